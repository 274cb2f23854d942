#pragma once
// The daemon under test on the tool's root: started, waited for until it
// serves and its boot cleanup has finished (so nothing of start-up runs
// beside a measurement), restarted, stopped. Or, with `--socket`, a daemon
// someone else runs, which can be neither restarted nor weighed.

#include "BenchOptions.h"
#include "LoadRoot.h"
#include "ServerProcess.h"

#include <filesystem>
#include <memory>

namespace quarn::loadbench {

class DaemonRunner {
public:
    DaemonRunner(const BenchOptions& options, LoadRoot& root);
    ~DaemonRunner();

    // Whether this tool starts the daemon (false with `--socket`).
    bool ownsDaemon() const { return options_.socket.empty(); }
    const std::filesystem::path& socket() const { return socket_; }

    // Starts it (stopping a running one first) and waits until it serves.
    void start();
    // Stops it; complains when it does not exit cleanly.
    void stop();
    long residentKiB() const;
    // The daemon process, when this tool started it.
    const ServerProcess* process() const { return process_.get(); }

private:
    void waitUntilServing();

    const BenchOptions& options_;
    LoadRoot& root_;
    std::filesystem::path socket_;
    std::unique_ptr<ServerProcess> process_;
    int starts_ = 0;
};

} // namespace quarn::loadbench
