#pragma once
// The kernel sandbox's table of container mappings: for each user, which
// container (item type, identifier, class, persona) lives at which path.
// The daemon pushes a mapping when a container becomes live and removes it
// when the container goes; the launcher reads it back to confine a process.

#include <cstdint>
#include <functional>
#include <map>
#include <mutex>
#include <string>
#include <tuple>
#include <vector>

namespace quarn {

struct SandboxItem {
    std::uint64_t itemType = 0; // 1 data, 2 app group, 4 system data, 8 system group
    std::string identifier;
    std::uint64_t containerClass = 0;
    std::int32_t personaID = 0;
    std::string path;

    friend bool operator==(const SandboxItem&, const SandboxItem&) = default;
};

class SandboxKernel {
public:
    virtual ~SandboxKernel() = default;

    // Each returns 0 or an errno value.
    virtual int setContainerMapping(std::uint32_t uid, const SandboxItem& item) = 0;
    virtual int removeContainerMapping(std::uint32_t uid, const SandboxItem& item) = 0;
    // Calls `visit` for each item of the user; stops when it returns false.
    virtual int forEachItem(std::uint32_t uid,
                            const std::function<bool(const SandboxItem&)>& visit) const = 0;
};

// The in-memory table. One mapping per (item type, identifier, class,
// persona) of a user; setting again replaces the path.
class InMemorySandboxKernel final : public SandboxKernel {
public:
    int setContainerMapping(std::uint32_t uid, const SandboxItem& item) override;
    int removeContainerMapping(std::uint32_t uid, const SandboxItem& item) override;
    int forEachItem(std::uint32_t uid,
                    const std::function<bool(const SandboxItem&)>& visit) const override;

    std::size_t count(std::uint32_t uid) const;

private:
    using Key = std::tuple<std::uint64_t, std::string, std::uint64_t, std::int32_t>;
    static Key keyOf(const SandboxItem& item);

    mutable std::mutex mutex_; // guards users_
    std::map<std::uint32_t, std::map<Key, SandboxItem>> users_;
};

} // namespace quarn
