#pragma once
// Keeps the lock-state queue suspended while the device is locked: each
// report of the device's lock state may suspend or resume it, so that work
// needing the device's keys waits for an unlock.

#include <cstdint>
#include <memory>
#include <mutex>

namespace quarn {

class LockState;
class Queue;

class QRNLockStateFollower {
public:
    // Neither locked nor unlocked, so the first report always takes effect.
    static constexpr std::int32_t kInitialState = 3;

    QRNLockStateFollower(std::shared_ptr<LockState> lockState, std::shared_ptr<Queue> queue);

    // Asks the lock state and suspends the queue on a change to locked,
    // resumes it on a change from locked to unlocked. Transitional states
    // change nothing, not even the recorded state, so suspend and resume
    // stay balanced whatever the order of reports.
    void lockstated_notification_callback();

    std::int32_t recordedState() const;

private:
    const std::shared_ptr<LockState> lockState_;
    const std::shared_ptr<Queue> queue_;

    // Guards lastState_, the query of the state and the queue's suspension
    // made from it: the call at start runs on the listener queue, the
    // notifications on the main queue.
    mutable std::mutex mutex_;
    std::int32_t lastState_ = kInitialState;
};

} // namespace quarn
