#include "Daemon/fs/DirectoryStack.h"

#include "Daemon/fs/DirectoryEntryName.h"
#include "Daemon/support/Log.h"

#include <cerrno>
#include <cstring>
#include <fcntl.h>

namespace quarn {

namespace {

constexpr int kDirectoryFlags = O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_NONBLOCK;

} // namespace

DirectoryStack::DirectoryStack(Env& env, std::string basePath, std::size_t openLevels)
    : env_(env), openLevels_(openLevels < 2 ? 2 : openLevels), path_(std::move(basePath)),
      basePathSize_(path_.size()) {}

DirectoryStack::~DirectoryStack() {
    clear();
}

SysResult<struct stat> DirectoryStack::push(int parentFd, const char* name, bool list) {
    auto opened = env_.openat(parentFd, name, kDirectoryFlags);
    if (!opened) {
        return SysError(opened.error());
    }
    Level level;
    level.dir = EnvFd(env_, *opened);
    auto st = env_.fstat(level.dir.get());
    if (!st) {
        return SysError(st.error());
    }
    if (list) {
        if (auto stream = level.dir.openDirectoryStream(); !stream) {
            return SysError(stream.error());
        }
    }
    // The parent (the current level) stays open: at least two levels are.
    if (openDescriptors() >= openLevels_) {
        evictOldest();
    }
    level.dev = st->st_dev;
    level.ino = st->st_ino;
    level.nameAt = appendToPath(name);
    if (level.nameAt > 0 && path_[level.nameAt] == '/') {
        ++level.nameAt; // the separator appendToPath added
    }
    level.pathEnd = path_.size();
    levels_.push_back(std::move(level));
    return *st;
}

void DirectoryStack::evictOldest() {
    Level& level = levels_[firstOpen_];
    if (level.dir.dir() != nullptr) {
        // Its stream goes with the descriptor: keep what it has not listed.
        auto unlisted = std::make_unique<Unlisted>();
        for (;;) {
            auto read = env_.readdir(level.dir.dir());
            if (!read) {
                unlisted->err = read.error();
                break;
            }
            if (*read == nullptr) {
                break;
            }
            if (!DirectoryEntryName::isDot((*read)->d_name)) {
                unlisted->names.push_back(Child{(*read)->d_name, (*read)->d_type});
            }
        }
        level.unlisted = std::move(unlisted);
    }
    close(level.dir);
    ++firstOpen_;
}

SysStatus DirectoryStack::pop() {
    Level popped = std::move(levels_.back());
    levels_.pop_back();
    SysStatus status;
    if (!levels_.empty() && firstOpen_ > levels_.size() - 1) {
        status = reopen(levels_.back(), popped.dir.get());
        firstOpen_ = levels_.size() - 1;
    }
    close(popped.dir);
    if (!status) {
        dropLevels(); // the path stays the popped level's, for messages
        return status;
    }
    if (levels_.empty()) {
        firstOpen_ = 0;
    }
    truncatePath(levels_.empty() ? basePathSize_ : levels_.back().pathEnd);
    return status;
}

SysStatus DirectoryStack::reopen(Level& level, int childFd) {
    const std::string where = path_.substr(0, level.pathEnd);
    auto opened = env_.openat(childFd, "..", kDirectoryFlags);
    if (!opened) {
        QRN_LOG_ERROR(LogCategory::Fs, "Could not open {} again: {}", where,
                      std::strerror(opened.error()));
        return SysError(opened.error());
    }
    EnvFd dir(env_, *opened);
    auto st = env_.fstat(dir.get());
    if (!st) {
        QRN_LOG_ERROR(LogCategory::Fs, "Could not stat {} again: {}", where,
                      std::strerror(st.error()));
        return SysError(st.error());
    }
    if (st->st_dev != level.dev || st->st_ino != level.ino) {
        QRN_LOG_ERROR(LogCategory::Fs,
                      "{} is no longer the directory walked into (moved meanwhile); stopping",
                      where);
        close(dir);
        return SysError(ESTALE);
    }
    level.dir = std::move(dir);
    return {};
}

void DirectoryStack::clear() {
    dropLevels();
    truncatePath(basePathSize_);
}

void DirectoryStack::dropLevels() {
    while (!levels_.empty()) {
        close(levels_.back().dir);
        levels_.pop_back();
    }
    firstOpen_ = 0;
}

int DirectoryStack::fd() const {
    return levels_.back().dir.get();
}

SysResult<const DirectoryStack::Child*> DirectoryStack::next() {
    Level& level = levels_.back();
    if (Unlisted* unlisted = level.unlisted.get()) {
        if (unlisted->at < unlisted->names.size()) {
            current_ = std::move(unlisted->names[unlisted->at++]);
            return &current_;
        }
        if (unlisted->err != 0) {
            return SysError(std::exchange(unlisted->err, 0));
        }
        return nullptr;
    }
    if (level.dir.dir() == nullptr) {
        return SysError(EBADF); // a level pushed without listing
    }
    for (;;) {
        auto read = env_.readdir(level.dir.dir());
        if (!read) {
            return SysError(read.error());
        }
        if (*read == nullptr) {
            return nullptr;
        }
        if (!DirectoryEntryName::isDot((*read)->d_name)) {
            current_.name.assign((*read)->d_name);
            current_.type = (*read)->d_type;
            return &current_;
        }
    }
}

std::string DirectoryStack::name() const {
    const Level& level = levels_.back();
    return path_.substr(level.nameAt, level.pathEnd - level.nameAt);
}

std::size_t DirectoryStack::appendToPath(std::string_view name) {
    const std::size_t before = path_.size();
    if (!path_.empty() && path_.back() != '/') {
        path_ += '/';
    }
    path_ += name;
    return before;
}

void DirectoryStack::close(EnvFd& fd) {
    if (auto closed = fd.close(); !closed && closeError_ == 0) {
        closeError_ = closed.error();
    }
}

} // namespace quarn
