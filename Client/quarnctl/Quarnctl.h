#pragma once
// The quarnctl command line: global options, one subcommand per request,
// text or JSON output, and exit codes a script can act on.

#include "Client/ClientError.h"
#include "Client/QRNClient.h"
#include "Client/QRNClientRequests.h"
#include "Client/quarnctl/ReplyPrinter.h"

#include <CLI/CLI.hpp>

#include <functional>
#include <list>
#include <optional>
#include <ostream>
#include <string>

namespace quarn::ctl {

class Quarnctl {
public:
    enum ExitCode : int {
        kSuccess = 0,
        kFailed = 1,      // the daemon answered with an error, or the reply was unusable
        kUsage = 2,       // bad arguments
        kUnreachable = 3, // no connection, or it broke before the reply
    };

    Quarnctl(std::ostream& out, std::ostream& err);
    int run(int argc, const char* const* argv);

private:
    // The arguments that name a container, one set per subcommand.
    struct ContainerArgs {
        std::string containerClass;
        std::string identifier;
        std::string uuid;
        bool transient = false;
        CLI::Option* identifierOption = nullptr;

        std::optional<std::string> optionalIdentifier() const;
        QRNContainerRef ref() const;
    };
    using TextPrinter = std::function<ClientResult<void>(const Value& reply, ReplyPrinter&)>;

    // Reads the reply with `parse` and, when that succeeds, shows the result.
    template <class Parse, class Show> static TextPrinter printing(Parse parse, Show show) {
        return [parse, show](const Value& reply, ReplyPrinter& printer) -> ClientResult<void> {
            auto result = parse(reply);
            if (!result) {
                return Unexpected(result.error());
            }
            show(printer, *result);
            return {};
        };
    }
    // Success shows nothing.
    static TextPrinter silent();

    void addCreateAndLookupCommands();
    void addListAndDeleteCommands();
    void addMetadataAndUsageCommands();
    void addInfoCommands();
    void addGroupCommands();
    void addPathCommands(); // system container, system group, personas
    void addRawCommand();
    ContainerArgs& containerArgs(CLI::App* command, bool withUUID, bool withTransient);
    CLI::Option* addIdentifier(CLI::App* command, std::string& into, const std::string& what);

    // Connects, sends, prints the reply and returns the exit code.
    int exchange(const Value& request, const TextPrinter& print);
    int reportFailure(const ClientError& error);

    std::ostream& out_;
    std::ostream& err_;
    CLI::App app_;
    std::string root_ = "/";
    std::string socket_;
    bool json_ = false;
    double timeoutSeconds_ = 60;
    std::list<ContainerArgs> containerArgs_; // stable addresses for the parser
    std::list<std::string> strings_;
    std::list<bool> flags_;
    std::function<int()> action_;
};

} // namespace quarn::ctl
