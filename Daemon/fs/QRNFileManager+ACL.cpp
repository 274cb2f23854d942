// Access control lists of system containers.
//
// Items are reached through an O_PATH descriptor opened without following
// links, and changed through its /proc entry (a kernel interface, not a
// device path, so not taken below the root prefix): libacl sets default ACLs
// only by path, and this path cannot be swapped for a link under us.

#include "Daemon/fs/DirectoryEntryName.h"
#include "Daemon/fs/EnvFd.h"
#include "Daemon/fs/QRNFileManager.h"
#include "Daemon/fs/SystemUserACL.h"
#include "Daemon/platform/Accounts.h"
#include "Daemon/support/QRNDaemonContext.h"

#include <fmt/format.h>
#include <fmt/ranges.h>

#include <cerrno>
#include <cstring>
#include <fcntl.h>

namespace quarn {

namespace {

namespace fs = std::filesystem;
using Entry = QRNFileManager::TraversalEntry;

// Below the top of a system container everything belongs to "nobody", so
// access is granted through the list only.
constexpr uid_t kNobody = 65534;

struct Lists {
    SystemUserACL topLevel;
    SystemUserACL directory;
    SystemUserACL file;
};

Result<Lists> makeLists(const Accounts& accounts) {
    auto topLevel = SystemUserACL::make(SystemUserACL::Kind::TopLevel, accounts);
    if (!topLevel) {
        return QRN_UNEXPECTED(topLevel.error());
    }
    auto directory = SystemUserACL::make(SystemUserACL::Kind::Directory, accounts);
    if (!directory) {
        return QRN_UNEXPECTED(directory.error());
    }
    auto file = SystemUserACL::make(SystemUserACL::Kind::File, accounts);
    if (!file) {
        return QRN_UNEXPECTED(file.error());
    }
    return Lists{std::move(*topLevel), std::move(*directory), std::move(*file)};
}

std::string procPathOf(int fd) {
    return fmt::format("/proc/self/fd/{}", fd);
}

// An item opened without following a link, and what it is now.
struct OpenedItem {
    EnvFd fd;
    struct stat status {};
};

SysResult<OpenedItem> openItem(Env& env, int parentFd, const char* name) {
    auto opened = env.openat(parentFd, name, O_PATH | O_NOFOLLOW);
    if (!opened) {
        return SysError(opened.error());
    }
    OpenedItem item{EnvFd(env, *opened), {}};
    auto st = env.fstat(item.fd.get());
    if (!st) {
        return SysError(st.error());
    }
    item.status = *st;
    return item;
}

SysResult<OpenedItem> openEntry(Env& env, const Entry& entry) {
    const bool isRoot = entry.parentFd == AT_FDCWD;
    return openItem(env, entry.parentFd, isRoot ? entry.path.c_str() : entry.name.c_str());
}

// Links cannot carry an ACL on Linux.
SysStatus applyList(Env& env, const SystemUserACL& list, const OpenedItem& item) {
    if (S_ISLNK(item.status.st_mode)) {
        return SysError(ELOOP);
    }
    return list.applyTo(env, procPathOf(item.fd.get()).c_str(), S_ISDIR(item.status.st_mode));
}

// Below the top: the list, mode 0 and owner "nobody". The mode goes first:
// changing it afterwards would narrow the list's mask to nothing. With the
// list in place the mode's group bits show that mask.
void standardizeBelowTop(Env& env, const Lists& lists, const OpenedItem& item,
                         const std::string& path) {
    const std::string proc = procPathOf(item.fd.get());
    if (!S_ISLNK(item.status.st_mode)) {
        if (auto chmodded = env.fchmodat(AT_FDCWD, proc.c_str(), 0, 0); !chmodded) {
            QRN_LOG_ERROR(LogCategory::Fs, "Could not chmod {}: {}", path,
                          std::strerror(chmodded.error()));
        }
        const auto& list = S_ISDIR(item.status.st_mode) ? lists.directory : lists.file;
        if (auto set = applyList(env, list, item); !set) {
            QRN_LOG_ERROR(LogCategory::Fs, "Failed to set ACL on dir {}: {}", path,
                          std::strerror(set.error()));
        }
    }
    if (auto chowned = env.fchownat(item.fd.get(), "", kNobody, kNobody, AT_EMPTY_PATH); !chowned) {
        QRN_LOG_ERROR(LogCategory::Fs, "Could not chown {}: {}", path,
                      std::strerror(chowned.error()));
    }
}

} // namespace

Status QRNFileManager::setTopLevelSystemContainerACLAtURL(const fs::path& url) {
    auto list = SystemUserACL::make(SystemUserACL::Kind::TopLevel, context_->instance<Accounts>());
    if (!list) {
        return QRN_UNEXPECTED(list.error());
    }
    auto parent = resolver().openParent(url);
    auto item = parent ? openItem(*env_, parent->directory.get(), parent->name.c_str())
                       : SysResult<OpenedItem>(SysError(parent.error()));
    SysStatus set = item ? applyList(*env_, *list, *item) : SysError(item.error());
    if (!set) {
        return QRN_UNEXPECTED(QRN_ERROR(kQRNErrorSetACLFailed, "Failed to set ACL on {}: {}",
                                        url.string(), std::strerror(set.error())));
    }
    return {};
}

Status QRNFileManager::standardizeACLsAtURL(const fs::path& url, bool isSystemContainer) {
    auto lists = makeLists(context_->instance<Accounts>());
    if (!lists) {
        return QRN_UNEXPECTED(lists.error());
    }
    // Per-entry failures are logged and the walk goes on, so that one bad
    // entry does not leave the rest of the tree unconverted.
    return _traverseDirectory(url, [&](const Entry& entry) -> Status {
        if (entry.kind == Entry::Kind::DirectoryPostOrder ||
            entry.path.string().find(DirectoryEntryName::kMetadataFile) != std::string::npos) {
            return {};
        }
        const bool topLevel = isSystemContainer && entry.level == 0;
        auto item = openEntry(*env_, entry);
        if (!topLevel) {
            if (item) {
                standardizeBelowTop(*env_, *lists, *item, entry.path.string());
            } else {
                QRN_LOG_ERROR(LogCategory::Fs, "Failed to set ACL on dir {}: {}",
                              entry.path.string(), std::strerror(item.error()));
            }
            return {};
        }
        // The container's own directory keeps its owner and mode.
        SysStatus set = item ? applyList(*env_, lists->topLevel, *item) : SysError(item.error());
        if (!set) {
            QRN_LOG_ERROR(LogCategory::Fs, "Failed to set top level ACL on dir {}: {}",
                          entry.path.string(), std::strerror(set.error()));
        }
        return {};
    });
}

Status QRNFileManager::standardizeACLsForSystemContainerAtURL(const fs::path& url) {
    return standardizeACLsAtURL(url, true);
}

Status QRNFileManager::standardizeAllSystemContainerACLsAtURL(const fs::path& url) {
    auto items = urlsForItemsInDirectoryAtURL(url);
    if (!items) {
        if (items.error().isPOSIX(ENOENT)) {
            return {};
        }
        QRN_LOG_ERROR(LogCategory::Fs, "Failed to get items at URL{} : {}", url.string(),
                      items.error().description());
        return QRN_UNEXPECTED(items.error());
    }
    if (items->empty()) {
        return {};
    }
    std::vector<std::string> paths;
    for (const auto& item : *items) {
        paths.push_back(item.url.string());
    }
    QRN_LOG_NOTICE(LogCategory::Fs, "Potential containers requiring ACL migration: {}",
                   fmt::join(paths, ", "));
    std::optional<Error> firstFailure;
    for (const auto& item : *items) {
        auto done = standardizeACLsForSystemContainerAtURL(item.url);
        if (!done) {
            QRN_LOG_ERROR(LogCategory::Fs, "Failed to set system container ACL at {}: {}",
                          item.url.string(), done.error().description());
            if (!firstFailure) {
                firstFailure = done.error();
            }
        }
    }
    if (firstFailure) {
        return QRN_UNEXPECTED(*firstFailure);
    }
    return {};
}

} // namespace quarn
