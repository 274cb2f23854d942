// Directory creation with mode, owner and data protection class. The new
// directory is reached through its parent's descriptor, and class and owner
// are set on a descriptor of the directory itself: no path is walked twice.

#include "Daemon/fs/EnvFd.h"
#include "Daemon/fs/QRNFileManager.h"

#include <cerrno>
#include <charconv>
#include <cstring>
#include <fcntl.h>
#include <string>

namespace quarn {

namespace {

namespace fs = std::filesystem;

constexpr int kDirectoryPathFlags = O_PATH | O_DIRECTORY;
// The made (or found) directory itself: never a link.
constexpr int kMadeDirectoryFlags = O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_NONBLOCK;

bool isPlainName(const std::string& name) {
    return !name.empty() && name != "." && name != "..";
}

// The parent of the directory to make and the leaf's name in it.
struct Leaf {
    int parent = AT_FDCWD;
    EnvFd ownedParent; // when the parent was opened here
    std::string name;

    void setParent(EnvFd fd) {
        ownedParent = std::move(fd);
        parent = ownedParent.get();
    }
};

// mkdir -p by descriptor from the root prefix: every level that has to be
// made is made with `mode`; existing levels are entered, but never through
// a link below the root prefix (ELOOP). Answers the mkdir of the leaf's
// errno (0 when it was made, EEXIST when it was there) or the errno of the
// failing step before it.
int makePath(Env& env, const PathResolver& resolver, const fs::path& url, mode_t mode, Leaf& leaf) {
    // Usually only the leaf is missing: its parent is entered in one step
    // then, instead of a walk of every level. A missing parent is left to
    // the walk.
    auto parent = resolver.open(url.parent_path(), kDirectoryPathFlags);
    if (parent) {
        leaf.setParent(std::move(*parent));
        auto made = env.mkdirat(leaf.parent, leaf.name.c_str(), mode);
        if (made || made.error() != ENOENT) {
            return made ? 0 : made.error();
        }
    } else if (parent.error() != ENOENT) {
        return parent.error();
    }
    auto from = resolver.anchor(url.parent_path());
    if (!from) {
        return from.error();
    }
    EnvFd dir = std::move(from->start);
    for (const fs::path& component : fs::path(from->relative)) {
        const std::string name = component.string();
        if (name.empty() || name == ".") {
            continue;
        }
        auto next = env.openat2(dir.get(), name.c_str(), kDirectoryPathFlags, 0, from->resolve);
        if (!next && next.error() == ENOENT) {
            auto made = env.mkdirat(dir.get(), name.c_str(), mode);
            if (!made && made.error() != EEXIST) {
                return made.error();
            }
            next = env.openat2(dir.get(), name.c_str(), kDirectoryPathFlags, 0, from->resolve);
        }
        if (!next) {
            PathResolver::logRefusal(url, next.error());
            return next.error();
        }
        dir = EnvFd(env, *next);
    }
    leaf.setParent(std::move(dir));
    auto made = env.mkdirat(leaf.parent, leaf.name.c_str(), mode);
    return made ? 0 : made.error();
}

// The parent must exist already.
int makeLeaf(Env& env, const PathResolver& resolver, const fs::path& url, mode_t mode, Leaf& leaf) {
    auto opened = resolver.open(url.parent_path(), kDirectoryPathFlags);
    if (!opened) {
        return opened.error();
    }
    leaf.setParent(std::move(*opened));
    auto made = env.mkdirat(leaf.parent, leaf.name.c_str(), mode);
    return made ? 0 : made.error();
}

// Written through the Env (not the attribute helper's own call) so that
// fault injection reaches it; same attribute and decimal text.
SysStatus setProtectionClassOfDirectory(Env& env, int fd, const char* attribute,
                                        int protectionClass) {
    if (protectionClass < 0) {
        return SysError(EINVAL);
    }
    char text[16];
    const auto converted = std::to_chars(text, text + sizeof text, protectionClass);
    return env.fsetxattr(fd, attribute, text, static_cast<std::size_t>(converted.ptr - text), 0);
}

// Names the directory in messages; the path is only joined for a message.
struct Where {
    const fs::path& base;
    const fs::path* relative = nullptr;
    fs::path url() const { return relative ? base / *relative : base; }
};

// What is applied to the leaf once it exists.
struct Finish {
    uid_t owner = 0; // 0: left alone
    int protectionClass = QRNFileManager::kProtectionClassUnchanged;
    bool keepOpen = false;
    const char* verb = "mkpath";     // names the step in messages
    const char* attribute = nullptr; // of the protection class
};

// A failed step, its errno and message; the public call makes the Error
// (so that it names the call).
struct Failure {
    int err;
    std::string message;
};
template <class T> using Made = Expected<T, Failure>;

Unexpected<Failure> creationError(const Where& where, const char* verb, int err) {
    return Unexpected(Failure{
        err, fmt::format("{} of {} failed: {}", verb, where.url().string(), std::strerror(err))});
}

// Class, then owner, on the open directory.
Made<void> applyClassAndOwner(Env& env, int fd, const Where& where, const Finish& finish,
                              bool ownerNeeded) {
    if (finish.protectionClass != QRNFileManager::kProtectionClassUnchanged) {
        if (auto set =
                setProtectionClassOfDirectory(env, fd, finish.attribute, finish.protectionClass);
            !set) {
            int err = set.error();
            return Unexpected(Failure{err, fmt::format("Failed to setclass({}) on directory {}: {}",
                                                       finish.protectionClass, where.url().string(),
                                                       std::strerror(err))});
        }
    }
    if (ownerNeeded) {
        // One number for user and group: container owners have equal ones.
        if (auto chowned = env.fchown(fd, finish.owner, finish.owner); !chowned) {
            int err = chowned.error();
            return Unexpected(
                Failure{err, fmt::format("Failed to chown({},{}) {}: {}", finish.owner,
                                         finish.owner, where.url().string(), std::strerror(err))});
        }
    }
    return {};
}

// An existing directory is taken over only from root or from the owner it
// is to have: one of anybody else (reached, say, through a link a user
// planted in a directory of theirs) is left as it is and refused.
bool mayTakeOver(const struct stat& st, uid_t owner) {
    return st.st_uid == 0 || st.st_uid == owner;
}

// `made`: the mkdir's errno. A directory that was there already must be a
// directory itself, not a link to one; it is given an owner only when its
// own differs.
Made<EnvFd> finishLeaf(Env& env, const Leaf& leaf, const Where& where, int made,
                       const Finish& finish) {
    bool ownerNeeded = finish.owner != 0;
    if (made == EEXIST) {
        auto st = env.fstatat(leaf.parent, leaf.name.c_str(), AT_SYMLINK_NOFOLLOW);
        made = !st ? st.error() : S_ISDIR(st->st_mode) ? 0 : ENOTDIR;
        if (st && S_ISLNK(st->st_mode)) {
            PathResolver::logRefusal(where.url(), ELOOP);
        }
        ownerNeeded =
            ownerNeeded && st &&
            (st->st_uid != finish.owner || st->st_gid != static_cast<gid_t>(finish.owner));
        if (ownerNeeded && !mayTakeOver(*st, finish.owner)) {
            QRN_LOG_ERROR(LogCategory::Fs, "Refusing to give {} (owner {}) to {}",
                          where.url().string(), st->st_uid, finish.owner);
            made = EPERM;
        }
    }
    if (made != 0) {
        return creationError(where, finish.verb, made);
    }
    const bool classNeeded = finish.protectionClass != QRNFileManager::kProtectionClassUnchanged;
    if (!classNeeded && !ownerNeeded && !finish.keepOpen) {
        return EnvFd();
    }
    auto opened = env.openat(leaf.parent, leaf.name.c_str(), kMadeDirectoryFlags);
    if (!opened) {
        // A link or a file swapped in since the mkdir is no directory of ours.
        int err = opened.error() == ELOOP ? ENOTDIR : opened.error();
        return creationError(where, "opendir", err);
    }
    EnvFd dir(env, *opened);
    if (auto applied = applyClassAndOwner(env, dir.get(), where, finish, ownerNeeded); !applied) {
        return Unexpected(applied.error());
    }
    return dir;
}

Made<EnvFd> createDirectory(Env& env, const PathResolver& resolver, const fs::path& url,
                            bool withIntermediateDirectories, mode_t mode, Finish finish) {
    Leaf leaf{AT_FDCWD, EnvFd(), url.filename().string()};
    if (url.empty() || !isPlainName(leaf.name)) {
        // "/", "a/.." and the like: nothing to make but the whole path itself.
        leaf.name = url.string();
        auto made = url.empty() ? SysStatus(SysError(ENOENT))
                                : env.mkdirat(AT_FDCWD, leaf.name.c_str(), mode);
        finish.verb = withIntermediateDirectories ? "mkpath" : "mkdir";
        return finishLeaf(env, leaf, Where{url}, made ? 0 : made.error(), finish);
    }
    int made = 0;
    if (withIntermediateDirectories) {
        made = makePath(env, resolver, url, mode, leaf);
    } else {
        made = makeLeaf(env, resolver, url, mode, leaf);
        finish.verb = "mkdir";
    }
    return finishLeaf(env, leaf, Where{url}, made, finish);
}

// From `leaf.parent` down to the parent of `relative`'s last component,
// making missing levels: only downwards, and never through a link.
int walkToParent(Env& env, const fs::path& relative, mode_t mode, Leaf& leaf) {
    if (relative.empty() || relative.is_absolute() || !isPlainName(leaf.name)) {
        return EINVAL;
    }
    if (relative.native().find('/') == std::string::npos) {
        return 0; // a name directly in the open directory
    }
    constexpr int kFlags = O_PATH | O_DIRECTORY | O_NOFOLLOW;
    for (const fs::path& component : relative.parent_path()) {
        const std::string name = component.string();
        if (!isPlainName(name)) {
            return EINVAL;
        }
        auto next = env.openat(leaf.parent, name.c_str(), kFlags);
        if (!next && next.error() == ENOENT) {
            auto made = env.mkdirat(leaf.parent, name.c_str(), mode);
            if (!made && made.error() != EEXIST) {
                return made.error();
            }
            next = env.openat(leaf.parent, name.c_str(), kFlags);
        }
        if (!next) {
            return next.error();
        }
        leaf.setParent(EnvFd(env, *next));
    }
    return 0;
}

} // namespace

Result<EnvFd> QRNFileManager::createAndOpenDirectoryAtURL(const fs::path& url,
                                                          bool withIntermediateDirectories,
                                                          mode_t mode, uid_t owner,
                                                          int protectionClass) {
    auto made =
        createDirectory(*env_, resolver(), url, withIntermediateDirectories, mode,
                        Finish{owner, protectionClass, true, "mkpath", protectionAttribute_});
    if (!made) {
        return QRN_UNEXPECTED(QRN_POSIX_ERROR(made.error().err, "{}", made.error().message));
    }
    return std::move(*made);
}

Result<EnvFd> QRNFileManager::createAndOpenDirectoryInDirectory(const EnvFd& parent,
                                                                const fs::path& parentURL,
                                                                const fs::path& relative,
                                                                mode_t mode, uid_t owner,
                                                                int protectionClass) {
    const Where where{parentURL, &relative};
    Leaf leaf{parent.get(), EnvFd(), relative.filename().string()};
    auto made = [&]() -> Made<EnvFd> {
        if (int walked = walkToParent(*env_, relative, mode, leaf); walked != 0) {
            return creationError(where, "mkpath", walked);
        }
        auto created = env_->mkdirat(leaf.parent, leaf.name.c_str(), mode);
        return finishLeaf(*env_, leaf, where, created ? 0 : created.error(),
                          Finish{owner, protectionClass, true, "mkpath", protectionAttribute_});
    }();
    if (!made) {
        return QRN_UNEXPECTED(QRN_POSIX_ERROR(made.error().err, "{}", made.error().message));
    }
    return std::move(*made);
}

Status QRNFileManager::createDirectoryAtURL(const fs::path& url, bool withIntermediateDirectories,
                                            mode_t mode, uid_t owner, int protectionClass) {
    auto made =
        createDirectory(*env_, resolver(), url, withIntermediateDirectories, mode,
                        Finish{owner, protectionClass, false, "mkpath", protectionAttribute_});
    if (!made) {
        return QRN_UNEXPECTED(QRN_POSIX_ERROR(made.error().err, "{}", made.error().message));
    }
    return {};
}

Status QRNFileManager::createDirectoryAtURL(const fs::path& url, bool withIntermediateDirectories,
                                            mode_t mode, Owner owner) {
    return createDirectoryAtURL(url, withIntermediateDirectories, mode, owner.uid,
                                kProtectionClassUnchanged);
}

Status QRNFileManager::createDirectoryAtURL(const fs::path& url, bool withIntermediateDirectories,
                                            mode_t mode, ProtectionClass protectionClass) {
    return createDirectoryAtURL(url, withIntermediateDirectories, mode, 0, protectionClass.value);
}

Status QRNFileManager::createDirectoryAtURL(const fs::path& url, bool withIntermediateDirectories,
                                            mode_t mode) {
    return createDirectoryAtURL(url, withIntermediateDirectories, mode, 0,
                                kProtectionClassUnchanged);
}

} // namespace quarn
