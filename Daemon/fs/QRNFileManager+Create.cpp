// Directory creation with mode, owner and data protection class.

#include "Daemon/fs/EnvFd.h"
#include "Daemon/fs/QRNFileManager.h"
#include "Daemon/support/ProtectionClassAttribute.h"

#include <cerrno>
#include <cstring>
#include <fcntl.h>
#include <string>

namespace quarn {

namespace {

constexpr int kDirectoryPathFlags = O_PATH | O_DIRECTORY;

// mkdir -p by descriptor: every level that has to be made is made with
// `mode`. Existing levels (links among them, as for mkdir -p) are entered
// as they are. Answers 0 or the errno of the failing step.
int makePath(Env& env, const std::filesystem::path& url, mode_t mode) {
    // Usually only the leaf is missing: its parent is entered in one step
    // then, instead of a walk of every level. A missing parent is left to
    // the walk.
    const auto parent = url.parent_path();
    const auto leaf = url.filename();
    if (!parent.empty() && !leaf.empty() && leaf != "." && leaf != "..") {
        if (auto opened = env.openat(AT_FDCWD, parent.c_str(), kDirectoryPathFlags)) {
            EnvFd dir(env, *opened);
            auto made = env.mkdirat(dir.get(), leaf.c_str(), mode);
            if (made || made.error() != ENOENT) {
                return made ? 0 : made.error();
            }
        }
    }
    auto start = env.openat(AT_FDCWD, url.is_absolute() ? "/" : ".", kDirectoryPathFlags);
    if (!start) {
        return start.error();
    }
    EnvFd dir(env, *start);
    auto relative = url.relative_path();
    for (auto it = relative.begin(); it != relative.end(); ++it) {
        const std::string name = it->string();
        if (name.empty() || name == ".") {
            continue;
        }
        const bool leaf = std::next(it) == relative.end();
        auto next = env.openat(dir.get(), name.c_str(), kDirectoryPathFlags);
        if (!next && next.error() == ENOENT) {
            auto made = env.mkdirat(dir.get(), name.c_str(), mode);
            if (!made && made.error() != EEXIST) {
                return made.error();
            }
            if (leaf) {
                return 0;
            }
            next = env.openat(dir.get(), name.c_str(), kDirectoryPathFlags);
        }
        if (!next) {
            return next.error();
        }
        dir = EnvFd(env, *next);
    }
    return 0;
}

// An existing item where a directory was asked for must be a directory
// itself, not a link to one: class and owner are applied without following.
int existingDirectoryError(Env& env, const std::filesystem::path& url) {
    auto st = env.fstatat(AT_FDCWD, url.c_str(), AT_SYMLINK_NOFOLLOW);
    if (!st) {
        return st.error();
    }
    return S_ISDIR(st->st_mode) ? 0 : ENOTDIR;
}

// Written through the Env (not the attribute helper's own call) so that
// fault injection reaches it; same attribute and decimal text.
SysStatus setProtectionClassOfDirectory(Env& env, int fd, int protectionClass) {
    if (protectionClass < 0) {
        return SysError(EINVAL);
    }
    const std::string value = std::to_string(protectionClass);
    return env.fsetxattr(fd, ProtectionClassAttribute::attributeName(), value.data(), value.size(),
                         0);
}

} // namespace

Status QRNFileManager::createDirectoryAtURL(const std::filesystem::path& url,
                                            bool withIntermediateDirectories, mode_t mode,
                                            uid_t owner, int protectionClass) {
    if (withIntermediateDirectories) {
        int err = url.empty() ? ENOENT : makePath(*env_, url, mode);
        if (err == 0 || err == EEXIST) {
            err = existingDirectoryError(*env_, url);
        }
        if (err != 0) {
            return QRN_UNEXPECTED(
                QRN_POSIX_ERROR(err, "mkpath of {} failed: {}", url.string(), std::strerror(err)));
        }
    } else {
        auto made = env_->mkdirat(AT_FDCWD, url.c_str(), mode);
        int err = made ? 0 : made.error();
        if (err == EEXIST) {
            err = existingDirectoryError(*env_, url);
        }
        if (err != 0) {
            return QRN_UNEXPECTED(
                QRN_POSIX_ERROR(err, "mkdir of {} failed: {}", url.string(), std::strerror(err)));
        }
    }
    if (protectionClass != kProtectionClassUnchanged) {
        auto opened =
            env_->openat(AT_FDCWD, url.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_NONBLOCK);
        if (!opened) {
            int err = opened.error();
            return QRN_UNEXPECTED(
                QRN_POSIX_ERROR(err, "opendir of {} failed: {}", url.string(), std::strerror(err)));
        }
        EnvFd dir(*env_, *opened);
        if (auto set = setProtectionClassOfDirectory(*env_, dir.get(), protectionClass); !set) {
            int err = set.error();
            return QRN_UNEXPECTED(QRN_POSIX_ERROR(err, "Failed to setclass({}) on directory {}: {}",
                                                  protectionClass, url.string(),
                                                  std::strerror(err)));
        }
    }
    if (owner != 0) {
        // One number for user and group: container owners have equal ones.
        auto chowned = env_->fchownat(AT_FDCWD, url.c_str(), owner, owner, AT_SYMLINK_NOFOLLOW);
        if (!chowned) {
            int err = chowned.error();
            return QRN_UNEXPECTED(QRN_POSIX_ERROR(err, "Failed to chown({},{}) {}: {}", owner,
                                                  owner, url.string(), std::strerror(err)));
        }
    }
    return {};
}

Status QRNFileManager::createDirectoryAtURL(const std::filesystem::path& url,
                                            bool withIntermediateDirectories, mode_t mode,
                                            Owner owner) {
    return createDirectoryAtURL(url, withIntermediateDirectories, mode, owner.uid,
                                kProtectionClassUnchanged);
}

Status QRNFileManager::createDirectoryAtURL(const std::filesystem::path& url,
                                            bool withIntermediateDirectories, mode_t mode,
                                            ProtectionClass protectionClass) {
    return createDirectoryAtURL(url, withIntermediateDirectories, mode, 0, protectionClass.value);
}

Status QRNFileManager::createDirectoryAtURL(const std::filesystem::path& url,
                                            bool withIntermediateDirectories, mode_t mode) {
    return createDirectoryAtURL(url, withIntermediateDirectories, mode, 0,
                                kProtectionClassUnchanged);
}

} // namespace quarn
