// The entries of one directory.

#include "Daemon/fs/EnvFd.h"
#include "Daemon/fs/QRNFileManager.h"

#include <cerrno>
#include <cstring>
#include <fcntl.h>

namespace quarn {

namespace {

// Reads the entries of the open directory into `items`, through a stream
// of its own so that `dirFd` stays open. Answers 0 or an errno.
int listDirectory(Env& env, int dirFd, const std::filesystem::path& url,
                  std::vector<QRNFileManager::Item>& items) {
    auto again = env.openat(dirFd, ".", O_RDONLY | O_DIRECTORY | O_NONBLOCK);
    if (!again) {
        return again.error();
    }
    EnvFd dir(env, *again);
    if (auto stream = dir.openDirectoryStream(); !stream) {
        return stream.error();
    }
    for (;;) {
        auto read = env.readdir(dir.dir());
        if (!read) {
            return read.error();
        }
        if (*read == nullptr) {
            break;
        }
        const char* name = (*read)->d_name;
        if (name[0] == '.') {
            continue; // ".", ".." and every dot-file, deliberately
        }
        unsigned char type = (*read)->d_type;
        if (type == DT_UNKNOWN) {
            auto st = env.fstatat(dirFd, name, AT_SYMLINK_NOFOLLOW);
            if (!st && st.error() == ENOENT) {
                continue; // removed since it was read
            }
            if (!st) {
                return st.error();
            }
            type = S_ISDIR(st->st_mode) ? DT_DIR : DT_REG;
        }
        items.push_back({url / name, type == DT_DIR});
    }
    auto closed = dir.close();
    return closed ? 0 : closed.error();
}

} // namespace

Result<QRNFileManager::Listing>
QRNFileManager::listDirectoryAtURL(const std::filesystem::path& url) {
    Listing listing{EnvFd(), url, {}};
    auto opened = resolver().open(url, O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_NONBLOCK);
    int err = 0;
    if (!opened) {
        err = opened.error();
        if (err != ENOENT) {
            QRN_LOG_ERROR(LogCategory::Fs, "opendir of {} failed: {}", url.string(),
                          std::strerror(err));
        }
    } else {
        listing.directory = std::move(*opened);
        err = listDirectory(*env_, listing.directory.get(), url, listing.items);
    }
    if (err != 0) {
        return QRN_UNEXPECTED(QRN_POSIX_ERROR(err, "_IterateDirectory for {} returned {}",
                                              url.string(), std::strerror(err)));
    }
    return listing;
}

Result<std::vector<QRNFileManager::Item>>
QRNFileManager::urlsForItemsInDirectoryAtURL(const std::filesystem::path& url) {
    auto listing = listDirectoryAtURL(url);
    if (!listing) {
        return QRN_UNEXPECTED(listing.error());
    }
    return std::move(listing->items);
}

} // namespace quarn
