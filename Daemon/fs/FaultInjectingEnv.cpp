#include "Daemon/fs/FaultInjectingEnv.h"

#include <limits>

namespace quarn {

FaultInjectingEnv::FaultInjectingEnv(std::shared_ptr<Env> inner) : inner_(std::move(inner)) {}

void FaultInjectingEnv::failCall(EnvCall call, std::uint64_t nth, int err) {
    std::lock_guard guard(mutex_);
    auto at = counts_[static_cast<std::size_t>(call)] + nth;
    rules_.push_back({call, at, at, err});
}

void FaultInjectingEnv::failCallsFrom(EnvCall call, std::uint64_t nth, int err) {
    std::lock_guard guard(mutex_);
    auto at = counts_[static_cast<std::size_t>(call)] + nth;
    rules_.push_back({call, at, std::numeric_limits<std::uint64_t>::max(), err});
}

void FaultInjectingEnv::clearFailures() {
    std::lock_guard guard(mutex_);
    rules_.clear();
}

std::uint64_t FaultInjectingEnv::count(EnvCall call) const {
    std::lock_guard guard(mutex_);
    return counts_[static_cast<std::size_t>(call)];
}

std::uint64_t FaultInjectingEnv::injectedFailures() const {
    std::lock_guard guard(mutex_);
    return injected_;
}

void FaultInjectingEnv::setHook(Hook hook) {
    std::lock_guard guard(mutex_);
    hook_ = std::move(hook);
}

std::optional<int> FaultInjectingEnv::enter(EnvCall call) {
    Hook hook;
    std::uint64_t number = 0;
    std::optional<int> err;
    {
        std::lock_guard guard(mutex_);
        number = ++counts_[static_cast<std::size_t>(call)];
        hook = hook_;
        for (const auto& rule : rules_) {
            if (rule.call == call && number >= rule.first && number <= rule.last) {
                err = rule.err;
                ++injected_;
                break;
            }
        }
    }
    if (hook) {
        hook(call, number);
    }
    return err;
}

// Forwards one call unless a rule makes it fail.
#define QRN_FORWARD(kind, call)                                                                    \
    do {                                                                                           \
        if (auto err = enter(EnvCall::kind)) {                                                     \
            return SysError(*err);                                                                 \
        }                                                                                          \
        return inner_->call;                                                                       \
    } while (0)

SysResult<int> FaultInjectingEnv::openat(int dirfd, const char* path, int flags, mode_t mode) {
    QRN_FORWARD(Open, openat(dirfd, path, flags, mode));
}

SysResult<int> FaultInjectingEnv::openat2(int dirfd, const char* path, int flags, mode_t mode,
                                          std::uint64_t resolve) {
    QRN_FORWARD(Openat2, openat2(dirfd, path, flags, mode, resolve));
}

SysStatus FaultInjectingEnv::close(int fd) {
    if (auto err = enter(EnvCall::Close)) {
        (void)inner_->close(fd); // a failed close still releases the descriptor
        return SysError(*err);
    }
    return inner_->close(fd);
}

SysResult<struct stat> FaultInjectingEnv::fstatat(int dirfd, const char* path, int flags) {
    QRN_FORWARD(Stat, fstatat(dirfd, path, flags));
}

SysResult<struct stat> FaultInjectingEnv::fstat(int fd) {
    QRN_FORWARD(Stat, fstat(fd));
}

SysStatus FaultInjectingEnv::fchownat(int dirfd, const char* path, uid_t uid, gid_t gid,
                                      int flags) {
    QRN_FORWARD(Chown, fchownat(dirfd, path, uid, gid, flags));
}

SysStatus FaultInjectingEnv::fchown(int fd, uid_t uid, gid_t gid) {
    QRN_FORWARD(Chown, fchown(fd, uid, gid));
}

SysStatus FaultInjectingEnv::fchmodat(int dirfd, const char* path, mode_t mode, int flags) {
    QRN_FORWARD(Chmod, fchmodat(dirfd, path, mode, flags));
}

SysStatus FaultInjectingEnv::fchmod(int fd, mode_t mode) {
    QRN_FORWARD(Chmod, fchmod(fd, mode));
}

SysStatus FaultInjectingEnv::utimensat(int dirfd, const char* path, const struct timespec times[2],
                                       int flags) {
    QRN_FORWARD(Utimens, utimensat(dirfd, path, times, flags));
}

SysStatus FaultInjectingEnv::futimens(int fd, const struct timespec times[2]) {
    QRN_FORWARD(Utimens, futimens(fd, times));
}

SysResult<int> FaultInjectingEnv::getFlags(int fd) {
    QRN_FORWARD(GetFlags, getFlags(fd));
}

SysStatus FaultInjectingEnv::setFlags(int fd, int flags) {
    QRN_FORWARD(SetFlags, setFlags(fd, flags));
}

SysStatus FaultInjectingEnv::mkdirat(int dirfd, const char* path, mode_t mode) {
    QRN_FORWARD(Mkdir, mkdirat(dirfd, path, mode));
}

SysStatus FaultInjectingEnv::unlinkat(int dirfd, const char* path, int flags) {
    QRN_FORWARD(Unlink, unlinkat(dirfd, path, flags));
}

SysStatus FaultInjectingEnv::renameat(int olddirfd, const char* oldpath, int newdirfd,
                                      const char* newpath) {
    QRN_FORWARD(Rename, renameat(olddirfd, oldpath, newdirfd, newpath));
}

SysResult<std::string> FaultInjectingEnv::readlinkat(int dirfd, const char* path,
                                                     std::size_t bufferSize) {
    QRN_FORWARD(Readlink, readlinkat(dirfd, path, bufferSize));
}

SysStatus FaultInjectingEnv::symlinkat(const char* target, int dirfd, const char* path) {
    QRN_FORWARD(Symlink, symlinkat(target, dirfd, path));
}

SysStatus FaultInjectingEnv::mknodat(int dirfd, const char* path, mode_t mode, dev_t dev) {
    QRN_FORWARD(Mknod, mknodat(dirfd, path, mode, dev));
}

SysResult<std::string> FaultInjectingEnv::realpath(const char* path) {
    QRN_FORWARD(Realpath, realpath(path));
}

SysResult<std::string> FaultInjectingEnv::mkdtemp(std::string pathTemplate) {
    QRN_FORWARD(Mkdtemp, mkdtemp(std::move(pathTemplate)));
}

SysResult<std::size_t> FaultInjectingEnv::fgetxattr(int fd, const char* name, void* value,
                                                    std::size_t size) {
    QRN_FORWARD(GetXattr, fgetxattr(fd, name, value, size));
}

SysStatus FaultInjectingEnv::fsetxattr(int fd, const char* name, const void* value,
                                       std::size_t size, int flags) {
    QRN_FORWARD(SetXattr, fsetxattr(fd, name, value, size, flags));
}

SysResult<std::size_t> FaultInjectingEnv::flistxattr(int fd, char* list, std::size_t size) {
    QRN_FORWARD(ListXattr, flistxattr(fd, list, size));
}

SysStatus FaultInjectingEnv::fremovexattr(int fd, const char* name) {
    QRN_FORWARD(RemoveXattr, fremovexattr(fd, name));
}

SysResult<std::size_t> FaultInjectingEnv::copyFileRange(int fdIn, int fdOut, std::size_t length) {
    QRN_FORWARD(CopyRange, copyFileRange(fdIn, fdOut, length));
}

SysStatus FaultInjectingEnv::cloneFile(int destFd, int srcFd) {
    QRN_FORWARD(Clone, cloneFile(destFd, srcFd));
}

SysResult<std::size_t> FaultInjectingEnv::read(int fd, void* buffer, std::size_t size) {
    QRN_FORWARD(Read, read(fd, buffer, size));
}

SysResult<std::size_t> FaultInjectingEnv::write(int fd, const void* buffer, std::size_t size) {
    QRN_FORWARD(Write, write(fd, buffer, size));
}

SysResult<DIR*> FaultInjectingEnv::fdopendir(int fd) {
    if (auto err = enter(EnvCall::OpenDir)) {
        (void)inner_->close(fd); // the descriptor was handed over either way
        return SysError(*err);
    }
    return inner_->fdopendir(fd);
}

SysResult<struct dirent*> FaultInjectingEnv::readdir(DIR* dir) {
    QRN_FORWARD(ReadDir, readdir(dir));
}

SysStatus FaultInjectingEnv::closedir(DIR* dir) {
    if (auto err = enter(EnvCall::CloseDir)) {
        (void)inner_->closedir(dir); // released even when reported as failed
        return SysError(*err);
    }
    return inner_->closedir(dir);
}

SysResult<acl_t> FaultInjectingEnv::aclGetFd(int fd) {
    QRN_FORWARD(AclGet, aclGetFd(fd));
}

SysStatus FaultInjectingEnv::aclSetFd(int fd, acl_t acl) {
    QRN_FORWARD(AclSet, aclSetFd(fd, acl));
}

SysResult<acl_t> FaultInjectingEnv::aclGetFile(const char* path, acl_type_t type) {
    QRN_FORWARD(AclGet, aclGetFile(path, type));
}

SysStatus FaultInjectingEnv::aclSetFile(const char* path, acl_type_t type, acl_t acl) {
    QRN_FORWARD(AclSet, aclSetFile(path, type, acl));
}

#undef QRN_FORWARD

} // namespace quarn
