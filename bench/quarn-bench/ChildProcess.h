#pragma once
// A process the tool starts (the daemon, the echo server), its output sent
// to a file, its resident memory read from /proc, ended with SIGTERM. When
// the tool stops early (exit() skips the destructors) the processes still
// running are ended too.

#include <sys/types.h>

#include <chrono>
#include <filesystem>
#include <string>
#include <vector>

namespace quarn::loadbench {

class ChildProcess {
public:
    // Starts `program` with `arguments`; stdout and stderr go to `output`.
    ChildProcess(const std::filesystem::path& program, const std::vector<std::string>& arguments,
                 const std::filesystem::path& output);
    ~ChildProcess(); // stop() if still running
    ChildProcess(const ChildProcess&) = delete;
    ChildProcess& operator=(const ChildProcess&) = delete;

    pid_t pid() const { return pid_; }
    bool running();
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
    pid_t pid_ = -1;
    int status_ = 0;
    bool reaped_ = false;
};

} // namespace quarn::loadbench
