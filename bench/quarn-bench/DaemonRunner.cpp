#include "DaemonRunner.h"

#include "Fail.h"
#include "FrameClient.h"
#include "common/shared/RequestValues.h"

#include <cstdio>
#include <thread>

namespace quarn::loadbench {

namespace {

constexpr const char* kCleanupComplete = "com.orvex.quarnd.cleanup-complete";
constexpr std::uint64_t kInvalidCommand = 49;

} // namespace

DaemonRunner::DaemonRunner(const BenchOptions& options, LoadRoot& root)
    : options_(options), root_(root),
      socket_(options.socket.empty() ? root.socketPath() : options.socket) {}

DaemonRunner::~DaemonRunner() {
    if (process_) {
        stop();
    }
}

void DaemonRunner::start() {
    if (!ownsDaemon()) {
        waitUntilServing();
        return;
    }
    if (process_) {
        stop();
    }
    const std::size_t cleanups = root_.notificationCount(kCleanupComplete);
    process_ = std::make_unique<ServerProcess>(
        options_.daemon, std::vector<std::string>{"--root", root_.path().string()},
        root_.path() / "quarnd.out");
    ++starts_;
    if (!process_->waitForSocket(socket_, std::chrono::seconds(60))) {
        fail("quarnd did not start serving; see {}", (root_.path() / "quarnd.out").string());
    }
    waitUntilServing();
    const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(120);
    while (root_.notificationCount(kCleanupComplete) <= cleanups) {
        if (std::chrono::steady_clock::now() > deadline) {
            std::fprintf(stderr, "quarn-bench: no cleanup-complete notification; going on\n");
            break;
        }
        std::this_thread::sleep_for(std::chrono::milliseconds(10));
    }
}

// Requests are answered only once initialisation has finished; an invalid
// command is answered without touching any container.
void DaemonRunner::waitUntilServing() {
    FrameClient client(socket_);
    const Value reply = client.roundTrip(Value(Value::Dictionary{{"Command", Value(33u)}}));
    if (test::replyError(reply) != kInvalidCommand) {
        fail("unexpected answer to an invalid command: {}", reply.description());
    }
}

void DaemonRunner::stop() {
    if (!process_) {
        return;
    }
    const int status = process_->stop();
    process_.reset();
    if (status != 0) {
        std::fprintf(stderr, "quarn-bench: quarnd exited with status %d; see %s\n", status,
                     (root_.path() / "quarnd.out").c_str());
    }
}

long DaemonRunner::residentKiB() const {
    if (!process_) {
        fail("the daemon's memory can only be read when this tool started it");
    }
    return process_->residentKiB();
}

} // namespace quarn::loadbench
