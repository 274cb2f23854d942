#include "Daemon/QRNLockStateFollower.h"

#include "Daemon/platform/LockState.h"
#include "Daemon/support/Log.h"
#include "Daemon/support/Queue.h"

#include <utility>

namespace quarn {

QRNLockStateFollower::QRNLockStateFollower(std::shared_ptr<LockState> lockState,
                                           std::shared_ptr<Queue> queue)
    : lockState_(std::move(lockState)), queue_(std::move(queue)) {}

void QRNLockStateFollower::lockstated_notification_callback() {
    // Asked under the lock: two reports racing must apply their states in
    // the order they read them, or a stale "locked" could win over a newer
    // "unlocked" and leave the queue suspended.
    std::lock_guard guard(mutex_);
    const std::int32_t state = lockState_->state();
    QRN_LOG_DEBUG(LogCategory::Startup, "LockState={}", state);
    if (state == LockState::kLocked) {
        if (lastState_ != LockState::kLocked) {
            queue_->suspend();
        }
        lastState_ = state;
    } else if (state == LockState::kUnlocked) {
        if (lastState_ == LockState::kLocked) {
            queue_->resume();
        }
        lastState_ = state;
    }
}

std::int32_t QRNLockStateFollower::recordedState() const {
    std::lock_guard guard(mutex_);
    return lastState_;
}

} // namespace quarn
