#include "SharedDaemonTest.h"

#include <iostream>

namespace quarn::test {

namespace {

// Enough to see what led to a failure without flooding the output.
constexpr std::size_t kLogTailBytes = 32 * 1024;

} // namespace

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
