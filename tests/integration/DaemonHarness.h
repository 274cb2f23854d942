#pragma once
// The real quarnd on a throw-away root: the root's accounts and OS release,
// a code-signing registry of client programs, the daemon process with its
// stderr in a file, and the ways a test talks to it (copies of the test
// client, or connections of the test binary itself).
//
// Every wait is bounded by kWaitLimit; none of them measures anything.

#include "Client/QRNClient.h"
#include "Daemon/platform/Paths.h"
#include "Daemon/support/PropertyList.h"
#include "Daemon/support/Value.h"
#include "common/shared/ChildProcess.h"
#include "common/shared/FrameSocket.h"
#include "common/shared/HexCbor.h"
#include "common/shared/RequestValues.h"
#include "common/shared/ScratchRoot.h"

#include <gtest/gtest.h>
#include <signal.h>
#include <sodium.h>
#include <unistd.h>

#include <chrono>
#include <filesystem>
#include <fstream>
#include <functional>
#include <iostream>
#include <iterator>
#include <optional>
#include <string>
#include <thread>
#include <vector>

namespace quarn::test {

// The client programs of the registry: hard links of quarn_test_client, one
// per set of entitlements (the kernel reports a process's executable by the
// path it was started from, so each link is a program of its own).
namespace program {
inline constexpr std::string_view kAllowed = "allowed";    // "allowed", with the right digest
inline constexpr std::string_view kNone = "none";          // no entitlements
inline constexpr std::string_view kLookup = "lookup";      // lookup of the allowed client's class 2
inline constexpr std::string_view kWipeBool = "wipe-bool"; // wipeContainer: true
inline constexpr std::string_view kWipeArray = "wipe-array"; // wipeContainer: [itself]
inline constexpr std::string_view kTestability = "testability";
inline constexpr std::string_view kBadDigest = "bad-digest"; // "allowed", wrong digest
inline std::string identifierOf(std::string_view name) {
    return "com.orvex.test." + std::string(name);
}
} // namespace program

constexpr std::chrono::seconds kWaitLimit{30};

// Polls `condition` until it holds or the limit has passed; answers its last value.
inline bool waitUntil(const std::function<bool()>& condition) {
    const auto deadline = std::chrono::steady_clock::now() + kWaitLimit;
    for (; !condition(); std::this_thread::sleep_for(std::chrono::milliseconds(10))) {
        if (std::chrono::steady_clock::now() >= deadline) {
            return condition();
        }
    }
    return true;
}

class DaemonHarness {
public:
    DaemonHarness() {
        root_.writeFile("/etc/os-release", "ID=quarnos\nVERSION_ID=1.0\nBUILD_ID=1A100\n"
                                           "VARIANT_ID=internal\n");
        writeRegistry(Paths(root()).configDirectory() / "codesign.d");
    }
    DaemonHarness(const DaemonHarness&) = delete;
    // A daemon still running must stop cleanly; a failed test shows the run's log.
    ~DaemonHarness() {
        expectCleanStop();
        if (::testing::Test::HasFailure()) {
            std::cerr << "---- quarnd stderr ----\n" << log() << "----\n";
        }
    }

    const std::filesystem::path& root() const { return root_.path(); }
    std::filesystem::path operator/(std::string_view absolute) const { return root_ / absolute; }
    std::filesystem::path socketPath() const { return QRNClient::socketPathForRoot(root()); }

    // Spawns quarnd on the root (with `environment` added) and waits until
    // its socket accepts; false when the daemon ended or the limit passed first.
    bool start(std::vector<std::string> environment = {}) {
        runLogStart_ = std::filesystem::exists(stderr_) ? std::filesystem::file_size(stderr_) : 0;
        daemon_.reset();
        auto spawned = ChildProcess::spawn(
            {.program = QUARN_DAEMON_PATH,
             .arguments = {"--root", root().string(), "--foreground", "--log-level", "debug"},
             .environment = std::move(environment),
             .stdoutFile = {},
             .stderrFile = stderr_});
        if (!spawned) {
            ADD_FAILURE() << spawned.error().description();
            return false;
        }
        daemon_.emplace(std::move(*spawned));
        // waitFor doubles as the pause between attempts, and ends early on a crash.
        return waitUntil([&] {
                   return FrameSocket::accepts(socketPath()) ||
                          daemon_->waitFor(std::chrono::milliseconds(10));
               }) &&
               daemon_->isRunning();
    }
    bool isRunning() const { return daemon_ && daemon_->isRunning(); }
    // The daemon's pid, -1 when none was started.
    pid_t pid() const { return daemon_ ? daemon_->pid() : -1; }
    // SIGTERM to a running daemon, which must then exit with status 0.
    void expectCleanStop() {
        if (!isRunning()) {
            return;
        }
        daemon_->signal(SIGTERM);
        const auto exit = daemon_->waitFor(kWaitLimit);
        EXPECT_TRUE(exit && exit->exitedWith(0))
            << "quarnd did not stop cleanly: " << (exit ? exit->description() : "running");
    }

    // The daemon's stderr of the current run (debug level), from byte `from` on.
    std::string log(std::size_t from = 0) const {
        std::ifstream in(stderr_, std::ios::binary);
        in.seekg(static_cast<std::streamoff>(runLogStart_ + from));
        return std::string(std::istreambuf_iterator<char>(in), {});
    }
    std::size_t logSize() const { return log().size(); }

    // Runs the client copy `program` with `requests` on one connection;
    // fails the calling test unless it answers each and exits with 0.
    std::vector<Value> replies(std::string_view program, const std::vector<Value>& requests) const {
        const std::filesystem::path out = clients() / ("run-" + std::to_string(++clientRuns_));
        std::vector<std::string> arguments{"--socket", socketPath().string()};
        for (const Value& request : requests) {
            arguments.push_back(HexCbor::encode(request));
        }
        auto child = ChildProcess::spawn({.program = clients() / program,
                                          .arguments = arguments,
                                          .environment = {},
                                          .stdoutFile = out,
                                          .stderrFile = {}});
        const auto exit = child ? child->waitFor(kWaitLimit) : std::nullopt;
        EXPECT_TRUE(exit && exit->exitedWith(0)) << program;
        std::vector<Value> replies;
        std::ifstream in(out);
        for (std::string line; std::getline(in, line);) {
            auto reply = HexCbor::decode(line);
            EXPECT_TRUE(reply) << program << ": " << line;
            replies.push_back(reply ? *reply : Value());
        }
        EXPECT_EQ(replies.size(), requests.size()) << program;
        replies.resize(requests.size());
        return replies;
    }
    // A connection of the test binary, which the registry grants "allowed".
    Result<QRNClient> connect() const {
        return QRNClient::connect(socketPath(), {.timeout = kWaitLimit});
    }
    // One request on a new connection; fails the calling test when no reply comes.
    Value request(const Value& request) const {
        auto client = connect();
        auto reply = client ? client->send(request) : Result<Value>(QRN_UNEXPECTED(client.error()));
        EXPECT_TRUE(reply) << request.description() << ": " << reply.error().description();
        return reply ? *reply : Value();
    }

private:
    std::filesystem::path clients() const { return root() / "clients"; }

    void writeRegistry(const std::filesystem::path& registry) const {
        [[maybe_unused]] static const int sodiumReady = sodium_init();
        std::filesystem::create_directories(clients());
        std::filesystem::create_directories(registry);
        const auto grant = [](std::string_view name, Value value) {
            return Value(Value::Dictionary{
                {"com.orvex.private.Quarn." + std::string(name), std::move(value)}});
        };
        std::ifstream in(QUARN_TEST_CLIENT_PATH, std::ios::binary);
        const std::string bytes(std::istreambuf_iterator<char>(in), {});
        unsigned char digest[crypto_hash_sha256_BYTES];
        crypto_hash_sha256(digest, reinterpret_cast<const unsigned char*>(bytes.data()),
                           bytes.size());
        char hex[2 * sizeof digest + 1];
        sodium_bin2hex(hex, sizeof hex, digest, sizeof digest);
        using namespace program;
        const Value lookup(Value::Dictionary{{"appData", Value::Array{identifierOf(kAllowed)}}});
        // Name, entitlements (none: no entry) and digest (empty: no entry);
        // the test binary itself too, so that the test's threads can talk to the daemon.
        const std::tuple<std::string_view, Value, std::string> programs[] = {
            {kAllowed, grant("allowed", true), hex},
            {kNone, Value(), ""},
            {kLookup, grant("lookup", lookup), ""},
            {kWipeBool, grant("wipeContainer", true), ""},
            {kWipeArray, grant("wipeContainer", Value::Array{identifierOf(kWipeArray)}), ""},
            {kTestability, grant("testability", true), ""},
            {kBadDigest, grant("allowed", true), std::string(64, '0')},
            {"integration", grant("allowed", true), ""},
        };
        for (const auto& [name, entitlements, sha256] : programs) {
            std::filesystem::path program = std::filesystem::read_symlink("/proc/self/exe");
            if (name != "integration") {
                program = clients() / name;
                // A copy where the root lies on another file system (a tmpfs /tmp).
                std::error_code linked;
                std::filesystem::create_hard_link(QUARN_TEST_CLIENT_PATH, program, linked);
                if (linked) {
                    std::filesystem::copy_file(QUARN_TEST_CLIENT_PATH, program);
                }
            }
            Value::Dictionary entry{{"Program", program.string()},
                                    {"Identifier", identifierOf(name)}};
            if (!entitlements.isNone()) {
                entry.emplace("Entitlements", entitlements);
            }
            if (!sha256.empty()) {
                entry.emplace("SHA256", sha256);
            }
            EXPECT_TRUE(
                QRN_writeToURL(Value(std::move(entry)), registry / (std::string(name) + ".plist")));
        }
    }

    ScratchRoot root_{{.withMobileUser = true, .installContext = false}, "quarn-it"};
    std::filesystem::path stderr_ = root() / "quarnd.stderr";
    std::size_t runLogStart_ = 0;        // where the current run's stderr begins
    mutable std::size_t clientRuns_ = 0; // names each client run's output file
    std::optional<ChildProcess> daemon_; // last: a running daemon is killed before the root goes
};

// A test suite sharing one daemon: started before the suite's first test,
// stopped (cleanly) after its last. Each test fails when the daemon is gone
// at its end, and shows the daemon's log of that test when it failed.
class SharedDaemonTest : public ::testing::Test {
protected:
    static void SetUpTestSuite() {
        harness_ = std::make_unique<DaemonHarness>();
        EXPECT_TRUE(harness_->start()) << "quarnd did not start";
    }
    static void TearDownTestSuite() { harness_.reset(); }
    void SetUp() override {
        ASSERT_TRUE(harness_->isRunning()) << "quarnd is not running";
        logStart_ = harness_->logSize();
    }
    void TearDown() override {
        EXPECT_TRUE(harness_->isRunning()) << "quarnd ended during the test";
        if (HasFailure()) {
            std::cerr << "---- quarnd stderr ----\n" << harness_->log(logStart_) << "----\n";
        }
    }
    static DaemonHarness& daemon() { return *harness_; }

private:
    static inline std::unique_ptr<DaemonHarness> harness_;
    std::size_t logStart_ = 0;
};

} // namespace quarn::test
