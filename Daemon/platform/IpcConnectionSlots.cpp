#include "Daemon/platform/IpcConnectionSlots.h"

#include <algorithm>

namespace quarn {

bool IpcConnectionSlots::mayTake(uid_t uid) const {
    if (used_ >= quota_.total) {
        return false;
    }
    if (uid == 0) {
        return true;
    }
    const std::size_t open =
        quota_.total > quota_.rootReserved ? quota_.total - quota_.rootReserved : 0;
    return used_ < open && heldBy(uid) < quota_.perUID;
}

bool IpcConnectionSlots::take(uid_t uid) {
    if (!mayTake(uid)) {
        return false;
    }
    ++used_;
    ++held_[uid];
    return true;
}

void IpcConnectionSlots::release(uid_t uid) {
    const auto found = held_.find(uid);
    if (found == held_.end()) {
        return;
    }
    --used_;
    if (--found->second == 0) {
        held_.erase(found);
    }
}

std::size_t IpcConnectionSlots::heldBy(uid_t uid) const {
    const auto found = held_.find(uid);
    return found == held_.end() ? 0 : found->second;
}

std::vector<uid_t> IpcConnectionSlots::uidsByUse() const {
    std::vector<std::pair<std::size_t, uid_t>> byUse;
    byUse.reserve(held_.size());
    for (const auto& [uid, count] : held_) {
        byUse.emplace_back(count, uid);
    }
    std::sort(byUse.begin(), byUse.end(), std::greater<>());
    std::vector<uid_t> uids;
    uids.reserve(byUse.size());
    for (const auto& entry : byUse) {
        uids.push_back(entry.second);
    }
    return uids;
}

} // namespace quarn
