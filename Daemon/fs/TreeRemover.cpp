#include "Daemon/fs/TreeRemover.h"

#include "Daemon/fs/DirectoryEntryName.h"
#include "Daemon/fs/EnvFd.h"
#include "Daemon/support/Log.h"

#include <cerrno>
#include <cstring>
#include <fcntl.h>
#include <linux/fs.h>

namespace quarn {

namespace {

std::string childPath(const std::string& parent, const char* name) {
    std::string path = parent;
    if (path.empty() || path.back() != '/') {
        path += '/';
    }
    path += name;
    return path;
}

} // namespace

void TreeRemover::removeTree(int parentFd, const std::string& parentPath, const char* name) {
    removeEntry(Place{parentFd, parentPath, false}, name, DT_UNKNOWN);
}

void TreeRemover::removeEntry(const Place& place, const char* name, unsigned char type) {
    const std::string path = childPath(place.parentPath, name);
    if (type == DT_UNKNOWN) {
        auto st = env_.fstatat(place.parentFd, name, AT_SYMLINK_NOFOLLOW);
        if (!st) {
            handleFailure(place, name, path, false, st.error());
            return;
        }
        type = S_ISDIR(st->st_mode) ? DT_DIR : DT_REG;
    }
    if (type == DT_DIR) {
        removeDirectory(place, name, path);
        return;
    }
    if (auto unlinked = env_.unlinkat(place.parentFd, name, 0); !unlinked) {
        handleFailure(place, name, path, false, unlinked.error());
    }
}

void TreeRemover::removeDirectory(const Place& place, const char* name, const std::string& path) {
    auto opened =
        env_.openat(place.parentFd, name, O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_NONBLOCK);
    if (!opened) {
        if (opened.error() == ENOTDIR || opened.error() == ELOOP) {
            // Replaced by a file or a link since it was read: remove that.
            removeEntry(place, name, DT_REG);
        } else {
            handleFailure(place, name, path, true, opened.error());
        }
        return;
    }
    removeChildren(*opened, path);
    if (auto removed = env_.unlinkat(place.parentFd, name, AT_REMOVEDIR); !removed) {
        handleFailure(place, name, path, true, removed.error());
    }
}

void TreeRemover::removeChildren(int dirFd, const std::string& path) {
    EnvFd dir(env_, dirFd);
    if (auto stream = dir.openDirectoryStream(); !stream) {
        QRN_LOG_ERROR(LogCategory::Fs, "remove hit error for {} : {}", path,
                      std::strerror(stream.error()));
        record(stream.error());
        return;
    }
    for (;;) {
        auto entry = env_.readdir(dir.dir());
        if (!entry) {
            QRN_LOG_ERROR(LogCategory::Fs, "remove hit error for {} : {}", path,
                          std::strerror(entry.error()));
            record(entry.error());
            break;
        }
        if (*entry == nullptr) {
            break;
        }
        if (!DirectoryEntryName::isDot((*entry)->d_name)) {
            removeEntry(Place{dirfd(dir.dir()), path, true}, (*entry)->d_name, (*entry)->d_type);
        }
    }
}

void TreeRemover::handleFailure(const Place& place, const char* name, const std::string& path,
                                bool isDirectory, int err) {
    if (err == ENOENT) {
        return; // already gone: that is what was wanted
    }
    QRN_LOG_ERROR(LogCategory::Fs, "remove hit error for {} : {}", path, std::strerror(err));
    if (err != EPERM) {
        record(err);
        return;
    }
    auto st = env_.fstatat(place.parentFd, name, AT_SYMLINK_NOFOLLOW);
    if (!st) {
        QRN_LOG_ERROR(LogCategory::Fs, "Failed to stat {} before unsetting the immutable flag: {}",
                      path, std::strerror(st.error()));
        record(err);
        return;
    }
    // Either the entry itself is immutable, or the directory holding it is
    // (which forbids removing anything inside). Only a directory inside the
    // tree is changed: the parent of the tree's root is not ours.
    bool cleared = false;
    if (S_ISREG(st->st_mode) || S_ISDIR(st->st_mode)) {
        auto opened = env_.openat(place.parentFd, name, O_RDONLY | O_NOFOLLOW | O_NONBLOCK);
        if (opened) {
            EnvFd entry(env_, *opened);
            if (isImmutable(entry.get())) {
                if (!clearImmutable(entry.get(), path)) {
                    record(err);
                    return;
                }
                cleared = true;
            }
        }
    }
    if (place.parentInTree && isImmutable(place.parentFd)) {
        if (!clearImmutable(place.parentFd, place.parentPath)) {
            record(err);
            return;
        }
        cleared = true;
    }
    if (!cleared) {
        record(err);
        return;
    }
    auto unlinked = env_.unlinkat(place.parentFd, name, isDirectory ? AT_REMOVEDIR : 0);
    if (!unlinked && isDirectory && unlinked.error() == ENOTEMPTY) {
        // Its children could not go while it was immutable: now they can.
        removeDirectory(place, name, path);
        return;
    }
    if (!unlinked && unlinked.error() != ENOENT) {
        QRN_LOG_ERROR(LogCategory::Fs, "unlink of {} failed: {}", path,
                      std::strerror(unlinked.error()));
        record(unlinked.error());
    }
}

bool TreeRemover::isImmutable(int fd) {
    auto flags = env_.getFlags(fd);
    return flags && (*flags & FS_IMMUTABLE_FL) != 0;
}

bool TreeRemover::clearImmutable(int fd, const std::string& path) {
    auto flags = env_.getFlags(fd);
    if (!flags) {
        QRN_LOG_ERROR(LogCategory::Fs, "Failed to clear the immutable flag of {}: {}", path,
                      std::strerror(flags.error()));
        return false;
    }
    if (auto set = env_.setFlags(fd, *flags & ~FS_IMMUTABLE_FL); !set) {
        QRN_LOG_ERROR(LogCategory::Fs, "Failed to clear the immutable flag of {}: {}", path,
                      std::strerror(set.error()));
        return false;
    }
    QRN_LOG_NOTICE(LogCategory::Fs, "Unset the immutable flag on {}", path);
    return true;
}

void TreeRemover::record(int err) {
    if (firstError_ == 0) {
        firstError_ = err;
    }
}

} // namespace quarn
