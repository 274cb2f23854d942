#pragma once
// The Env of the running system: each call is the Linux system call (or
// libacl function) of the same name.

#include "Daemon/fs/Env.h"

namespace quarn {

class LinuxEnv final : public Env {
public:
    SysResult<int> openat(int dirfd, const char* path, int flags, mode_t mode) override;
    SysResult<int> openat2(int dirfd, const char* path, int flags, mode_t mode,
                           std::uint64_t resolve) override;
    SysStatus close(int fd) override;

    SysResult<struct stat> fstatat(int dirfd, const char* path, int flags) override;
    SysResult<struct stat> fstat(int fd) override;
    SysStatus fchownat(int dirfd, const char* path, uid_t uid, gid_t gid, int flags) override;
    SysStatus fchown(int fd, uid_t uid, gid_t gid) override;
    SysStatus fchmodat(int dirfd, const char* path, mode_t mode, int flags) override;
    SysStatus fchmod(int fd, mode_t mode) override;
    SysStatus utimensat(int dirfd, const char* path, const struct timespec times[2],
                        int flags) override;
    SysStatus futimens(int fd, const struct timespec times[2]) override;
    SysResult<int> getFlags(int fd) override;
    SysStatus setFlags(int fd, int flags) override;

    SysStatus mkdirat(int dirfd, const char* path, mode_t mode) override;
    SysStatus unlinkat(int dirfd, const char* path, int flags) override;
    SysStatus renameat(int olddirfd, const char* oldpath, int newdirfd,
                       const char* newpath) override;
    SysResult<std::string> readlinkat(int dirfd, const char* path, std::size_t bufferSize) override;
    SysStatus symlinkat(const char* target, int dirfd, const char* path) override;
    SysStatus mknodat(int dirfd, const char* path, mode_t mode, dev_t dev) override;
    SysResult<std::string> realpath(const char* path) override;
    SysResult<std::string> mkdtemp(std::string pathTemplate) override;

    SysResult<std::size_t> fgetxattr(int fd, const char* name, void* value,
                                     std::size_t size) override;
    SysStatus fsetxattr(int fd, const char* name, const void* value, std::size_t size,
                        int flags) override;
    SysResult<std::size_t> flistxattr(int fd, char* list, std::size_t size) override;
    SysStatus fremovexattr(int fd, const char* name) override;

    SysResult<std::size_t> copyFileRange(int fdIn, int fdOut, std::size_t length) override;
    SysStatus cloneFile(int destFd, int srcFd) override;
    SysResult<std::size_t> read(int fd, void* buffer, std::size_t size) override;
    SysResult<std::size_t> write(int fd, const void* buffer, std::size_t size) override;

    SysResult<DIR*> fdopendir(int fd) override;
    SysResult<struct dirent*> readdir(DIR* dir) override;
    SysStatus closedir(DIR* dir) override;

    SysResult<acl_t> aclGetFd(int fd) override;
    SysStatus aclSetFd(int fd, acl_t acl) override;
    SysResult<acl_t> aclGetFile(const char* path, acl_type_t type) override;
    SysStatus aclSetFile(const char* path, acl_type_t type, acl_t acl) override;
};

} // namespace quarn
