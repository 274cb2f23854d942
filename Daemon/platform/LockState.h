#pragma once
// The device's lock state and its change notification. Data-protection work
// waits while the device is locked and resumes when it is unlocked.

#include "Daemon/support/QRNError.h"

#include <cstdint>
#include <functional>

namespace quarn {

class LockState {
public:
    // Any other value is a transitional state: neither locked nor unlocked.
    static constexpr std::int32_t kUnlocked = 0;
    static constexpr std::int32_t kLocked = 1;

    using Callback = std::function<void(std::int32_t state)>;

    virtual ~LockState() = default;

    virtual std::int32_t state() const = 0;
    bool isLocked() const { return state() == kLocked; }

    // Calls `callback` with the new state, on a thread of the implementation,
    // each time the state changes after this returns (the state at the start
    // is not reported: ask `state()`). Replaces an earlier watch.
    virtual Status startWatching(Callback callback) = 0;
    // After this returns no callback runs any more, unless it is called from
    // the callback itself, which then is the last one.
    virtual void stopWatching() = 0;
};

} // namespace quarn
