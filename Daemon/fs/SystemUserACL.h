#pragma once
// The access control lists of system containers: entries granting the group
// "systemusers" rights, in the three forms the file manager puts on a tree
// (the container's own directory, directories below it, everything else).
//
// The rights are written as the platform's permission and flag words so the
// tables can be checked against them; on Linux they become POSIX ACL
// entries. Inheritance has no per-entry flag there: an entry that is only
// inherited goes to the default ACL, one that is inherited and applies too
// goes to both, any other to the access ACL.

#include "Daemon/fs/Env.h"
#include "Daemon/support/QRNError.h"

#include <sys/acl.h>

#include <cstdint>
#include <memory>
#include <type_traits>

namespace quarn {

class Accounts;

class SystemUserACL {
public:
    // Permission bits.
    static constexpr std::uint32_t kReadData = 0x2;
    static constexpr std::uint32_t kWriteData = 0x4;
    static constexpr std::uint32_t kExecute = 0x8;
    static constexpr std::uint32_t kDelete = 0x10;
    static constexpr std::uint32_t kAppendData = 0x20;
    static constexpr std::uint32_t kDeleteChild = 0x40;
    static constexpr std::uint32_t kReadExtendedAttributes = 0x200;
    static constexpr std::uint32_t kWriteExtendedAttributes = 0x400;
    static constexpr std::uint32_t kAllPermissions = 0x3ffe;
    // Flag bits.
    static constexpr std::uint32_t kInherited = 0x10;
    static constexpr std::uint32_t kFileInherit = 0x20;
    static constexpr std::uint32_t kDirectoryInherit = 0x40;
    static constexpr std::uint32_t kOnlyInherit = 0x100;

    enum class Kind { TopLevel, Directory, File };

    // The list of that kind. Failures are QRNErrorDomain code 63.
    static Result<SystemUserACL> make(Kind kind, const Accounts& accounts);

    // Adds one entry for "systemusers" with the platform's permission and
    // flag words.
    static Status _CreateSystemUserACEInACL(SystemUserACL& acl, std::uint32_t permissions,
                                            std::uint32_t flags, const Accounts& accounts);

    // The rwx bits a permission word grants on Linux.
    static acl_perm_t linuxPermissions(std::uint32_t permissions);

    // Puts the list on the item `path` names (a path that does not follow
    // links, such as a descriptor's /proc entry). Its owner, owning group and
    // other entries stay as they are; any other entry is replaced.
    // Directories also get the default entries. Answers the errno.
    SysStatus applyTo(Env& env, const char* path, bool isDirectory) const;

    bool hasDefaultEntries() const;

private:
    struct Free {
        void operator()(void* p) const { acl_free(p); }
    };
    using Handle = std::unique_ptr<std::remove_pointer_t<acl_t>, Free>;

    Handle access_;
    Handle default_;
};

} // namespace quarn
