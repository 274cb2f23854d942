#pragma once
// An Env for tests: forwards to another Env, counts every call by kind, and
// makes chosen calls fail with a chosen errno ("the 3rd unlinkat from now
// fails with EIO"). A hook runs before each call so a test can stop the
// process at an exact point (kill tests).

#include "Daemon/fs/Env.h"

#include <array>
#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <vector>

namespace quarn {

class FaultInjectingEnv final : public Env {
public:
    using Hook = std::function<void(EnvCall call, std::uint64_t number)>;

    explicit FaultInjectingEnv(std::shared_ptr<Env> inner);

    // The nth call of this kind counted from now (1 = the next one) fails with err.
    void failCall(EnvCall call, std::uint64_t nth, int err);
    // Every call of this kind from the nth one counted from now fails with err.
    void failCallsFrom(EnvCall call, std::uint64_t nth, int err);
    void clearFailures();
    // Calls of this kind made so far, failed ones included.
    std::uint64_t count(EnvCall call) const;
    std::uint64_t injectedFailures() const;
    // Runs before every call (outside any lock) with the call's number.
    void setHook(Hook hook);

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

private:
    struct Rule {
        EnvCall call;
        std::uint64_t first; // absolute call numbers, inclusive
        std::uint64_t last;
        int err;
    };

    // Counts the call, runs the hook, and answers the errno to fail with.
    std::optional<int> enter(EnvCall call);

    std::shared_ptr<Env> inner_;
    mutable std::mutex mutex_; // guards counts_, rules_, injected_ and hook_
    std::array<std::uint64_t, static_cast<std::size_t>(EnvCall::Count_)> counts_{};
    std::vector<Rule> rules_;
    std::uint64_t injected_ = 0;
    Hook hook_;
};

} // namespace quarn
