#pragma once
// The one seam between the file manager and the kernel: every system call the
// file manager makes goes through an Env, so tests can count calls and make
// any one of them fail (FaultInjectingEnv) without touching the code under
// test.
//
// Each call returns its value or the errno it failed with (SysResult). EINTR
// is retried inside; descriptors are always opened close-on-exec.
//
// The file manager takes the Env installed in its daemon context
// (`context.install<Env>(...)`, before the manager is first used) and the
// system's own (LinuxEnv) when none is.

#include "Daemon/support/Expected.h"

#include <dirent.h>
#include <sys/acl.h>
#include <sys/stat.h>
#include <sys/types.h>

#include <cstddef>
#include <cstdint>
#include <string>

namespace quarn {

// A system call's value, or the errno it failed with.
template <class T> using SysResult = Expected<T, int>;
using SysStatus = Expected<void, int>;

inline Unexpected<int> SysError(int err) {
    return Unexpected<int>(err);
}

// The kinds of call, for counting and fault injection. Related calls share a
// kind (fstat and fstatat are both Stat) so a test names what it means.
enum class EnvCall : std::size_t {
    Open,
    Close,
    Stat,
    Mkdir,
    Unlink,
    Rename,
    Readlink,
    Realpath,
    Symlink,
    Mknod,
    Chown,
    Chmod,
    GetFlags,
    SetFlags,
    GetXattr,
    SetXattr,
    ListXattr,
    RemoveXattr,
    CopyRange,
    Clone,
    Read,
    Write,
    OpenDir,
    ReadDir,
    CloseDir,
    Mkdtemp,
    Utimens,
    AclGet,
    AclSet,
    Openat2,
    Count_
};

const char* envCallName(EnvCall call);

class Env {
public:
    virtual ~Env() = default;

    // Descriptors. O_CLOEXEC is always added.
    virtual SysResult<int> openat(int dirfd, const char* path, int flags, mode_t mode = 0) = 0;
    // openat2(2): `resolve` holds RESOLVE_* flags restricting how the path
    // is walked (e.g. no symbolic link anywhere in it).
    virtual SysResult<int> openat2(int dirfd, const char* path, int flags, mode_t mode,
                                   std::uint64_t resolve) = 0;
    // The descriptor is released even when this reports an error.
    virtual SysStatus close(int fd) = 0;

    // Metadata.
    virtual SysResult<struct stat> fstatat(int dirfd, const char* path, int flags) = 0;
    virtual SysResult<struct stat> fstat(int fd) = 0;
    virtual SysStatus fchownat(int dirfd, const char* path, uid_t uid, gid_t gid, int flags) = 0;
    virtual SysStatus fchown(int fd, uid_t uid, gid_t gid) = 0;
    virtual SysStatus fchmodat(int dirfd, const char* path, mode_t mode, int flags) = 0;
    virtual SysStatus fchmod(int fd, mode_t mode) = 0;
    virtual SysStatus utimensat(int dirfd, const char* path, const struct timespec times[2],
                                int flags) = 0;
    virtual SysStatus futimens(int fd, const struct timespec times[2]) = 0;
    // Inode flags (FS_IOC_GETFLAGS / FS_IOC_SETFLAGS), e.g. FS_IMMUTABLE_FL.
    virtual SysResult<int> getFlags(int fd) = 0;
    virtual SysStatus setFlags(int fd, int flags) = 0;

    // Names.
    virtual SysStatus mkdirat(int dirfd, const char* path, mode_t mode) = 0;
    virtual SysStatus unlinkat(int dirfd, const char* path, int flags) = 0;
    virtual SysStatus renameat(int olddirfd, const char* oldpath, int newdirfd,
                               const char* newpath) = 0;
    virtual SysResult<std::string> readlinkat(int dirfd, const char* path,
                                              std::size_t bufferSize) = 0;
    virtual SysStatus symlinkat(const char* target, int dirfd, const char* path) = 0;
    virtual SysStatus mknodat(int dirfd, const char* path, mode_t mode, dev_t dev) = 0;
    virtual SysResult<std::string> realpath(const char* path) = 0;
    // Fills in the trailing "XXXXXX" of the template; returns the made path.
    virtual SysResult<std::string> mkdtemp(std::string pathTemplate) = 0;

    // Extended attributes (POSIX ACLs are the "system.posix_acl_*" ones).
    virtual SysResult<std::size_t> fgetxattr(int fd, const char* name, void* value,
                                             std::size_t size) = 0;
    virtual SysStatus fsetxattr(int fd, const char* name, const void* value, std::size_t size,
                                int flags) = 0;
    virtual SysResult<std::size_t> flistxattr(int fd, char* list, std::size_t size) = 0;
    virtual SysStatus fremovexattr(int fd, const char* name) = 0;

    // Data. copyFileRange uses and advances both files' offsets; 0 = end.
    virtual SysResult<std::size_t> copyFileRange(int fdIn, int fdOut, std::size_t length) = 0;
    virtual SysStatus cloneFile(int destFd, int srcFd) = 0; // FICLONE
    virtual SysResult<std::size_t> read(int fd, void* buffer, std::size_t size) = 0;
    virtual SysResult<std::size_t> write(int fd, const void* buffer, std::size_t size) = 0;

    // Directory streams. fdopendir takes the descriptor over; closedir
    // releases both even when it reports an error. readdir gives nullptr at
    // the end.
    virtual SysResult<DIR*> fdopendir(int fd) = 0;
    virtual SysResult<struct dirent*> readdir(DIR* dir) = 0;
    virtual SysStatus closedir(DIR* dir) = 0;

    // POSIX ACLs (libacl); the caller frees what it gets with acl_free.
    virtual SysResult<acl_t> aclGetFd(int fd) = 0;
    virtual SysStatus aclSetFd(int fd, acl_t acl) = 0;
    virtual SysResult<acl_t> aclGetFile(const char* path, acl_type_t type) = 0;
    virtual SysStatus aclSetFile(const char* path, acl_type_t type, acl_t acl) = 0;
};

} // namespace quarn
