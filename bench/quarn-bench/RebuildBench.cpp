#include "RebuildBench.h"

#include "ContainerFactory.h"
#include "CpuTime.h"
#include "Fail.h"
#include "FrameClient.h"
#include "Requests.h"

#include "Daemon/model/QRNMetadata.h"
#include "common/shared/RequestValues.h"

#include <fmt/format.h>
#include <plist/plist.h>

#include <dirent.h>
#include <fcntl.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <string>
#include <vector>

namespace quarn::loadbench {

namespace {

using Clock = std::chrono::steady_clock;
// Per-user data classes nothing else in the run touches.
constexpr std::uint64_t kRebuildClass = 4;
constexpr std::uint64_t kMemoryClass = 6;
constexpr std::uint64_t kEmptyClass = 10;
constexpr std::uint64_t kNotFound = 21;

double median(std::vector<double> values) {
    std::sort(values.begin(), values.end());
    return values[values.size() / 2];
}

} // namespace

RebuildBench::RebuildBench(const BenchOptions& options, DaemonRunner& daemon)
    : options_(options), daemon_(daemon) {}

RebuildBench::Timing RebuildBench::firstLookup(std::uint64_t containerClass,
                                               const std::string& identifier,
                                               std::uint64_t expectedError) const {
    FrameClient client(daemon_.socket());
    const ServerProcess* process = daemon_.process();
    const double cpuBefore = process ? process->cpuSeconds() : 0;
    const auto start = Clock::now();
    const Value reply = client.roundTrip(containerRequest(identifier, containerClass, false));
    Timing timing;
    timing.seconds = std::chrono::duration<double>(Clock::now() - start).count();
    timing.cpu = process ? process->cpuSeconds() - cpuBefore : 0;
    if (test::replyError(reply) != expectedError) {
        fail("lookup of {} in class {}: {}", identifier, containerClass, reply.description());
    }
    return timing;
}

RebuildBench::Timing RebuildBench::readAndParseAll(const std::filesystem::path& classDirectory,
                                                   int expected) {
    const double cpuBefore = threadCpuSeconds();
    const auto start = Clock::now();
    DIR* directory = ::opendir(classDirectory.c_str());
    if (directory == nullptr) {
        fail("cannot list {}", classDirectory.string());
    }
    const std::string suffix = "/" + std::string(QRNMetadata::kFileName);
    std::vector<char> buffer(64 * 1024);
    int parsed = 0;
    while (const dirent* entry = ::readdir(directory)) {
        if (entry->d_name[0] == '.') {
            continue;
        }
        const std::string file = entry->d_name + suffix;
        int fd = ::openat(::dirfd(directory), file.c_str(), O_RDONLY | O_CLOEXEC);
        ssize_t n = fd < 0 ? -1 : ::read(fd, buffer.data(), buffer.size());
        if (fd >= 0) {
            ::close(fd);
        }
        plist_t node = nullptr;
        if (n > 0) {
            plist_from_bin(buffer.data(), static_cast<std::uint32_t>(n), &node);
        }
        parsed += node != nullptr && plist_get_node_type(node) == PLIST_DICT;
        plist_free(node);
    }
    ::closedir(directory);
    if (parsed != expected) {
        fail("parsed {} metadata files in {}, expected {}", parsed, classDirectory.string(),
             expected);
    }
    return {std::chrono::duration<double>(Clock::now() - start).count(),
            threadCpuSeconds() - cpuBefore};
}

void RebuildBench::runRebuild(ResultTable& table) {
    const int count = options_.rebuildContainers;
    const std::string prefix = "com.orvex.bench.rebuild";
    ContainerFactory factory;
    factory.make(kRebuildClass, prefix, count);
    const auto directory = factory.classDirectory(kRebuildClass);
    readAndParseAll(directory, count); // both sides then find the files cached
    std::vector<double> daemonTimes, floorTimes, daemonCpu, floorCpu;
    for (int round = 0; round < std::max(1, options_.rounds); ++round) {
        daemon_.start();
        const Timing daemon = firstLookup(kRebuildClass, prefix + "0", kReplySuccess);
        const Timing bare = readAndParseAll(directory, count);
        daemonTimes.push_back(daemon.seconds);
        daemonCpu.push_back(daemon.cpu);
        floorTimes.push_back(bare.seconds);
        floorCpu.push_back(bare.cpu);
    }
    table.add({fmt::format("cache rebuild, {} containers", count), "ms", median(daemonTimes) * 1e3,
               median(floorTimes) * 1e3, ResultTable::Goal::RatioAtMost, 1.5});
    if (daemon_.process()) {
        table.add(
            {"server CPU, cache rebuild", "ms", median(daemonCpu) * 1e3, median(floorCpu) * 1e3});
    }
}

void RebuildBench::runMemory(ResultTable& table) {
    const int count = options_.memoryContainers;
    const std::string prefix = "com.orvex.bench.memory";
    ContainerFactory().make(kMemoryClass, prefix, count);
    daemon_.start();
    firstLookup(kEmptyClass, prefix + "0", kNotFound);
    const long empty = daemon_.residentKiB();
    const double seconds = firstLookup(kMemoryClass, prefix + "0", kReplySuccess).seconds;
    const long full = daemon_.residentKiB();
    table.add({fmt::format("cache rebuild, {} containers", count), "ms", seconds * 1e3});
    table.add({"memory per cached container", "B",
               static_cast<double>(full - empty) * 1024.0 / count, std::nullopt,
               ResultTable::Goal::ValueAtMost, 1024});
}

} // namespace quarn::loadbench
