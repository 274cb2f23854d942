#pragma once
// The real quarnd on a throw-away root: the root's accounts and OS release,
// a code-signing registry of client programs, the daemon process with its
// stderr in a file, and the ways a test talks to it (copies of the test
// client, or connections of the test binary itself).
//
// Every wait is bounded by kWaitLimit; none of them measures anything.

#include "Client/QRNClient.h"
#include "ClientPrograms.h"
#include "Daemon/support/Value.h"
#include "common/shared/ChildProcess.h"
#include "common/shared/RequestValues.h"
#include "common/shared/ScratchRoot.h"

#include <gtest/gtest.h>

#include <chrono>
#include <cstddef>
#include <filesystem>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace quarn::test {

class DaemonHarness {
public:
    static constexpr std::chrono::seconds kWaitLimit{30};

    // What one run of a client copy printed.
    struct ClientRun {
        std::vector<Value> replies;
        std::string failure; // the client's "!" line, or why its output was unreadable
        std::optional<ChildProcess::Exit> exit; // none: it did not end
    };

    DaemonHarness();
    DaemonHarness(const DaemonHarness&) = delete;
    DaemonHarness& operator=(const DaemonHarness&) = delete;

    const std::filesystem::path& root() const { return root_.path(); }
    // An absolute device path taken below the root.
    std::filesystem::path operator/(std::string_view absolute) const;
    std::filesystem::path runDirectory() const;
    std::filesystem::path socketPath() const;

    // Spawns quarnd on the root (with `environment` added) and returns at
    // once. False when it cannot be spawned.
    bool spawn(std::vector<std::string> environment = {});
    // Polls connecting to the socket until it accepts; false when the
    // daemon ended or the limit passed first.
    bool waitUntilAccepting();
    bool start() { return spawn() && waitUntilAccepting(); }
    bool isRunning() const;
    // SIGTERM, then waits for the exit; none when the daemon does not end.
    std::optional<ChildProcess::Exit> stop();

    // The daemon's stderr of the current run (debug level), from byte
    // `from` of that run on.
    std::string log(std::size_t from = 0) const;
    std::size_t logSize() const;
    // Waits until `text` appears in the current run's log at or after
    // `from`; answers where, or npos when the daemon ended or the limit
    // passed first.
    std::size_t waitForLog(std::string_view text, std::size_t from = 0) const;

    // Runs the client copy `program` with `requests` on one connection.
    ClientRun runClient(std::string_view program, const std::vector<Value>& requests) const;
    // A connection of the test binary, which the registry grants "allowed".
    Result<QRNClient> connect() const;
    // One request on a new connection of the test binary; fails the
    // calling test when no reply comes.
    Value request(const Value& request) const;

private:
    ScratchRoot root_{{.withMobileUser = true, .installContext = false}, "quarn-it"};
    std::filesystem::path stderrFile_;
    std::size_t runLogStart_ = 0;        // where the current run's stderr begins
    mutable std::size_t clientRuns_ = 0; // names each client run's output file
    std::optional<ClientPrograms> clients_;
    std::optional<ChildProcess>
        daemon_; // last: a daemon still running is killed before the root goes
};

// Polls `condition` until it holds or `limit` has passed; answers its last value.
bool waitUntil(const std::function<bool()>& condition,
               std::chrono::milliseconds limit = DaemonHarness::kWaitLimit);

// A test suite sharing one daemon: started before the suite's first test,
// stopped after its last, when it must exit with status 0. Each test fails
// when the daemon is gone at its end, and shows the daemon's log of that
// test when it failed.
class SharedDaemonTest : public ::testing::Test {
protected:
    static void SetUpTestSuite();
    static void TearDownTestSuite();
    void SetUp() override;
    void TearDown() override;

    static DaemonHarness& daemon() { return *harness_; }

private:
    static std::unique_ptr<DaemonHarness> harness_;
    std::size_t logStart_ = 0;
};

// Prints the daemon's log from `from` on, under a header, for a failed test.
void dumpLog(const DaemonHarness& harness, std::size_t from);
// Stops the daemon and fails the calling test unless it exits with status 0.
void expectCleanStop(DaemonHarness& harness);

} // namespace quarn::test
