// quarn-bench: the request path and container creation of quarnd under
// load, each beside its floor, in one table. See the README, "Benchmarks".
//
//   quarn-bench [--daemon PATH] [--work DIR]    start quarnd on a temporary root
//   quarn-bench --socket PATH                   use a running daemon (lookup, create)

#include "BenchOptions.h"
#include "CreateBench.h"
#include "DaemonRunner.h"
#include "EchoServer.h"
#include "Fail.h"
#include "LoadRoot.h"
#include "LookupBench.h"
#include "RebuildBench.h"
#include "ResultTable.h"

#include "common/shared/HexCbor.h"

#include <CLI/CLI.hpp>

#include <signal.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdio>

using namespace quarn::loadbench;

namespace {

#ifdef QUARN_BENCH_QUARND
constexpr const char* kBuiltDaemon = QUARN_BENCH_QUARND;
#else
constexpr const char* kBuiltDaemon = "";
#endif

[[noreturn]] void runEchoServer(const std::string& socket, const std::string& replyHex) {
    auto reply = quarn::test::HexCbor::decode(replyHex);
    if (!reply) {
        fail("--echo-reply is not a CBOR message in hex");
    }
    EchoServer(socket, std::move(*reply)).run();
}

void checkSetup(BenchOptions& options) {
    if (!options.socket.empty()) {
        return;
    }
    if (::geteuid() != 0) {
        fail("quarnd runs as root: run this tool as root, or give --socket");
    }
    if (options.daemon.empty()) {
        options.daemon = kBuiltDaemon;
    }
    if (options.daemon.empty() || !std::filesystem::exists(options.daemon)) {
        fail("no quarnd binary: give --daemon PATH or --socket PATH");
    }
}

void runAll(BenchOptions& options) {
    LoadRoot root(options.work, options.keepRoot);
    DaemonRunner daemon(options, root);
    ResultTable table;
    std::printf("quarn-bench: root %s, %d rounds of %.1f s, %d clients\n", root.path().c_str(),
                options.rounds, options.seconds, options.clients);
    daemon.start();
    if (options.runs("lookup")) {
        LookupBench(options, daemon, root).run(table);
    }
    if (options.runs("create")) {
        CreateBench(options, daemon, root).run(table);
    }
    if (daemon.ownsDaemon()) {
        RebuildBench rebuild(options, daemon);
        if (options.runs("rebuild")) {
            rebuild.runRebuild(table);
        }
        if (options.runs("memory")) {
            rebuild.runMemory(table);
        }
        daemon.stop();
    } else {
        table.skip("cache rebuild", "needs a daemon this tool starts (no --socket)");
        table.skip("memory per cached container", "needs a daemon this tool starts");
    }
    std::printf("\n");
    table.print();
    std::printf("\n%s\n", table.allMet() ? "all goals met" : "some goals are NOT met");
}

} // namespace

int main(int argc, char** argv) {
    CLI::App app{"quarnd under load, beside the floor of the same work"};
    BenchOptions options;
    std::string echoSocket;
    std::string echoReply;
    app.add_option("--daemon", options.daemon, "quarnd binary to start (default: the one built)");
    app.add_option("--socket", options.socket, "use the daemon listening here instead");
    app.add_option("--work", options.work, "directory for the temporary root")
        ->capture_default_str();
    app.add_option("--seconds", options.seconds, "length of one timed lookup run")
        ->capture_default_str()
        ->check(CLI::PositiveNumber);
    app.add_option("--rounds", options.rounds, "daemon/floor alternations")
        ->capture_default_str()
        ->check(CLI::Range(1, 100));
    app.add_option("--clients", options.clients, "clients of the concurrent lookup run")
        ->capture_default_str()
        ->check(CLI::Range(1, 256));
    app.add_option("--creates", options.creates, "containers created")
        ->capture_default_str()
        ->check(CLI::Range(1, 100000));
    app.add_option("--rebuild-containers", options.rebuildContainers)
        ->capture_default_str()
        ->check(CLI::Range(1, 1000000));
    app.add_option("--memory-containers", options.memoryContainers)
        ->capture_default_str()
        ->check(CLI::Range(1, 1000000));
    app.add_option("--only", options.only, "run one measure")
        ->check(CLI::IsMember({"lookup", "create", "rebuild", "memory"}));
    app.add_flag("--keep-root", options.keepRoot, "keep the temporary root and the daemon's log");
    app.add_option("--echo-server", echoSocket, "internal: serve the echo floor on this socket");
    app.add_option("--echo-reply", echoReply, "internal: the echo server's reply, CBOR in hex");
    CLI11_PARSE(app, argc, argv);

    ::signal(SIGPIPE, SIG_IGN);
    if (!echoSocket.empty()) {
        runEchoServer(echoSocket, echoReply);
    }
    ::umask(022); // the registry entry must not be group- or world-writable
    checkSetup(options);
    runAll(options);
    return 0;
}
