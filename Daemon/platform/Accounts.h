#pragma once
// The password and group databases: who "mobile" is, where a uid's home
// directory lies, which gid the group "systemusers" has.

#include <cstdint>
#include <filesystem>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace quarn {

class Accounts {
public:
    struct User {
        std::string name;
        std::uint32_t uid = 0;
        std::uint32_t gid = 0;
        // Already below the root prefix; empty when the entry names none.
        std::filesystem::path homeDirectory;
    };

    struct Group {
        std::string name;
        std::uint32_t gid = 0;
        std::vector<std::string> members;
    };

    virtual ~Accounts() = default;

    // nullopt when there is no such entry (or the database cannot be read).
    virtual std::optional<User> userByName(std::string_view name) const = 0;
    virtual std::optional<User> userByUID(std::uint32_t uid) const = 0;
    virtual std::optional<Group> groupByName(std::string_view name) const = 0;
    virtual std::optional<Group> groupByGID(std::uint32_t gid) const = 0;
};

} // namespace quarn
