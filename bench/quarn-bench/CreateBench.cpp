#include "CreateBench.h"

#include "ContainerFactory.h"
#include "CpuTime.h"
#include "Fail.h"
#include "FrameClient.h"
#include "Requests.h"

#include "Daemon/model/QRNMetadata.h"
#include "Daemon/support/ProtectionClassAttribute.h"
#include "Daemon/support/UUID.h"
#include "common/shared/RequestValues.h"

#include <fmt/format.h>

#include <fcntl.h>
#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <cstring>

namespace quarn::loadbench {

namespace {

using Clock = std::chrono::steady_clock;
constexpr std::uint64_t kAppDataClass = 2;
constexpr uid_t kMobileUID = 501;
// The subdirectories of an app data container, in creation order.
constexpr const char* kSubdirectories[] = {"Documents",           "Library",    "Library/Caches",
                                           "Library/Preferences", "SystemData", "tmp"};

std::string identifierAt(int i) {
    return fmt::format("com.orvex.bench.create{:06}", i);
}

std::uint64_t nanosecondsSince(Clock::time_point start) {
    return static_cast<std::uint64_t>(
        std::chrono::duration_cast<std::chrono::nanoseconds>(Clock::now() - start).count());
}

// What the daemon adds to every item it makes: the container user as
// owner and the data protection class attribute.
void applyOwnerAndClass(const std::filesystem::path& path) {
    int fd = ::open(path.c_str(), O_RDONLY | O_NOFOLLOW | O_CLOEXEC);
    const char value = '0';
    if (fd < 0 || ::fsetxattr(fd, ProtectionClassAttribute::attributeName(), &value, 1, 0) != 0 ||
        ::fchown(fd, kMobileUID, kMobileUID) != 0 || ::close(fd) != 0) {
        fail("owner and class of {}: {}", path.string(), std::strerror(errno));
    }
}

} // namespace

CreateBench::CreateBench(const BenchOptions& options, DaemonRunner& daemon, LoadRoot& root)
    : options_(options), daemon_(daemon), staging_(root.path() / "floor" / "staging"),
      live_(root.path() / "floor" / "live") {
    std::filesystem::create_directories(staging_);
    std::filesystem::create_directories(live_);
    const auto url = live_ / UUID::random().string();
    metadata_ = ContainerFactory().metadataBytes(kAppDataClass, identifierAt(0), url);
}

void CreateBench::createWithDaemon(int count, LatencySamples& samples, Totals& totals) {
    FrameClient client(daemon_.socket());
    const ServerProcess* process = daemon_.process();
    const double cpuBefore = process ? process->cpuSeconds() : 0;
    const auto begin = Clock::now();
    for (int i = 0; i < count; ++i) {
        const auto start = Clock::now();
        const Value reply =
            client.roundTrip(containerRequest(identifierAt(made_++), kAppDataClass, true));
        samples.add(nanosecondsSince(start));
        const Value* existed = reply.get("ReplyExisted");
        if (test::replyError(reply) != kReplySuccess || !existed || existed->asBool() != false) {
            fail("create failed: {}", reply.description());
        }
    }
    totals.seconds += std::chrono::duration<double>(Clock::now() - begin).count();
    totals.cpu += process ? process->cpuSeconds() - cpuBefore : 0;
}

void CreateBench::createOneBare(const std::filesystem::path& name, bool ownerAndClass) const {
    const auto staged = staging_ / name;
    const auto metadataFile = staged / QRNMetadata::kFileName;
    if (::mkdir(staged.c_str(), 0755) != 0) {
        fail("mkdir {}: {}", staged.string(), std::strerror(errno));
    }
    int fd = ::open(metadataFile.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0644);
    if (fd < 0 ||
        ::write(fd, metadata_.data(), metadata_.size()) != static_cast<ssize_t>(metadata_.size()) ||
        ::close(fd) != 0) {
        fail("writing {}: {}", metadataFile.string(), std::strerror(errno));
    }
    if (ownerAndClass) {
        applyOwnerAndClass(staged);
        applyOwnerAndClass(metadataFile);
    }
    for (const char* subdirectory : kSubdirectories) {
        const auto path = staged / subdirectory;
        if (::mkdir(path.c_str(), 0755) != 0) {
            fail("mkdir {}: {}", path.string(), std::strerror(errno));
        }
        if (ownerAndClass) {
            applyOwnerAndClass(path);
        }
    }
    const auto target = live_ / name;
    if (::rename(staged.c_str(), target.c_str()) != 0) {
        fail("rename {}: {}", staged.string(), std::strerror(errno));
    }
}

void CreateBench::createBare(int count, bool ownerAndClass, LatencySamples& samples,
                             Totals& totals) {
    const double cpuBefore = threadCpuSeconds();
    const auto begin = Clock::now();
    for (int i = 0; i < count; ++i) {
        const auto start = Clock::now();
        createOneBare(UUID::random().string(), ownerAndClass);
        samples.add(nanosecondsSince(start));
    }
    totals.seconds += std::chrono::duration<double>(Clock::now() - begin).count();
    totals.cpu += threadCpuSeconds() - cpuBefore;
}

void CreateBench::run(ResultTable& table) {
    const int rounds = std::max(1, options_.rounds);
    const int perRound = std::max(1, options_.creates / rounds);
    LatencySamples daemonSamples, bareSamples, fullSamples;
    Totals daemon, bare, full;
    for (int round = 0; round < rounds; ++round) {
        createWithDaemon(perRound, daemonSamples, daemon);
        createBare(perRound, false, bareSamples, bare);
        createBare(perRound, true, fullSamples, full);
    }
    const double total = perRound * rounds;
    table.add({"create, per container (p50)", "us", daemonSamples.percentileMicroseconds(50),
               bareSamples.percentileMicroseconds(50), ResultTable::Goal::RatioAtMost, 1.3});
    table.add({"create p50, floor with owner+class", "us", daemonSamples.percentileMicroseconds(50),
               fullSamples.percentileMicroseconds(50)});
    table.add({"create, per container (p99)", "us", daemonSamples.percentileMicroseconds(99),
               bareSamples.percentileMicroseconds(99)});
    table.add(
        {"create throughput, 1 client", "cont/s", total / daemon.seconds, total / bare.seconds});
    if (daemon_.process()) {
        table.add(
            {"server CPU per create", "us", daemon.cpu * 1e6 / total, bare.cpu * 1e6 / total});
    }
}

} // namespace quarn::loadbench
