#include "Daemon/fs/LinuxEnv.h"

#include <cerrno>
#include <cstdlib>
#include <fcntl.h>
#include <linux/fs.h>
#include <linux/openat2.h>
#include <sys/ioctl.h>
#include <sys/syscall.h>
#include <sys/xattr.h>
#include <unistd.h>

namespace quarn {

namespace {

// The one place where errno becomes a value. Never 0: a call that failed
// without saying why is reported as EIO.
int takeErrno() {
    int err = errno;
    return err != 0 ? err : EIO;
}

// Runs a call that reports failure as -1, retrying it while interrupted.
template <class F> auto retrying(F&& call) -> SysResult<decltype(call())> {
    for (;;) {
        auto value = call();
        if (value != -1) {
            return value;
        }
        int err = takeErrno();
        if (err != EINTR) {
            return SysError(err);
        }
    }
}

template <class T> SysStatus status(const SysResult<T>& result) {
    if (!result) {
        return SysError(result.error());
    }
    return {};
}

template <class T> SysResult<std::size_t> size(const SysResult<T>& result) {
    if (!result) {
        return SysError(result.error());
    }
    return static_cast<std::size_t>(*result);
}

} // namespace

SysResult<int> LinuxEnv::openat(int dirfd, const char* path, int flags, mode_t mode) {
    return retrying([&] { return ::openat(dirfd, path, flags | O_CLOEXEC, mode); });
}

SysResult<int> LinuxEnv::openat2(int dirfd, const char* path, int flags, mode_t mode,
                                 std::uint64_t resolve) {
    struct open_how how {};
    how.flags = static_cast<std::uint64_t>(flags | O_CLOEXEC);
    // The kernel refuses a mode without O_CREAT or O_TMPFILE.
    how.mode = (flags & (O_CREAT | O_TMPFILE)) != 0 ? mode : 0;
    how.resolve = resolve;
    return retrying(
        [&] { return static_cast<int>(::syscall(SYS_openat2, dirfd, path, &how, sizeof how)); });
}

SysStatus LinuxEnv::close(int fd) {
    // Never retried: Linux releases the descriptor even when interrupted, and
    // a retry could close a descriptor another thread has just been given.
    if (::close(fd) == -1) {
        int err = takeErrno();
        if (err != EINTR) {
            return SysError(err);
        }
    }
    return {};
}

SysResult<struct stat> LinuxEnv::fstatat(int dirfd, const char* path, int flags) {
    struct stat st {};
    auto r = retrying([&] { return ::fstatat(dirfd, path, &st, flags); });
    if (!r) {
        return SysError(r.error());
    }
    return st;
}

SysResult<struct stat> LinuxEnv::fstat(int fd) {
    struct stat st {};
    auto r = retrying([&] { return ::fstat(fd, &st); });
    if (!r) {
        return SysError(r.error());
    }
    return st;
}

SysStatus LinuxEnv::fchownat(int dirfd, const char* path, uid_t uid, gid_t gid, int flags) {
    return status(retrying([&] { return ::fchownat(dirfd, path, uid, gid, flags); }));
}

SysStatus LinuxEnv::fchown(int fd, uid_t uid, gid_t gid) {
    return status(retrying([&] { return ::fchown(fd, uid, gid); }));
}

SysStatus LinuxEnv::fchmodat(int dirfd, const char* path, mode_t mode, int flags) {
    return status(retrying([&] { return ::fchmodat(dirfd, path, mode, flags); }));
}

SysStatus LinuxEnv::fchmod(int fd, mode_t mode) {
    return status(retrying([&] { return ::fchmod(fd, mode); }));
}

SysStatus LinuxEnv::utimensat(int dirfd, const char* path, const struct timespec times[2],
                              int flags) {
    return status(retrying([&] { return ::utimensat(dirfd, path, times, flags); }));
}

SysStatus LinuxEnv::futimens(int fd, const struct timespec times[2]) {
    return status(retrying([&] { return ::futimens(fd, times); }));
}

SysResult<int> LinuxEnv::getFlags(int fd) {
    int flags = 0;
    auto r = retrying([&] { return ::ioctl(fd, FS_IOC_GETFLAGS, &flags); });
    if (!r) {
        return SysError(r.error());
    }
    return flags;
}

SysStatus LinuxEnv::setFlags(int fd, int flags) {
    return status(retrying([&] { return ::ioctl(fd, FS_IOC_SETFLAGS, &flags); }));
}

SysStatus LinuxEnv::mkdirat(int dirfd, const char* path, mode_t mode) {
    return status(retrying([&] { return ::mkdirat(dirfd, path, mode); }));
}

SysStatus LinuxEnv::unlinkat(int dirfd, const char* path, int flags) {
    return status(retrying([&] { return ::unlinkat(dirfd, path, flags); }));
}

SysStatus LinuxEnv::renameat(int olddirfd, const char* oldpath, int newdirfd, const char* newpath) {
    return status(retrying([&] { return ::renameat(olddirfd, oldpath, newdirfd, newpath); }));
}

SysResult<std::string> LinuxEnv::readlinkat(int dirfd, const char* path, std::size_t bufferSize) {
    std::string target(bufferSize, '\0');
    auto n = retrying([&] { return ::readlinkat(dirfd, path, target.data(), target.size()); });
    if (!n) {
        return SysError(n.error());
    }
    target.resize(static_cast<std::size_t>(*n));
    return target;
}

SysStatus LinuxEnv::symlinkat(const char* target, int dirfd, const char* path) {
    return status(retrying([&] { return ::symlinkat(target, dirfd, path); }));
}

SysStatus LinuxEnv::mknodat(int dirfd, const char* path, mode_t mode, dev_t dev) {
    return status(retrying([&] { return ::mknodat(dirfd, path, mode, dev); }));
}

SysResult<std::string> LinuxEnv::realpath(const char* path) {
    char* resolved = ::realpath(path, nullptr);
    if (!resolved) {
        return SysError(takeErrno());
    }
    std::string result(resolved);
    std::free(resolved);
    return result;
}

SysResult<std::string> LinuxEnv::mkdtemp(std::string pathTemplate) {
    if (!::mkdtemp(pathTemplate.data())) {
        return SysError(takeErrno());
    }
    return pathTemplate;
}

SysResult<std::size_t> LinuxEnv::fgetxattr(int fd, const char* name, void* value,
                                           std::size_t size) {
    return quarn::size(retrying([&] { return ::fgetxattr(fd, name, value, size); }));
}

SysStatus LinuxEnv::fsetxattr(int fd, const char* name, const void* value, std::size_t size,
                              int flags) {
    return status(retrying([&] { return ::fsetxattr(fd, name, value, size, flags); }));
}

SysResult<std::size_t> LinuxEnv::flistxattr(int fd, char* list, std::size_t size) {
    return quarn::size(retrying([&] { return ::flistxattr(fd, list, size); }));
}

SysStatus LinuxEnv::fremovexattr(int fd, const char* name) {
    return status(retrying([&] { return ::fremovexattr(fd, name); }));
}

SysResult<std::size_t> LinuxEnv::copyFileRange(int fdIn, int fdOut, std::size_t length) {
    return quarn::size(
        retrying([&] { return ::copy_file_range(fdIn, nullptr, fdOut, nullptr, length, 0); }));
}

SysStatus LinuxEnv::cloneFile(int destFd, int srcFd) {
    return status(retrying([&] { return ::ioctl(destFd, FICLONE, srcFd); }));
}

SysResult<std::size_t> LinuxEnv::read(int fd, void* buffer, std::size_t size) {
    return quarn::size(retrying([&] { return ::read(fd, buffer, size); }));
}

SysResult<std::size_t> LinuxEnv::write(int fd, const void* buffer, std::size_t size) {
    return quarn::size(retrying([&] { return ::write(fd, buffer, size); }));
}

SysResult<DIR*> LinuxEnv::fdopendir(int fd) {
    DIR* dir = ::fdopendir(fd);
    if (!dir) {
        int err = takeErrno();
        ::close(fd); // the descriptor was handed over either way
        return SysError(err);
    }
    return dir;
}

SysResult<struct dirent*> LinuxEnv::readdir(DIR* dir) {
    errno = 0;
    struct dirent* entry = ::readdir(dir);
    if (!entry && errno != 0) {
        return SysError(takeErrno());
    }
    return entry;
}

SysStatus LinuxEnv::closedir(DIR* dir) {
    if (::closedir(dir) == -1) {
        int err = takeErrno();
        if (err != EINTR) {
            return SysError(err);
        }
    }
    return {};
}

SysResult<acl_t> LinuxEnv::aclGetFd(int fd) {
    acl_t acl = ::acl_get_fd(fd);
    if (!acl) {
        return SysError(takeErrno());
    }
    return acl;
}

SysStatus LinuxEnv::aclSetFd(int fd, acl_t acl) {
    return status(retrying([&] { return ::acl_set_fd(fd, acl); }));
}

SysResult<acl_t> LinuxEnv::aclGetFile(const char* path, acl_type_t type) {
    acl_t acl = ::acl_get_file(path, type);
    if (!acl) {
        return SysError(takeErrno());
    }
    return acl;
}

SysStatus LinuxEnv::aclSetFile(const char* path, acl_type_t type, acl_t acl) {
    return status(retrying([&] { return ::acl_set_file(path, type, acl); }));
}

} // namespace quarn
