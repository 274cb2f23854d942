#pragma once
// A child process of a test or a benchmark: the daemon, a test client, an
// echo server. Spawned with its stdin on /dev/null and its stdout and
// stderr appended to files. Waits are bounded: a child that hangs fails
// the test instead of hanging it.

#include "Daemon/support/Descriptor.h"
#include "Daemon/support/QRNError.h"

#include <sys/types.h>

#include <chrono>
#include <filesystem>
#include <memory>
#include <optional>
#include <string>
#include <vector>

namespace quarn::test {

class ChildProcess {
public:
    struct Launch {
        std::filesystem::path program;
        std::vector<std::string> arguments; // after argv[0]
        // Added to the test's environment, which loses the systemd
        // hand-over variables (LISTEN_*, NOTIFY_SOCKET) first.
        std::vector<std::string> environment;
        std::filesystem::path stdoutFile; // empty: /dev/null
        std::filesystem::path stderrFile; // empty: the parent's own stderr
    };

    // How a child ended, as waitpid reported it.
    struct Exit {
        int status = 0;
        bool exitedWith(int code) const;
        std::string description() const;
    };

    static Result<ChildProcess> spawn(const Launch& launch);

    ChildProcess(ChildProcess&& other) noexcept;
    ChildProcess& operator=(ChildProcess&&) = delete;
    // Kills and reaps a child still running.
    ~ChildProcess();

    pid_t pid() const { return pid_; }
    bool isRunning() const;
    // Waits up to `limit` for the child to end; none when it is still running.
    std::optional<Exit> waitFor(std::chrono::milliseconds limit);
    void signal(int signo) const;

private:
    ChildProcess(pid_t pid, std::unique_ptr<Descriptor> pidfd)
        : pid_(pid), pidfd_(std::move(pidfd)) {}

    pid_t pid_ = -1;
    std::unique_ptr<Descriptor> pidfd_;
    std::optional<Exit> exit_;
};

} // namespace quarn::test
