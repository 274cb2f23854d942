#pragma once
// Fixture of a test suite that shares one daemon: started before the
// suite's first test, stopped after its last, when it must exit with
// status 0. Each test fails when the daemon is gone at its end, and shows
// the daemon's log of that test when it failed.

#include "DaemonHarness.h"

#include <gtest/gtest.h>

#include <memory>

namespace quarn::test {

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
