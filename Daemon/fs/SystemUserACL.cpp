#include "Daemon/fs/SystemUserACL.h"

#include "Daemon/platform/Accounts.h"

#include <cerrno>
#include <cstring>
#include <vector>

namespace quarn {

namespace {

constexpr const char* kSystemUsersGroup = "systemusers";

int lastErrno() {
    return errno != 0 ? errno : EIO;
}

// Building a list fails with the ACL code of the error table, whatever the
// library call that failed.
#define ACL_BUILD_ERROR(...) QRN_UNEXPECTED(QRN_ERROR(kQRNErrorSetACLFailed, __VA_ARGS__))

bool isBaseEntry(acl_tag_t tag) {
    return tag == ACL_USER_OBJ || tag == ACL_GROUP_OBJ || tag == ACL_OTHER;
}

// Appends the entries of `from` to `*to` (only owner, owning group and other
// when `baseOnly`). Answers 0 or the errno.
int copyEntries(acl_t from, acl_t* to, bool baseOnly) {
    acl_entry_t entry;
    for (int which = ACL_FIRST_ENTRY;; which = ACL_NEXT_ENTRY) {
        int found = acl_get_entry(from, which, &entry);
        if (found < 0) {
            return lastErrno();
        }
        if (found == 0) {
            return 0;
        }
        acl_tag_t tag;
        if (acl_get_tag_type(entry, &tag) != 0) {
            return lastErrno();
        }
        if (baseOnly && !isBaseEntry(tag)) {
            continue;
        }
        acl_entry_t copy;
        if (acl_create_entry(to, &copy) != 0 || acl_copy_entry(copy, entry) != 0) {
            return lastErrno();
        }
    }
}

// The item's own base entries with `extra` added and the mask recomputed.
SysResult<acl_t> merged(acl_t base, acl_t extra) {
    acl_t out = acl_init(6);
    if (!out) {
        return SysError(lastErrno());
    }
    int err = copyEntries(base, &out, true);
    if (err == 0) {
        err = copyEntries(extra, &out, false);
    }
    if (err == 0 && acl_calc_mask(&out) != 0) {
        err = lastErrno();
    }
    if (err != 0) {
        acl_free(out);
        return SysError(err);
    }
    return out;
}

} // namespace

Result<SystemUserACL> SystemUserACL::make(Kind kind, const Accounts& accounts) {
    SystemUserACL acl;
    acl.access_.reset(acl_init(2));
    acl.default_.reset(acl_init(2));
    if (!acl.access_ || !acl.default_) {
        return ACL_BUILD_ERROR("acl_init() failed: {}", std::strerror(lastErrno()));
    }
    Status added;
    switch (kind) {
    case Kind::TopLevel:
        added = _CreateSystemUserACEInACL(
            acl, kAllPermissions, kFileInherit | kDirectoryInherit | kOnlyInherit, accounts);
        if (added) {
            added = _CreateSystemUserACEInACL(
                acl, kWriteData | kAppendData | kReadExtendedAttributes | kWriteExtendedAttributes,
                0, accounts);
        }
        break;
    case Kind::Directory:
        added = _CreateSystemUserACEInACL(acl, kAllPermissions, kFileInherit | kDirectoryInherit,
                                          accounts);
        break;
    case Kind::File:
        added =
            _CreateSystemUserACEInACL(acl, kAllPermissions & ~kDeleteChild, kInherited, accounts);
        break;
    }
    if (!added) {
        return QRN_UNEXPECTED(added.error());
    }
    return acl;
}

Status SystemUserACL::_CreateSystemUserACEInACL(SystemUserACL& acl, std::uint32_t permissions,
                                                std::uint32_t flags, const Accounts& accounts) {
    // The flags decide which of the two lists hold the entry.
    std::vector<Handle*> lists;
    if ((flags & kOnlyInherit) == 0) {
        lists.push_back(&acl.access_);
    }
    if ((flags & (kFileInherit | kDirectoryInherit)) != 0) {
        lists.push_back(&acl.default_);
    }
    std::vector<acl_entry_t> entries;
    for (Handle* list : lists) {
        acl_t raw = list->get();
        acl_entry_t entry;
        const int created = acl_create_entry(&raw, &entry);
        (void)list->release(); // the library may have moved the list
        list->reset(raw);
        if (created != 0) {
            return ACL_BUILD_ERROR("acl_create_entry() failed: {}", std::strerror(lastErrno()));
        }
        entries.push_back(entry);
    }
    auto group = accounts.groupByName(kSystemUsersGroup);
    if (!group) {
        return ACL_BUILD_ERROR("group lookup failed: {}", "no group named systemusers");
    }
    const gid_t gid = group->gid;
    for (acl_entry_t entry : entries) {
        if (permissions != 0) {
            acl_permset_t permset;
            if (acl_get_permset(entry, &permset) != 0) {
                return ACL_BUILD_ERROR("acl_get_permset() failed: {}", std::strerror(lastErrno()));
            }
            if (acl_add_perm(permset, linuxPermissions(permissions)) != 0) {
                return ACL_BUILD_ERROR("acl_add_perm() failed to set perms {:x}: {}", permissions,
                                       std::strerror(lastErrno()));
            }
            if (acl_set_permset(entry, permset) != 0) {
                return ACL_BUILD_ERROR("acl_set_permset() failed: {}", std::strerror(lastErrno()));
            }
        }
        if (acl_set_tag_type(entry, ACL_GROUP) != 0) {
            return ACL_BUILD_ERROR("acl_set_tag_type() failed: {}", std::strerror(lastErrno()));
        }
        if (acl_set_qualifier(entry, &gid) != 0) {
            return ACL_BUILD_ERROR("acl_set_qualifier() failed: {}", std::strerror(lastErrno()));
        }
    }
    return {};
}

acl_perm_t SystemUserACL::linuxPermissions(std::uint32_t permissions) {
    acl_perm_t perms = 0;
    if (permissions & kReadData) {
        perms |= ACL_READ;
    }
    if (permissions & (kWriteData | kAppendData | kDelete | kDeleteChild)) {
        perms |= ACL_WRITE;
    }
    // Adding an entry to a directory needs search rights on Linux.
    if (permissions & (kExecute | kWriteData | kAppendData)) {
        perms |= ACL_EXECUTE;
    }
    return perms;
}

bool SystemUserACL::hasDefaultEntries() const {
    acl_entry_t entry;
    return default_ && acl_get_entry(default_.get(), ACL_FIRST_ENTRY, &entry) == 1;
}

SysStatus SystemUserACL::applyTo(Env& env, const char* path, bool isDirectory) const {
    auto current = env.aclGetFile(path, ACL_TYPE_ACCESS);
    if (!current) {
        return SysError(current.error());
    }
    const Handle base(*current);
    auto access = merged(base.get(), access_.get());
    if (!access) {
        return SysError(access.error());
    }
    const Handle accessList(*access);
    if (auto set = env.aclSetFile(path, ACL_TYPE_ACCESS, accessList.get()); !set) {
        return set;
    }
    if (!isDirectory || !hasDefaultEntries()) {
        return {};
    }
    auto defaults = merged(base.get(), default_.get());
    if (!defaults) {
        return SysError(defaults.error());
    }
    const Handle defaultList(*defaults);
    return env.aclSetFile(path, ACL_TYPE_DEFAULT, defaultList.get());
}

} // namespace quarn
