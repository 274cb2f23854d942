// Moves: a rename by name between two directories opened by descriptor, or
// a copy and a removal, by descriptor as well, across file systems.

#include "Daemon/fs/Env.h"
#include "Daemon/fs/QRNFileManager.h"
#include "Daemon/fs/TreeCopier.h"
#include "Daemon/fs/TreeRemover.h"

#include <cerrno>
#include <cstring>
#include <fcntl.h>

namespace quarn {

namespace {

Unexpected<Error> moveError(int err, const std::filesystem::path& src,
                            const std::filesystem::path& dst) {
    return QRN_UNEXPECTED(QRN_POSIX_ERROR(err, "rename of [{}] to [{}] failed: {}", src.string(),
                                          dst.string(), std::strerror(err)));
}

// The copy half of a move across file systems; a partial copy is removed.
int copyAcross(Env& env, int srcDir, const char* srcName, int dstDir,
               const std::filesystem::path& dstDirURL, const char* dstName) {
    TreeCopier copier(env);
    const int err = copier.copy(srcDir, srcName, dstDir, dstName);
    if (err != 0 && copier.madeDestination()) {
        TreeRemover(env).removeTree(dstDir, dstDirURL.string(), dstName);
    }
    return err;
}

} // namespace

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
    auto from = resolver().openParent(src);
    if (!from) {
        if (!failIfSrcMissing && from.error() == ENOENT) {
            return {};
        }
        return moveError(from.error(), src, dst);
    }
    if (!failIfSrcMissing) {
        auto st = env_->fstatat(from->directory.get(), from->name.c_str(), AT_SYMLINK_NOFOLLOW);
        if (!st && st.error() == ENOENT) {
            return {};
        }
        if (!st) {
            return QRN_UNEXPECTED(QRN_POSIX_ERROR(st.error(), "stat of [{}] failed: {}",
                                                  src.string(), std::strerror(st.error())));
        }
    }
    auto to = resolver().openParent(dst);
    if (!to) {
        return moveError(to.error(), src, dst);
    }
    return moveItemInDirectory(from->directory, src.parent_path(), from->name, to->directory,
                               dst.parent_path(), to->name);
}

Status QRNFileManager::moveItemInDirectory(const EnvFd& srcDir,
                                           const std::filesystem::path& srcDirURL,
                                           const std::string& srcName, const EnvFd& dstDir,
                                           const std::filesystem::path& dstDirURL,
                                           const std::string& dstName) {
    const auto src = srcDirURL / srcName;
    const auto dst = dstDirURL / dstName;
    auto renamed = env_->renameat(srcDir.get(), srcName.c_str(), dstDir.get(), dstName.c_str());
    if (renamed) {
        return {};
    }
    if (renamed.error() != EXDEV) {
        return moveError(renamed.error(), src, dst);
    }
    if (int err = copyAcross(*env_, srcDir.get(), srcName.c_str(), dstDir.get(), dstDirURL,
                             dstName.c_str())) {
        return QRN_UNEXPECTED(QRN_POSIX_ERROR(err, "copy of {} to {} failed: {}", src.string(),
                                              dst.string(), std::strerror(err)));
    }
    // The destination is complete: a source left behind is only untidy.
    TreeRemover remover(*env_);
    remover.removeTree(srcDir.get(), srcDirURL.string(), srcName.c_str());
    if (int err = remover.firstError()) {
        QRN_LOG_ERROR(LogCategory::Fs, "Failed to remove move source after copy at {} : {}",
                      src.string(), std::strerror(err));
    }
    return {};
}

} // namespace quarn
