// Moves: a rename, or a copy and a removal across file systems.

#include "Daemon/fs/Env.h"
#include "Daemon/fs/QRNFileManager.h"

#include <cerrno>
#include <cstring>
#include <fcntl.h>

namespace quarn {

Status QRNFileManager::moveItemAtURL(const std::filesystem::path& src,
                                     const std::filesystem::path& dst) {
    return _moveItemAtURL(src, dst, true);
}

Status QRNFileManager::moveItemIfExistsAtURL(const std::filesystem::path& src,
                                             const std::filesystem::path& dst) {
    return _moveItemAtURL(src, dst, false);
}

Status QRNFileManager::_moveItemAtURL(const std::filesystem::path& src,
                                      const std::filesystem::path& dst, bool failIfSrcMissing) {
    if (!failIfSrcMissing) {
        auto st = env_->fstatat(AT_FDCWD, src.c_str(), AT_SYMLINK_NOFOLLOW);
        if (!st && st.error() == ENOENT) {
            return {};
        }
        if (!st) {
            return QRN_UNEXPECTED(QRN_POSIX_ERROR(st.error(), "stat of [{}] failed: {}",
                                                  src.string(), std::strerror(st.error())));
        }
    }
    auto renamed = env_->renameat(AT_FDCWD, src.c_str(), AT_FDCWD, dst.c_str());
    if (renamed) {
        return {};
    }
    int err = renamed.error();
    if (err != EXDEV) {
        return QRN_UNEXPECTED(QRN_POSIX_ERROR(err, "rename of [{}] to [{}] failed: {}",
                                              src.string(), dst.string(), std::strerror(err)));
    }
    if (auto copied = _copyItemAtURL(src, dst, true); !copied) {
        return copied;
    }
    // The destination is complete: a source left behind is only untidy.
    if (auto removed = removeItemAtURL(src); !removed) {
        QRN_LOG_ERROR(LogCategory::Fs, "Failed to remove move source after copy at {} : {}",
                      src.string(), removed.error().description());
    }
    return {};
}

} // namespace quarn
