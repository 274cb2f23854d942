#pragma once
// A server the tool starts (the daemon, the echo server), its output sent
// to a file, its resident memory and CPU time read from /proc, ended with
// SIGTERM. When the tool stops early (exit() skips the destructors) the
// servers still running are ended too.

#include "common/shared/ChildProcess.h"

#include <sys/types.h>

#include <chrono>
#include <filesystem>
#include <optional>
#include <string>
#include <vector>

namespace quarn::loadbench {

class ServerProcess {
public:
    // Starts `program` with `arguments`; stdout and stderr go to `output`.
    ServerProcess(const std::filesystem::path& program, const std::vector<std::string>& arguments,
                  const std::filesystem::path& output);
    ~ServerProcess(); // stop() if still running
    ServerProcess(const ServerProcess&) = delete;
    ServerProcess& operator=(const ServerProcess&) = delete;

    pid_t pid() const { return process_->pid(); }
    // Polls until `socket` accepts; false when the process ends or the
    // time runs out first.
    bool waitForSocket(const std::filesystem::path& socket, std::chrono::seconds timeout);
    // VmRSS in KiB.
    long residentKiB() const;
    // User and system time of all its threads so far, in seconds.
    double cpuSeconds() const;
    // SIGTERM, then SIGKILL when it has not ended in `grace`. The exit code,
    // or 128 + the signal that ended it.
    int stop(std::chrono::seconds grace = std::chrono::seconds(20));

private:
    std::optional<test::ChildProcess> process_;
};

} // namespace quarn::loadbench
