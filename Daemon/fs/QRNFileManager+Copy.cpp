// Recursive copy of data and metadata.

#include "Daemon/fs/EnvFd.h"
#include "Daemon/fs/ParentAndName.h"
#include "Daemon/fs/QRNFileManager.h"
#include "Daemon/fs/TreeCopier.h"
#include "Daemon/fs/TreeRemover.h"

#include <cerrno>
#include <cstring>
#include <fcntl.h>

namespace quarn {

namespace {

constexpr int kParentFlags = O_PATH | O_DIRECTORY;

// Copies src to dst by descriptor; a partial copy is removed again so a
// failed copy leaves the destination as it was. Answers 0 or an errno.
// Both parents are opened without following a link below the root prefix.
int copyTree(Env& env, const PathResolver& resolver, const std::filesystem::path& src,
             const std::filesystem::path& dst) {
    auto from = ParentAndName::of(src);
    auto to = ParentAndName::of(dst);
    if (!from || !to) {
        return EINVAL;
    }
    auto srcParentFd = resolver.open(from->parent, kParentFlags);
    if (!srcParentFd) {
        return srcParentFd.error();
    }
    auto dstParentFd = resolver.open(to->parent, kParentFlags);
    if (!dstParentFd) {
        return dstParentFd.error();
    }
    TreeCopier copier(env);
    int err =
        copier.copy(srcParentFd->get(), from->name.c_str(), dstParentFd->get(), to->name.c_str());
    if (err != 0 && copier.madeDestination()) {
        TreeRemover remover(env);
        remover.removeTree(dstParentFd->get(), to->parent.string(), to->name.c_str());
    }
    return err;
}

} // namespace

Status QRNFileManager::copyItemAtURL(const std::filesystem::path& src,
                                     const std::filesystem::path& dst) {
    return _copyItemAtURL(src, dst, true);
}

Status QRNFileManager::copyItemIfExistsAtURL(const std::filesystem::path& src,
                                             const std::filesystem::path& dst) {
    return _copyItemAtURL(src, dst, false);
}

Status QRNFileManager::_copyItemAtURL(const std::filesystem::path& src,
                                      const std::filesystem::path& dst, bool failIfSrcMissing) {
    if (!failIfSrcMissing) {
        auto st = env_->fstatat(AT_FDCWD, src.c_str(), AT_SYMLINK_NOFOLLOW);
        if (!st && st.error() == ENOENT) {
            return {};
        }
        if (!st) {
            return QRN_UNEXPECTED(QRN_POSIX_ERROR(st.error(), "stat of {} failed: {}", src.string(),
                                                  std::strerror(st.error())));
        }
    }
    if (int err = copyTree(*env_, resolver(), src, dst)) {
        return QRN_UNEXPECTED(QRN_POSIX_ERROR(err, "copy of {} to {} failed: {}", src.string(),
                                              dst.string(), std::strerror(err)));
    }
    return {};
}

} // namespace quarn
