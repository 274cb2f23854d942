// The lock-state follower against a lock state the test sets. A manual
// queue shows whether it is suspended: runPending() runs nothing then.

#include "Daemon/QRNLockStateFollower.h"
#include "Daemon/platform/LockState.h"
#include "Daemon/support/Queue.h"

#include <gtest/gtest.h>

#include <initializer_list>

using namespace quarn;

namespace {

class FakeLockState final : public LockState {
public:
    std::int32_t state() const override { return state_; }
    Status startWatching(Callback) override { return {}; }
    void stopWatching() override {}
    void set(std::int32_t state) { state_ = state; }

private:
    std::int32_t state_ = kUnlocked;
};

class DaemonLockStateTest : public ::testing::Test {
protected:
    DaemonLockStateTest()
        : lockState_(std::make_shared<FakeLockState>()),
          queue_(std::make_shared<Queue>("test.lockstate", Queue::Kind::Manual)),
          follower_(lockState_, queue_) {}

    void report(std::initializer_list<std::int32_t> states) {
        for (std::int32_t state : states) {
            lockState_->set(state);
            follower_.lockstated_notification_callback();
        }
    }
    // Whether a block submitted now runs: the queue is not suspended.
    bool running() {
        queue_->async([] {});
        return queue_->runPending() > 0;
    }

    std::shared_ptr<FakeLockState> lockState_;
    std::shared_ptr<Queue> queue_;
    QRNLockStateFollower follower_;
};

TEST_F(DaemonLockStateTest, RepeatedLockedSuspendsOnceAndUnlockedResumesOnce) {
    EXPECT_EQ(follower_.recordedState(), QRNLockStateFollower::kInitialState);
    report({LockState::kLocked});
    EXPECT_FALSE(running()) << "locked did not suspend";
    report({LockState::kLocked});
    report({LockState::kUnlocked});
    EXPECT_TRUE(running()) << "a second locked report suspended again";
    EXPECT_EQ(follower_.recordedState(), LockState::kUnlocked);
    report({LockState::kUnlocked});
    EXPECT_TRUE(running());
}

TEST_F(DaemonLockStateTest, TransitionalStatesChangeNothing) {
    report({LockState::kLocked, 2, -1});
    EXPECT_EQ(follower_.recordedState(), LockState::kLocked);
    EXPECT_FALSE(running());
    report({LockState::kUnlocked});
    EXPECT_TRUE(running());
    report({7});
    EXPECT_EQ(follower_.recordedState(), LockState::kUnlocked);
    EXPECT_TRUE(running());
}

TEST_F(DaemonLockStateTest, FirstUnlockedReportResumesNothing) {
    // Held by someone else: a resume by the follower would let this block run.
    queue_->suspend();
    report({LockState::kUnlocked});
    EXPECT_EQ(follower_.recordedState(), LockState::kUnlocked);
    EXPECT_FALSE(running());
    queue_->resume();
    EXPECT_EQ(queue_->runPending(), 1u);
}

} // namespace
