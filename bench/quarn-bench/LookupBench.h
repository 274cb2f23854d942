#pragma once
// Lookup of an existing container (command 0, creation off) with 1 and with
// N clients, each on its own connection, against the echo floor on the same
// kind of socket with the same request and a reply of the same size. Daemon
// and floor runs alternate, and each figure is the median over the rounds,
// so a machine busy with other work disturbs both sides alike.

#include "BenchOptions.h"
#include "DaemonRunner.h"
#include "LatencySamples.h"
#include "LoadRoot.h"
#include "ResultTable.h"
#include "ServerProcess.h"

#include "Daemon/support/Value.h"

#include <filesystem>
#include <string>
#include <vector>

namespace quarn::loadbench {

class LookupBench {
public:
    LookupBench(const BenchOptions& options, DaemonRunner& daemon, LoadRoot& root);
    void run(ResultTable& table);

private:
    struct Run {
        LatencySamples samples;
        double throughput = 0; // requests per second
        double cpu = 0;        // the server's CPU time per request, microseconds
    };
    struct Figures {
        std::vector<double> p50, p99, throughput, cpu;
        void add(const Run& run);
    };

    // One container per client; answers the reply a lookup gets.
    Value prepare();
    // `server`, when known, is weighed for its CPU time.
    Run measure(const std::filesystem::path& socket, const ServerProcess* server, int clients,
                double seconds) const;
    static void clientLoop(const std::filesystem::path& socket, const Value& request,
                           const std::atomic<bool>& go, std::atomic<int>& ready,
                           std::chrono::steady_clock::time_point& deadline, LatencySamples& out);

    const BenchOptions& options_;
    DaemonRunner& daemon_;
    LoadRoot& root_;
    std::vector<Value> requests_; // one per client
};

} // namespace quarn::loadbench
