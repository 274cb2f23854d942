#pragma once
// Who may hold the entitlements of a code-signing registry entry. The
// registry names a program, and anyone may run a program: the entitlements
// are the rights of the program run by the users the entry names
// ("EntitledUsers", "EntitledGroups": arrays of names or numeric ids;
// without either, root only), and run as its author wrote it: not traced,
// not started with code the dynamic loader adds (LD_PRELOAD and the like).
// A process refused keeps the entry's identifier, without entitlements.

#include "Daemon/platform/Accounts.h"
#include "Daemon/platform/ProcessInfo.h"
#include "Daemon/support/Value.h"

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <variant>
#include <vector>

namespace quarn {

class EntitlementHolders {
public:
    // A user or group by name (looked up when a process is checked, so that
    // the accounts of the root prefix may change) or by number.
    using Principal = std::variant<std::string, std::uint32_t>;

    // Root only.
    EntitlementHolders() = default;

    // From an entry's property list; the reason when a key is malformed.
    static std::optional<EntitlementHolders> fromPropertyList(const Value& plist,
                                                              std::string& problem);

    // What a process is, as far as entitlements go.
    struct Process {
        ProcessInfo::Standing standing;
        std::string loaderInjection; // the variable's name, "" when none
    };

    // Why `process` may not hold the entitlements, or none when it may.
    std::optional<std::string> refusal(const Process& process, const Accounts& accounts) const;

private:
    bool admitsUser(std::uint32_t uid, const Accounts& accounts) const;
    bool admitsGroup(std::uint32_t gid, const Accounts& accounts) const;

    bool named_ = false; // false: root only
    std::vector<Principal> users_;
    std::vector<Principal> groups_;
};

} // namespace quarn
