#pragma once
// The serial queue "com.orvex.quarnd.lockstate": work that must wait while
// the device is locked (data-protection changes). Start-up suspends it while
// the device is locked and resumes it on unlock. One per daemon context,
// made on first use, so whoever needs it first finds the same queue.

#include "Daemon/support/Queue.h"

#include <memory>

namespace quarn {

class LockStateQueue {
public:
    LockStateQueue() : queue_(std::make_shared<Queue>(Queue::ownerLabel("lockstate"))) {}

    const std::shared_ptr<Queue>& queue() const { return queue_; }

private:
    std::shared_ptr<Queue> queue_;
};

} // namespace quarn
