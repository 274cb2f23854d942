#include "Daemon/platform/SandboxKernel.h"

#include <cerrno>

namespace quarn {

InMemorySandboxKernel::Key InMemorySandboxKernel::keyOf(const SandboxItem& item) {
    return {item.itemType, item.identifier, item.containerClass, item.personaID};
}

int InMemorySandboxKernel::setContainerMapping(std::uint32_t uid, const SandboxItem& item) {
    if (item.identifier.empty() || item.path.empty()) {
        return EINVAL;
    }
    std::lock_guard guard(mutex_);
    users_[uid].insert_or_assign(keyOf(item), item);
    return 0;
}

int InMemorySandboxKernel::removeContainerMapping(std::uint32_t uid, const SandboxItem& item) {
    std::lock_guard guard(mutex_);
    auto user = users_.find(uid);
    if (user == users_.end() || user->second.erase(keyOf(item)) == 0) {
        return ENOENT;
    }
    if (user->second.empty()) {
        users_.erase(user);
    }
    return 0;
}

int InMemorySandboxKernel::forEachItem(std::uint32_t uid,
                                       const std::function<bool(const SandboxItem&)>& visit) const {
    // Copy first: the visitor may call back into the table.
    std::vector<SandboxItem> items;
    {
        std::lock_guard guard(mutex_);
        auto user = users_.find(uid);
        if (user != users_.end()) {
            for (const auto& [key, item] : user->second) {
                items.push_back(item);
            }
        }
    }
    for (const auto& item : items) {
        if (!visit(item)) {
            break;
        }
    }
    return 0;
}

std::size_t InMemorySandboxKernel::count(std::uint32_t uid) const {
    std::lock_guard guard(mutex_);
    auto user = users_.find(uid);
    return user == users_.end() ? 0 : user->second.size();
}

} // namespace quarn
