#include "LookupBench.h"

#include "Fail.h"
#include "FrameClient.h"
#include "Requests.h"
#include "ServerProcess.h"

#include "common/shared/HexCbor.h"
#include "common/shared/RequestValues.h"

#include <fmt/format.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <thread>

namespace quarn::loadbench {

namespace {

using Clock = std::chrono::steady_clock;
constexpr std::uint64_t kAppDataClass = 2;

double median(std::vector<double> values) {
    std::sort(values.begin(), values.end());
    return values.empty() ? 0 : values[values.size() / 2];
}

} // namespace

void LookupBench::Figures::add(const Run& run) {
    p50.push_back(run.samples.percentileMicroseconds(50));
    p99.push_back(run.samples.percentileMicroseconds(99));
    throughput.push_back(run.throughput);
    cpu.push_back(run.cpu);
}

LookupBench::LookupBench(const BenchOptions& options, DaemonRunner& daemon, LoadRoot& root)
    : options_(options), daemon_(daemon), root_(root) {}

Value LookupBench::prepare() {
    FrameClient client(daemon_.socket());
    for (int i = 0; i < std::max(1, options_.clients); ++i) {
        const std::string identifier = fmt::format("com.orvex.bench.lookup{:03}", i);
        const Value created = client.roundTrip(containerRequest(identifier, kAppDataClass, true));
        if (test::replyError(created) != kReplySuccess) {
            fail("creating {} failed: {}", identifier, created.description());
        }
        requests_.push_back(containerRequest(identifier, kAppDataClass, false));
    }
    const Value reply = client.roundTrip(requests_.front());
    if (test::replyError(reply) != kReplySuccess) {
        fail("lookup failed: {}", reply.description());
    }
    return reply;
}

void LookupBench::clientLoop(const std::filesystem::path& socket, const Value& request,
                             const std::atomic<bool>& go, std::atomic<int>& ready,
                             Clock::time_point& deadline, LatencySamples& out) {
    FrameClient client(socket);
    ++ready;
    while (!go.load()) {
        std::this_thread::yield();
    }
    for (;;) {
        const auto start = Clock::now();
        const Value reply = client.roundTrip(request);
        const auto end = Clock::now();
        if (test::replyError(reply) != kReplySuccess) {
            fail("lookup failed under load: {}", reply.description());
        }
        out.add(static_cast<std::uint64_t>(
            std::chrono::duration_cast<std::chrono::nanoseconds>(end - start).count()));
        if (end >= deadline) {
            return;
        }
    }
}

LookupBench::Run LookupBench::measure(const std::filesystem::path& socket,
                                      const ServerProcess* server, int clients,
                                      double seconds) const {
    std::vector<LatencySamples> perClient(static_cast<std::size_t>(clients));
    std::vector<std::thread> threads;
    std::atomic<bool> go{false};
    std::atomic<int> ready{0};
    Clock::time_point deadline = Clock::time_point::max();
    for (int i = 0; i < clients; ++i) {
        threads.emplace_back(clientLoop, std::cref(socket),
                             std::cref(requests_[static_cast<std::size_t>(i) % requests_.size()]),
                             std::cref(go), std::ref(ready), std::ref(deadline),
                             std::ref(perClient[static_cast<std::size_t>(i)]));
    }
    while (ready.load() < clients) {
        std::this_thread::yield();
    }
    const double cpuBefore = server ? server->cpuSeconds() : 0;
    const auto start = Clock::now();
    deadline =
        start + std::chrono::duration_cast<Clock::duration>(std::chrono::duration<double>(seconds));
    go.store(true);
    for (auto& thread : threads) {
        thread.join();
    }
    const double elapsed = std::chrono::duration<double>(Clock::now() - start).count();
    Run run;
    for (const auto& samples : perClient) {
        run.samples.append(samples);
    }
    run.throughput = static_cast<double>(run.samples.count()) / elapsed;
    if (server) {
        run.cpu =
            (server->cpuSeconds() - cpuBefore) * 1e6 / static_cast<double>(run.samples.count());
    }
    return run;
}

void LookupBench::run(ResultTable& table) {
    const Value reply = prepare();
    const auto echoSocket = root_.path() / "echo.sock";
    ServerProcess echo(
        std::filesystem::read_symlink("/proc/self/exe"),
        {"--echo-server", echoSocket.string(), "--echo-reply", test::HexCbor::encode(reply)},
        root_.path() / "echo.out");
    if (!echo.waitForSocket(echoSocket, std::chrono::seconds(10))) {
        fail("the echo server did not start");
    }
    const int many = std::max(1, options_.clients);
    // Warm both sides up (first connections, caches, the daemon's pool).
    measure(daemon_.socket(), daemon_.process(), many, 0.2);
    measure(echoSocket, &echo, many, 0.2);
    Figures daemonOne, echoOne, daemonMany, echoMany;
    for (int round = 0; round < options_.rounds; ++round) {
        daemonOne.add(measure(daemon_.socket(), daemon_.process(), 1, options_.seconds));
        echoOne.add(measure(echoSocket, &echo, 1, options_.seconds));
        daemonMany.add(measure(daemon_.socket(), daemon_.process(), many, options_.seconds));
        echoMany.add(measure(echoSocket, &echo, many, options_.seconds));
    }
    using Goal = ResultTable::Goal;
    const std::string n = fmt::format("{} clients", many);
    table.add({"lookup p50, 1 client", "us", median(daemonOne.p50), median(echoOne.p50),
               Goal::RatioAtMost, 1.5});
    table.add({"lookup p99, 1 client", "us", median(daemonOne.p99), median(echoOne.p99)});
    table.add({"lookup throughput, 1 client", "req/s", median(daemonOne.throughput),
               median(echoOne.throughput)});
    table.add({"lookup p50, " + n, "us", median(daemonMany.p50), median(echoMany.p50)});
    table.add({"lookup p99, " + n, "us", median(daemonMany.p99), median(echoMany.p99)});
    table.add({"lookup throughput, " + n, "req/s", median(daemonMany.throughput),
               median(echoMany.throughput), Goal::RatioAtLeast, 0.6});
    if (daemon_.process()) {
        table.add(
            {"server CPU per lookup, " + n, "us", median(daemonMany.cpu), median(echoMany.cpu)});
    }
}

} // namespace quarn::loadbench
