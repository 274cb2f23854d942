#pragma once
// A descriptor (or directory stream) owned for one scope and released
// through the Env that made it.

#include "Daemon/fs/Env.h"

#include <utility>

namespace quarn {

class EnvFd {
public:
    EnvFd() = default;
    EnvFd(Env& env, int fd) : env_(&env), fd_(fd) {}
    EnvFd(EnvFd&& other) noexcept
        : env_(other.env_), fd_(std::exchange(other.fd_, -1)),
          dir_(std::exchange(other.dir_, nullptr)) {}
    EnvFd& operator=(EnvFd&& other) noexcept {
        if (this != &other) {
            reset();
            env_ = other.env_;
            fd_ = std::exchange(other.fd_, -1);
            dir_ = std::exchange(other.dir_, nullptr);
        }
        return *this;
    }
    EnvFd(const EnvFd&) = delete;
    EnvFd& operator=(const EnvFd&) = delete;
    ~EnvFd() { reset(); }

    int get() const { return fd_; }
    explicit operator bool() const { return fd_ >= 0; }
    DIR* dir() const { return dir_; }

    // Turns the descriptor into a directory stream (which then owns it).
    SysStatus openDirectoryStream() {
        auto dir = env_->fdopendir(fd_);
        if (!dir) {
            fd_ = -1; // handed over even on failure
            return SysError(dir.error());
        }
        dir_ = *dir;
        return {};
    }

    // Releases now, reporting the close's error.
    SysStatus close() {
        SysStatus result;
        if (dir_) {
            result = env_->closedir(dir_);
        } else if (fd_ >= 0) {
            result = env_->close(fd_);
        }
        dir_ = nullptr;
        fd_ = -1;
        return result;
    }

    void reset() { (void)close(); }

private:
    Env* env_ = nullptr;
    int fd_ = -1;
    DIR* dir_ = nullptr; // when set, owns fd_
};

} // namespace quarn
