// The lock-state follower against a lock state the test sets. A manual
// queue shows whether it is suspended: runPending() runs nothing then.

#include "Daemon/QRNLockStateFollower.h"
#include "Daemon/platform/LockState.h"
#include "Daemon/support/Queue.h"

#include <gtest/gtest.h>

#include <vector>

using namespace quarn;

namespace {

class FakeLockState final : public LockState {
public:
    std::int32_t state() const override { return current; }
    Status startWatching(Callback) override { return {}; }
    void stopWatching() override {}
    std::int32_t current = kUnlocked;
};

TEST(DaemonLockStateTest, FollowerSuspendsAndResumesOncePerChange) {
    constexpr std::int32_t kLocked = LockState::kLocked, kUnlocked = LockState::kUnlocked;
    const struct {
        const char* what;
        bool heldElsewhere; // the queue is suspended by someone else first
        std::vector<std::int32_t> reports;
        std::int32_t recorded;
        bool running;
    } cases[] = {
        {"locked suspends", false, {kLocked}, kLocked, false},
        {"no second suspend", false, {kLocked, kLocked, kUnlocked}, kUnlocked, true},
        {"no second resume", false, {kLocked, kUnlocked, kUnlocked}, kUnlocked, true},
        {"transitional states", false, {kLocked, 2, -1}, kLocked, false},
        {"transitional, unlocked", false, {kLocked, kUnlocked, 7}, kUnlocked, true},
        // A resume by the follower would let the other holder's block run.
        {"first unlocked resumes nothing", true, {kUnlocked}, kUnlocked, false},
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(c.what);
        auto lockState = std::make_shared<FakeLockState>();
        auto queue = std::make_shared<Queue>("test.lockstate", Queue::Kind::Manual);
        QRNLockStateFollower follower(lockState, queue);
        EXPECT_EQ(follower.recordedState(), QRNLockStateFollower::kInitialState);
        if (c.heldElsewhere) {
            queue->suspend();
        }
        for (std::int32_t state : c.reports) {
            lockState->current = state;
            follower.lockstated_notification_callback();
        }
        EXPECT_EQ(follower.recordedState(), c.recorded);
        queue->async([] {});
        EXPECT_EQ(queue->runPending() > 0, c.running);
        if (c.heldElsewhere) {
            queue->resume();
            EXPECT_EQ(queue->runPending(), 1u);
        }
    }
}

} // namespace
