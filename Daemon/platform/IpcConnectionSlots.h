#pragma once
// The connection slots of the request service, shared out by uid: no uid
// holds more than its share, and the last few slots are kept for root so
// that the system can still be served while users hold everything else.
// Not thread-safe: the service core guards it.

#include <sys/types.h>

#include <cstddef>
#include <unordered_map>
#include <vector>

namespace quarn {

class IpcConnectionSlots {
public:
    struct Quota {
        std::size_t total = 256;
        std::size_t perUID = 64;
        std::size_t rootReserved = 16; // of `total`, taken by uid 0 only
    };

    explicit IpcConnectionSlots(Quota quota) : quota_(quota) {}

    bool mayTake(uid_t uid) const;
    // False (and nothing taken) when `uid` may not take one.
    bool take(uid_t uid);
    void release(uid_t uid);

    std::size_t used() const { return used_; }
    std::size_t heldBy(uid_t uid) const;
    // The uids holding slots, those holding most first.
    std::vector<uid_t> uidsByUse() const;

private:
    Quota quota_;
    std::size_t used_ = 0;
    std::unordered_map<uid_t, std::size_t> held_;
};

} // namespace quarn
