// Recursive removal.

#include "Daemon/fs/EnvFd.h"
#include "Daemon/fs/ParentAndName.h"
#include "Daemon/fs/QRNFileManager.h"
#include "Daemon/fs/TreeRemover.h"

#include <cerrno>
#include <cstring>
#include <fcntl.h>

namespace quarn {

Status QRNFileManager::removeItemAtURL(const std::filesystem::path& url) {
    if (url.empty()) {
        return QRN_UNEXPECTED(QRN_POSIX_ERROR(EFAULT, "nil url passed to -removeItemAtURL:error:"));
    }
    int err = 0;
    if (auto parts = ParentAndName::of(url)) {
        // Opened without links below the root prefix: what is removed is
        // what the path names, never what a link leads to.
        auto parent = resolver().openParent(url);
        if (parent) {
            TreeRemover remover(*env_);
            remover.removeTree(parent->directory.get(), parts->parent.string(),
                               parts->name.c_str());
            err = remover.firstError();
        } else {
            err = parent.error();
        }
    } else {
        err = EINVAL; // "/", "." or "..": never a tree to remove
    }
    if (err == 0 || err == ENOENT) {
        return {};
    }
    return QRN_UNEXPECTED(
        QRN_POSIX_ERROR(err, "remove of {} failed: {}", url.string(), std::strerror(err)));
}

} // namespace quarn
