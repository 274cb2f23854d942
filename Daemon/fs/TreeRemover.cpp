#include "Daemon/fs/TreeRemover.h"

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
    rootParentFd_ = parentFd;
    DirectoryStack stack(env_, parentPath, openLevels_);
    removeEntry(stack, name, DT_UNKNOWN);
    while (!stack.empty()) {
        auto next = stack.next();
        if (!next) {
            QRN_LOG_ERROR(LogCategory::Fs, "remove hit error for {} : {}", stack.path(),
                          std::strerror(next.error()));
            record(next.error());
            finishDirectory(stack);
        } else if (*next == nullptr) {
            finishDirectory(stack);
        } else {
            removeEntry(stack, (*next)->name.c_str(), (*next)->type);
        }
    }
}

TreeRemover::Place TreeRemover::placeIn(const DirectoryStack& stack) const {
    return stack.empty() ? Place{rootParentFd_, false} : Place{stack.fd(), true};
}

void TreeRemover::removeEntry(DirectoryStack& stack, const char* name, unsigned char type) {
    const Place place = placeIn(stack);
    if (type == DT_UNKNOWN) {
        auto st = env_.fstatat(place.parentFd, name, AT_SYMLINK_NOFOLLOW);
        if (!st) {
            handleFailure(stack, name, false, st.error());
            return;
        }
        type = S_ISDIR(st->st_mode) ? DT_DIR : DT_REG;
    }
    if (type == DT_DIR) {
        enterDirectory(stack, name);
        return;
    }
    if (auto unlinked = env_.unlinkat(place.parentFd, name, 0); !unlinked) {
        handleFailure(stack, name, false, unlinked.error());
    }
}

void TreeRemover::enterDirectory(DirectoryStack& stack, const char* name) {
    auto pushed = stack.push(placeIn(stack).parentFd, name);
    if (pushed) {
        return;
    }
    if (pushed.error() == ENOTDIR || pushed.error() == ELOOP) {
        // Replaced by a file or a link since it was read: remove that.
        removeEntry(stack, name, DT_REG);
    } else {
        handleFailure(stack, name, true, pushed.error());
    }
}

void TreeRemover::finishDirectory(DirectoryStack& stack) {
    const std::string name = stack.name();
    if (auto popped = stack.pop(); !popped) {
        QRN_LOG_ERROR(LogCategory::Fs, "remove of {} stopped: {}", stack.path(),
                      std::strerror(popped.error()));
        record(popped.error());
        return; // every level is dropped: the removal ends here
    }
    const Place place = placeIn(stack);
    if (auto removed = env_.unlinkat(place.parentFd, name.c_str(), AT_REMOVEDIR); !removed) {
        handleFailure(stack, name.c_str(), true, removed.error());
    }
}

void TreeRemover::handleFailure(DirectoryStack& stack, const char* name, bool isDirectory,
                                int err) {
    if (err == ENOENT) {
        return; // already gone: that is what was wanted
    }
    const std::string path = childPath(stack.path(), name);
    QRN_LOG_ERROR(LogCategory::Fs, "remove hit error for {} : {}", path, std::strerror(err));
    if (err != EPERM || !clearBlockingFlags(stack, name, path)) {
        record(err);
        return;
    }
    const Place place = placeIn(stack);
    auto unlinked = env_.unlinkat(place.parentFd, name, isDirectory ? AT_REMOVEDIR : 0);
    if (!unlinked && isDirectory && unlinked.error() == ENOTEMPTY) {
        // Its children could not go while it was immutable: now they can.
        enterDirectory(stack, name);
        return;
    }
    if (!unlinked && unlinked.error() != ENOENT) {
        QRN_LOG_ERROR(LogCategory::Fs, "unlink of {} failed: {}", path,
                      std::strerror(unlinked.error()));
        record(unlinked.error());
    }
}

// Either the entry itself is immutable, or the directory holding it is
// (which forbids removing anything inside). Only a directory inside the
// tree is changed: the parent of the tree's root is not ours. True when a
// flag was cleared and the removal is worth retrying.
bool TreeRemover::clearBlockingFlags(DirectoryStack& stack, const char* name,
                                     const std::string& path) {
    const Place place = placeIn(stack);
    auto st = env_.fstatat(place.parentFd, name, AT_SYMLINK_NOFOLLOW);
    if (!st) {
        QRN_LOG_ERROR(LogCategory::Fs, "Failed to stat {} before unsetting the immutable flag: {}",
                      path, std::strerror(st.error()));
        return false;
    }
    bool cleared = false;
    if (S_ISREG(st->st_mode) || S_ISDIR(st->st_mode)) {
        auto opened = env_.openat(place.parentFd, name, O_RDONLY | O_NOFOLLOW | O_NONBLOCK);
        if (opened) {
            EnvFd entry(env_, *opened);
            if (isImmutable(entry.get())) {
                if (!clearImmutable(entry.get(), path)) {
                    return false;
                }
                cleared = true;
            }
        }
    }
    if (place.parentInTree && isImmutable(place.parentFd)) {
        if (!clearImmutable(place.parentFd, stack.path())) {
            return false;
        }
        cleared = true;
    }
    return cleared;
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
