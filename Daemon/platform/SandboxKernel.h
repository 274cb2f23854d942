#pragma once
// The kernel sandbox's table of container mappings: for each user, which
// container (item type, identifier, class, persona) lives at which path.
// The daemon pushes a mapping when a container becomes live and removes it
// when the container goes; the launcher reads it back to confine a process.

#include <compare>
#include <cstdint>
#include <functional>
#include <map>
#include <mutex>
#include <set>
#include <string>
#include <string_view>
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
    // What names a mapping, viewing a stored one or a caller's item.
    struct KeyView {
        std::uint64_t itemType;
        std::string_view identifier;
        std::uint64_t containerClass;
        std::int32_t personaID;
        friend auto operator<=>(const KeyView&, const KeyView&) = default;
    };
    // One mapping as held: the identifier and the path share one string,
    // since a table of every container of the device is kept in memory.
    struct Stored {
        std::uint64_t itemType;
        std::uint64_t containerClass;
        std::int32_t personaID;
        std::uint32_t identifierLength;
        std::string text; // identifier, then path

        KeyView key() const {
            return {itemType, std::string_view(text).substr(0, identifierLength), containerClass,
                    personaID};
        }
        SandboxItem item() const;
    };
    struct Less {
        using is_transparent = void;
        static KeyView view(const Stored& s) { return s.key(); }
        static const KeyView& view(const KeyView& k) { return k; }
        bool operator()(const auto& a, const auto& b) const { return view(a) < view(b); }
    };
    static KeyView keyOf(const SandboxItem& item);

    mutable std::mutex mutex_; // guards users_
    std::map<std::uint32_t, std::set<Stored, Less>> users_;
};

} // namespace quarn
