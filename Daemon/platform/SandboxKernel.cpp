#include "Daemon/platform/SandboxKernel.h"

#include <cerrno>
#include <limits>

namespace quarn {

InMemorySandboxKernel::KeyView InMemorySandboxKernel::keyOf(const SandboxItem& item) {
    return {item.itemType, item.identifier, item.containerClass, item.personaID};
}

SandboxItem InMemorySandboxKernel::Stored::item() const {
    const std::string_view all(text);
    return SandboxItem{itemType, std::string(all.substr(0, identifierLength)), containerClass,
                       personaID, std::string(all.substr(identifierLength))};
}

int InMemorySandboxKernel::setContainerMapping(std::uint32_t uid, const SandboxItem& item) {
    if (item.identifier.empty() || item.path.empty() ||
        item.identifier.size() > std::numeric_limits<std::uint32_t>::max()) {
        return EINVAL;
    }
    Stored stored{item.itemType, item.containerClass, item.personaID,
                  static_cast<std::uint32_t>(item.identifier.size()), std::string()};
    stored.text.reserve(item.identifier.size() + item.path.size());
    stored.text.append(item.identifier).append(item.path);
    std::lock_guard guard(mutex_);
    auto& items = users_[uid];
    // Setting again replaces the path.
    if (auto found = items.find(keyOf(item)); found != items.end()) {
        items.erase(found);
    }
    items.insert(std::move(stored));
    return 0;
}

int InMemorySandboxKernel::removeContainerMapping(std::uint32_t uid, const SandboxItem& item) {
    std::lock_guard guard(mutex_);
    auto user = users_.find(uid);
    if (user == users_.end()) {
        return ENOENT;
    }
    auto found = user->second.find(keyOf(item));
    if (found == user->second.end()) {
        return ENOENT;
    }
    user->second.erase(found);
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
            items.reserve(user->second.size());
            for (const auto& stored : user->second) {
                items.push_back(stored.item());
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
