#include "Daemon/fs/TreeCopier.h"

#include "Daemon/fs/EnvFd.h"

#include <cerrno>
#include <climits>
#include <fcntl.h>
#include <string_view>
#include <vector>

namespace quarn {

namespace {

constexpr int kReadFlags = O_RDONLY | O_NOFOLLOW | O_NONBLOCK;

// The destination cannot hold this (kind of) data: not a reason to fail.
bool unsupported(int err) {
    return err == ENOTSUP || err == EOPNOTSUPP;
}

// The call cannot be used between these two files; another way may work.
bool tryAnotherWay(int err) {
    return err == EXDEV || err == EINVAL || err == ENOSYS || err == ENOTTY || unsupported(err);
}

} // namespace

int TreeCopier::copy(int srcParentFd, const char* srcName, int dstParentFd, const char* dstName) {
    depth0_ = true;
    madeDestination_ = false;
    auto st = env_.fstatat(srcParentFd, srcName, AT_SYMLINK_NOFOLLOW);
    if (!st) {
        return st.error();
    }
    if (!S_ISDIR(st->st_mode)) {
        return copyLeaf(srcParentFd, srcName, dstParentFd, dstName, *st);
    }
    Stacks stacks{DirectoryStack(env_, std::string()), DirectoryStack(env_, std::string())};
    if (int err = enterDirectory(stacks, srcParentFd, srcName, dstParentFd, dstName)) {
        return err;
    }
    return copyBelow(stacks);
}

int TreeCopier::copyBelow(Stacks& stacks) {
    while (!stacks.src.empty()) {
        auto next = stacks.src.next();
        if (!next) {
            return next.error();
        }
        const int err =
            *next == nullptr ? leaveDirectory(stacks) : copyChild(stacks, (*next)->name.c_str());
        if (err != 0) {
            return err;
        }
    }
    return stacks.src.closeError();
}

int TreeCopier::copyChild(Stacks& stacks, const char* name) {
    const int srcFd = stacks.src.fd();
    auto st = env_.fstatat(srcFd, name, AT_SYMLINK_NOFOLLOW);
    if (!st) {
        return st.error();
    }
    if (!S_ISDIR(st->st_mode)) {
        return copyLeaf(srcFd, name, stacks.dst.fd(), name, *st);
    }
    if (st->st_dev == dstRootDev_ && st->st_ino == dstRootIno_) {
        return 0; // the copy itself, inside its own source
    }
    return enterDirectory(stacks, srcFd, name, stacks.dst.fd(), name);
}

int TreeCopier::copyLeaf(int srcParentFd, const char* srcName, int dstParentFd, const char* dstName,
                         const struct stat& st) {
    switch (st.st_mode & S_IFMT) {
    case S_IFREG:
        return copyFile(srcParentFd, srcName, dstParentFd, dstName, st);
    case S_IFLNK:
        return copySymlink(srcParentFd, srcName, dstParentFd, dstName, st);
    default:
        return copyNode(dstParentFd, dstName, st);
    }
}

int TreeCopier::enterDirectory(Stacks& stacks, int srcParentFd, const char* srcName,
                               int dstParentFd, const char* dstName) {
    // Made private first: the real mode comes after the contents.
    if (auto made = env_.mkdirat(dstParentFd, dstName, 0700); !made) {
        return made.error();
    }
    const bool root = depth0_;
    madeDestination_ = madeDestination_ || root;
    depth0_ = false;
    if (auto src = stacks.src.push(srcParentFd, srcName); !src) {
        return src.error();
    }
    auto dst = stacks.dst.push(dstParentFd, dstName, false);
    if (!dst) {
        return dst.error();
    }
    if (root) {
        dstRootDev_ = dst->st_dev;
        dstRootIno_ = dst->st_ino;
    }
    return 0;
}

int TreeCopier::leaveDirectory(Stacks& stacks) {
    auto st = env_.fstat(stacks.src.fd());
    if (!st) {
        return st.error();
    }
    if (int err = copyExtendedAttributes(stacks.src.fd(), stacks.dst.fd())) {
        return err;
    }
    if (int err = applyOwnerModeTimes(stacks.dst.fd(), *st)) {
        return err;
    }
    auto src = stacks.src.pop();
    auto dst = stacks.dst.pop();
    return !src ? src.error() : !dst ? dst.error() : 0;
}

int TreeCopier::copyFile(int srcParentFd, const char* srcName, int dstParentFd, const char* dstName,
                         const struct stat& st) {
    auto src = env_.openat(srcParentFd, srcName, kReadFlags);
    if (!src) {
        return src.error();
    }
    EnvFd srcFile(env_, *src);
    auto dst = env_.openat(dstParentFd, dstName, O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW,
                           S_IRUSR | S_IWUSR);
    if (!dst) {
        return dst.error();
    }
    madeDestination_ = madeDestination_ || depth0_;
    depth0_ = false;
    EnvFd dstFile(env_, *dst);
    if (st.st_size > 0) {
        if (int err = copyData(srcFile.get(), dstFile.get())) {
            return err;
        }
    }
    if (int err = copyExtendedAttributes(srcFile.get(), dstFile.get())) {
        return err;
    }
    if (int err = applyOwnerModeTimes(dstFile.get(), st)) {
        return err;
    }
    auto closed = dstFile.close(); // a delayed write error shows here
    return closed ? 0 : closed.error();
}

int TreeCopier::copyData(int srcFd, int dstFd) {
    if (cloneWorks_) {
        auto cloned = env_.cloneFile(dstFd, srcFd);
        if (cloned) {
            return 0;
        }
        if (!tryAnotherWay(cloned.error())) {
            return cloned.error();
        }
        cloneWorks_ = false;
    }
    if (copyRangeWorks_) {
        bool first = true;
        for (;;) {
            auto copied = env_.copyFileRange(srcFd, dstFd, std::size_t{1} << 30);
            if (copied && *copied == 0) {
                return 0;
            }
            if (!copied) {
                if (!first || !tryAnotherWay(copied.error())) {
                    return copied.error();
                }
                copyRangeWorks_ = false;
                break;
            }
            first = false;
        }
    }
    return copyByReading(srcFd, dstFd);
}

int TreeCopier::copyByReading(int srcFd, int dstFd) {
    std::vector<char> buffer(std::size_t{1} << 20);
    for (;;) {
        auto n = env_.read(srcFd, buffer.data(), buffer.size());
        if (!n) {
            return n.error();
        }
        if (*n == 0) {
            return 0;
        }
        std::size_t done = 0;
        while (done < *n) {
            auto written = env_.write(dstFd, buffer.data() + done, *n - done);
            if (!written) {
                return written.error();
            }
            done += *written;
        }
    }
}

int TreeCopier::copySymlink(int srcParentFd, const char* srcName, int dstParentFd,
                            const char* dstName, const struct stat& st) {
    auto target = env_.readlinkat(srcParentFd, srcName, PATH_MAX);
    if (!target) {
        return target.error();
    }
    if (auto made = env_.symlinkat(target->c_str(), dstParentFd, dstName); !made) {
        return made.error();
    }
    madeDestination_ = madeDestination_ || depth0_;
    depth0_ = false;
    // Links carry no mode of their own on Linux; owner and times they do.
    if (auto owned = env_.fchownat(dstParentFd, dstName, st.st_uid, st.st_gid, AT_SYMLINK_NOFOLLOW);
        !owned) {
        return owned.error();
    }
    const struct timespec times[2] = {st.st_atim, st.st_mtim};
    auto timed = env_.utimensat(dstParentFd, dstName, times, AT_SYMLINK_NOFOLLOW);
    return timed ? 0 : timed.error();
}

int TreeCopier::copyNode(int dstParentFd, const char* dstName, const struct stat& st) {
    // Fifos, sockets and devices: made anew, never opened (that could block
    // or act on a device).
    if (auto made = env_.mknodat(dstParentFd, dstName, st.st_mode & (S_IFMT | 07777), st.st_rdev);
        !made) {
        return made.error();
    }
    madeDestination_ = madeDestination_ || depth0_;
    depth0_ = false;
    if (auto owned = env_.fchownat(dstParentFd, dstName, st.st_uid, st.st_gid, AT_SYMLINK_NOFOLLOW);
        !owned) {
        return owned.error();
    }
    if (auto moded = env_.fchmodat(dstParentFd, dstName, st.st_mode & 07777, 0); !moded) {
        return moded.error();
    }
    const struct timespec times[2] = {st.st_atim, st.st_mtim};
    auto timed = env_.utimensat(dstParentFd, dstName, times, AT_SYMLINK_NOFOLLOW);
    return timed ? 0 : timed.error();
}

int TreeCopier::copyExtendedAttributes(int srcFd, int dstFd) {
    auto size = env_.flistxattr(srcFd, nullptr, 0);
    if (!size) {
        return unsupported(size.error()) ? 0 : size.error();
    }
    if (*size == 0) {
        return 0;
    }
    std::vector<char> names(*size);
    auto listed = env_.flistxattr(srcFd, names.data(), names.size());
    if (!listed) {
        return listed.error();
    }
    for (std::size_t at = 0; at < *listed;) {
        const char* name = names.data() + at;
        at += std::string_view(name).size() + 1;
        if (int err = copyAttribute(srcFd, dstFd, name)) {
            return err;
        }
    }
    return 0;
}

int TreeCopier::copyAttribute(int srcFd, int dstFd, const char* name) {
    auto size = env_.fgetxattr(srcFd, name, nullptr, 0);
    if (!size) {
        return size.error() == ENODATA ? 0 : size.error(); // removed meanwhile
    }
    std::vector<char> value(*size);
    auto got = env_.fgetxattr(srcFd, name, value.data(), value.size());
    if (!got) {
        return got.error();
    }
    auto set = env_.fsetxattr(dstFd, name, value.data(), *got, 0);
    return !set && !unsupported(set.error()) ? set.error() : 0;
}

int TreeCopier::applyOwnerModeTimes(int dstFd, const struct stat& st) {
    if (auto owned = env_.fchown(dstFd, st.st_uid, st.st_gid); !owned) {
        return owned.error();
    }
    if (auto moded = env_.fchmod(dstFd, st.st_mode & 07777); !moded) {
        return moded.error();
    }
    const struct timespec times[2] = {st.st_atim, st.st_mtim};
    auto timed = env_.futimens(dstFd, times);
    return timed ? 0 : timed.error();
}

} // namespace quarn
