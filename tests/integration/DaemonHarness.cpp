#include "DaemonHarness.h"

#include "Daemon/platform/Paths.h"
#include "common/shared/FrameSocket.h"
#include "common/shared/HexCbor.h"

#include <gtest/gtest.h>

#include <signal.h>

#include <fstream>
#include <iostream>
#include <iterator>
#include <thread>

namespace quarn::test {

using Clock = std::chrono::steady_clock;

bool waitUntil(const std::function<bool()>& condition, std::chrono::milliseconds limit) {
    const Clock::time_point deadline = Clock::now() + limit;
    while (!condition()) {
        if (Clock::now() >= deadline) {
            return condition();
        }
        std::this_thread::sleep_for(std::chrono::milliseconds(10));
    }
    return true;
}

DaemonHarness::DaemonHarness() {
    stderrFile_ = root() / "quarnd.stderr";
    root_.writeFile("/etc/os-release", "ID=quarnos\n"
                                       "VERSION_ID=1.0\n"
                                       "BUILD_ID=1A100\n"
                                       "VARIANT_ID=internal\n");
    clients_.emplace(QUARN_TEST_CLIENT_PATH, root() / "clients",
                     Paths(root()).configDirectory() / "codesign.d");
}

std::filesystem::path DaemonHarness::operator/(std::string_view absolute) const {
    return root_ / absolute;
}

std::filesystem::path DaemonHarness::runDirectory() const {
    return Paths(root()).runDirectory();
}

std::filesystem::path DaemonHarness::socketPath() const {
    return QRNClient::socketPathForRoot(root());
}

bool DaemonHarness::spawn(std::vector<std::string> environment) {
    runLogStart_ =
        std::filesystem::exists(stderrFile_) ? std::filesystem::file_size(stderrFile_) : 0;
    ChildProcess::Launch launch;
    launch.program = QUARN_DAEMON_PATH;
    launch.arguments = {"--root", root().string(), "--foreground", "--log-level", "debug"};
    launch.environment = std::move(environment);
    launch.stderrFile = stderrFile_;
    auto spawned = ChildProcess::spawn(launch);
    daemon_.reset();
    if (!spawned) {
        ADD_FAILURE() << spawned.error().description();
        return false;
    }
    daemon_.emplace(std::move(*spawned));
    return true;
}

bool DaemonHarness::waitUntilAccepting() {
    const Clock::time_point deadline = Clock::now() + kWaitLimit;
    while (daemon_ && Clock::now() < deadline) {
        // Without the client library's error logging: a socket that is not
        // there yet is the normal case while polling.
        if (FrameSocket::accepts(socketPath())) {
            return true;
        }
        // Doubles as the pause between attempts, and ends early on a crash.
        if (daemon_->waitFor(std::chrono::milliseconds(10))) {
            return false;
        }
    }
    return false;
}

bool DaemonHarness::isRunning() const {
    return daemon_ && daemon_->isRunning();
}

std::optional<ChildProcess::Exit> DaemonHarness::stop() {
    if (!daemon_) {
        return std::nullopt;
    }
    daemon_->signal(SIGTERM);
    return daemon_->waitFor(kWaitLimit);
}

std::string DaemonHarness::log(std::size_t from) const {
    std::ifstream in(stderrFile_, std::ios::binary);
    in.seekg(static_cast<std::streamoff>(runLogStart_ + from));
    return std::string((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
}

std::size_t DaemonHarness::logSize() const {
    std::error_code ec;
    const std::uintmax_t size = std::filesystem::file_size(stderrFile_, ec);
    return ec || size < runLogStart_ ? 0 : static_cast<std::size_t>(size - runLogStart_);
}

std::size_t DaemonHarness::waitForLog(std::string_view text, std::size_t from) const {
    std::size_t at = std::string::npos;
    waitUntil([&] {
        const std::string tail = log(from);
        const std::size_t found = tail.find(text);
        if (found != std::string::npos) {
            at = from + found;
        }
        return at != std::string::npos || !isRunning();
    });
    return at;
}

DaemonHarness::ClientRun DaemonHarness::runClient(std::string_view program,
                                                  const std::vector<Value>& requests) const {
    ChildProcess::Launch launch;
    launch.program = clients_->pathOf(program);
    launch.arguments = {"--socket", socketPath().string()};
    for (const Value& request : requests) {
        launch.arguments.push_back(HexCbor::encode(request));
    }
    launch.stdoutFile = root() / "clients" / ("run-" + std::to_string(++clientRuns_) + ".out");
    ClientRun run;
    auto child = ChildProcess::spawn(launch);
    if (!child) {
        run.failure = child.error().description();
        return run;
    }
    run.exit = child->waitFor(kWaitLimit);
    std::ifstream out(launch.stdoutFile);
    for (std::string line; std::getline(out, line);) {
        if (line.starts_with('!')) {
            run.failure = line.substr(1);
            break;
        }
        auto reply = HexCbor::decode(line);
        if (!reply) {
            run.failure = "unreadable reply line: " + reply.error().message;
            break;
        }
        run.replies.push_back(std::move(*reply));
    }
    return run;
}

Result<QRNClient> DaemonHarness::connect() const {
    QRNClient::Options options;
    options.timeout = kWaitLimit;
    return QRNClient::connect(socketPath(), options);
}

Value DaemonHarness::request(const Value& request) const {
    auto client = connect();
    auto reply = client ? client->send(request) : Result<Value>(QRN_UNEXPECTED(client.error()));
    EXPECT_TRUE(reply) << "no reply to " << request.description() << ": "
                       << reply.error().description();
    return reply ? *reply : Value();
}

// Enough to see what led to a failure without flooding the output.
constexpr std::size_t kLogTailBytes = 32 * 1024;

std::unique_ptr<DaemonHarness> SharedDaemonTest::harness_;

void dumpLog(const DaemonHarness& harness, std::size_t from) {
    std::string text = harness.log(from);
    if (text.size() > kLogTailBytes) {
        text = "...\n" + text.substr(text.size() - kLogTailBytes);
    }
    std::cerr << "---- quarnd stderr (" << harness.root().string() << ") ----\n"
              << text << "---- end of quarnd stderr ----\n";
}

void expectCleanStop(DaemonHarness& harness) {
    const std::optional<ChildProcess::Exit> exit = harness.stop();
    if (!exit || !exit->exitedWith(0)) {
        ADD_FAILURE() << "quarnd did not stop cleanly on SIGTERM: "
                      << (exit ? exit->description() : "still running");
        dumpLog(harness, 0);
    }
}

void SharedDaemonTest::SetUpTestSuite() {
    harness_ = std::make_unique<DaemonHarness>();
    if (!harness_->start()) {
        ADD_FAILURE() << "quarnd did not start accepting connections";
        dumpLog(*harness_, 0);
    }
}

void SharedDaemonTest::TearDownTestSuite() {
    if (harness_) {
        expectCleanStop(*harness_);
        harness_.reset();
    }
}

void SharedDaemonTest::SetUp() {
    ASSERT_TRUE(harness_ && harness_->isRunning()) << "quarnd is not running";
    logStart_ = harness_->logSize();
}

void SharedDaemonTest::TearDown() {
    if (!harness_) {
        return;
    }
    EXPECT_TRUE(harness_->isRunning()) << "quarnd ended during the test";
    if (HasFailure()) {
        dumpLog(*harness_, logStart_);
    }
}

} // namespace quarn::test
