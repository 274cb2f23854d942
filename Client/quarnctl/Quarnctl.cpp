#include "Client/quarnctl/Quarnctl.h"

#include "Client/QRNClientReplies.h"
#include "Client/quarnctl/ContainerClassName.h"
#include "Client/quarnctl/JsonConvention.h"

#include <cmath>
#include <iostream>
#include <iterator>

namespace quarn::ctl {

Quarnctl::Quarnctl(std::ostream& out, std::ostream& err)
    : out_(out), err_(err), app_("Talks to quarnd, the container manager.", "quarnctl") {
    app_.require_subcommand(1);
    // Global options may follow the subcommand too.
    app_.fallthrough();
    auto* root = app_.add_option("--root", root_, "Root prefix quarnd runs on (default /)");
    auto* socket =
        app_.add_option("--socket", socket_, "Socket path, instead of the one in --root");
    root->excludes(socket);
    app_.add_flag("--json", json_, "Print the reply dictionary as JSON");
    app_.add_option("--timeout", timeoutSeconds_, "Seconds to wait for quarnd (default 60)")
        ->check(CLI::PositiveNumber);
    addCreateAndLookupCommands();
    addListAndDeleteCommands();
    addMetadataAndUsageCommands();
    addInfoCommands();
    addGroupCommands();
    addPathCommands();
    addRawCommand();
}

int Quarnctl::run(int argc, const char* const* argv) {
    try {
        app_.parse(argc, argv);
    } catch (const CLI::ParseError& e) {
        return app_.exit(e, out_, err_) == 0 ? kSuccess : kUsage;
    }
    return action_ ? action_() : kUsage;
}

std::optional<std::string> Quarnctl::ContainerArgs::optionalIdentifier() const {
    if (identifierOption && identifierOption->count() > 0) {
        return identifier;
    }
    return std::nullopt;
}

QRNContainerRef Quarnctl::ContainerArgs::ref() const {
    QRNContainerRef ref;
    ref.identifier = optionalIdentifier();
    ref.containerClass = ContainerClassName::parse(containerClass).value_or(0);
    if (!uuid.empty()) {
        ref.uuid = UUID::parse(uuid);
    }
    return ref;
}

CLI::Option* Quarnctl::addIdentifier(CLI::App* command, std::string& into,
                                     const std::string& what) {
    return command->add_option("identifier", into, what);
}

Quarnctl::ContainerArgs& Quarnctl::containerArgs(CLI::App* command, bool withUUID,
                                                 bool withTransient) {
    auto& args = containerArgs_.emplace_back();
    static const CLI::Validator kClass(
        [](std::string& text) {
            return ContainerClassName::parse(text)
                       ? std::string()
                       : "unknown container class \"" + text +
                             "\"; use 1..13 or one of: " + ContainerClassName::allNames();
        },
        "CLASS");
    command->add_option("-c,--class", args.containerClass, "Container class: number or name")
        ->required()
        ->check(kClass);
    if (withUUID) {
        static const CLI::Validator kUUID(
            [](std::string& text) {
                return UUID::parse(text) ? std::string() : "not a UUID: \"" + text + "\"";
            },
            "UUID");
        command->add_option("--uuid", args.uuid, "The container's UUID")->check(kUUID);
    }
    if (withTransient) {
        command->add_flag("--transient", args.transient, "A transient container");
    }
    return args;
}

int Quarnctl::exchange(const Value& request, const TextPrinter& print) {
    QRNClient::Options options;
    options.timeout = std::chrono::milliseconds(std::llround(timeoutSeconds_ * 1000));
    auto path =
        socket_.empty() ? QRNClient::socketPathForRoot(root_) : std::filesystem::path(socket_);
    auto client = QRNClient::connect(path, options);
    if (!client) {
        err_ << "quarnctl: " << client.error().message << '\n';
        return kUnreachable;
    }
    auto reply = client->send(request);
    if (!reply) {
        err_ << "quarnctl: " << reply.error().message << '\n';
        return kUnreachable;
    }
    ClientResult<void> result;
    if (json_) {
        out_ << JsonConvention::print(*reply) << '\n';
        result = QRNClientReplies::status(*reply);
    } else {
        ReplyPrinter printer(out_);
        result = print(*reply, printer);
    }
    return result ? kSuccess : reportFailure(result.error());
}

int Quarnctl::reportFailure(const ClientError& error) {
    err_ << error.description() << '\n';
    return error.kind == ClientError::Kind::Transport ? kUnreachable : kFailed;
}

void Quarnctl::addRawCommand() {
    auto* command = app_.add_subcommand(
        "raw", "Send a request dictionary written as JSON; print the reply as JSON");
    auto& text = strings_.emplace_back();
    command->add_option("request", text, "The request as JSON; read from stdin when absent or -");
    command->callback([this, &text] {
        action_ = [this, &text]() -> int {
            if (text.empty() || text == "-") {
                text.assign(std::istreambuf_iterator<char>(std::cin), {});
            }
            auto request = JsonConvention::parse(text);
            if (!request || !request->isDictionary()) {
                err_ << "quarnctl: "
                     << (request ? "a request is a JSON object" : request.error().message) << '\n';
                return kUsage;
            }
            json_ = true;
            return exchange(*request, {});
        };
    });
}

} // namespace quarn::ctl
