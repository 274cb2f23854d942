#pragma once
// Accounts on Linux. On the system root the C library's name service answers
// (so LDAP or systemd users work as everywhere else); below any other root
// prefix the root's own etc/passwd and etc/group are read, so a demo or test
// root carries its own users, and their home directories lie below the root.

#include "Daemon/platform/Accounts.h"
#include "Daemon/platform/Paths.h"

#include <functional>

struct passwd;
struct group;

namespace quarn {

class LinuxAccounts final : public Accounts {
public:
    explicit LinuxAccounts(Paths paths);

    std::optional<User> userByName(std::string_view name) const override;
    std::optional<User> userByUID(std::uint32_t uid) const override;
    std::optional<Group> groupByName(std::string_view name) const override;
    std::optional<Group> groupByGID(std::uint32_t gid) const override;

    // Lines longer than this are given up on rather than grown for.
    static constexpr std::size_t kMaxEntryBytes = 1 << 20;

private:
    using UserMatch = std::function<bool(const passwd&)>;
    using GroupMatch = std::function<bool(const group&)>;

    std::optional<User> systemUser(const std::string* name, std::uint32_t uid) const;
    std::optional<Group> systemGroup(const std::string* name, std::uint32_t gid) const;
    std::optional<User> fileUser(const UserMatch& matches) const;
    std::optional<Group> fileGroup(const GroupMatch& matches) const;

    User makeUser(const passwd& entry) const;
    static Group makeGroup(const group& entry);
    std::filesystem::path homeBelowRoot(const char* home) const;

    Paths paths_;
};

} // namespace quarn
