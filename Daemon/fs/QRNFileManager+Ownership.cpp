// Forcing owner, group and mode over a whole tree.

#include "Daemon/fs/QRNFileManager.h"

#include "Daemon/fs/DirectoryEntryName.h"
#include "Daemon/fs/Env.h"

#include <cerrno>
#include <cstring>
#include <fcntl.h>

namespace quarn {

namespace {

using Entry = QRNFileManager::TraversalEntry;

mode_t standardModeFor(const struct stat& st) {
    return S_ISDIR(st.st_mode) || (st.st_mode & 0111) != 0 ? 0755 : 0644;
}

// Both calls act on the entry itself: a link is never followed, and its
// own mode (which Linux cannot change) is left alone.
void standardizeEntry(Env& env, const Entry& entry, uid_t uid, gid_t gid) {
    const bool isRoot = entry.parentFd == AT_FDCWD;
    const char* name = isRoot ? entry.path.c_str() : entry.name.c_str();
    if (entry.status.st_uid != uid || entry.status.st_gid != gid) {
        if (auto chowned = env.fchownat(entry.parentFd, name, uid, gid, AT_SYMLINK_NOFOLLOW);
            !chowned) {
            QRN_LOG_ERROR(LogCategory::Fs, "Could not chown {}: {}", entry.path.string(),
                          std::strerror(chowned.error()));
        }
    }
    if (entry.kind == Entry::Kind::Symlink) {
        return;
    }
    const mode_t mode = standardModeFor(entry.status);
    if (auto chmodded = env.fchmodat(entry.parentFd, name, mode, AT_SYMLINK_NOFOLLOW); !chmodded) {
        QRN_LOG_ERROR(LogCategory::Fs, "Could not chmod {}: {}", entry.path.string(),
                      std::strerror(chmodded.error()));
    }
}

} // namespace

Status QRNFileManager::standardizeOwnershipAtURL(const std::filesystem::path& url, uid_t uid,
                                                 gid_t gid) {
    if (auto st = env_->fstatat(AT_FDCWD, url.c_str(), AT_SYMLINK_NOFOLLOW); !st) {
        return QRN_UNEXPECTED(QRN_POSIX_ERROR(st.error(), "Could not stat {}: {}", url.string(),
                                              std::strerror(st.error())));
    }
    // Per-entry failures are logged only: one bad entry must not leave the
    // rest of the tree with the wrong owner.
    return _traverseDirectory(url, [&](const Entry& entry) -> Status {
        if (entry.kind != Entry::Kind::DirectoryPostOrder &&
            entry.path.string().find(DirectoryEntryName::kMetadataFile) == std::string::npos) {
            standardizeEntry(*env_, entry, uid, gid);
        }
        return {};
    });
}

} // namespace quarn
