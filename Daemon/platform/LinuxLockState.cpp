#include "Daemon/platform/LinuxLockState.h"

#include "Daemon/platform/ConfigFile.h"
#include "Daemon/support/Log.h"

#include <atomic>
#include <cerrno>
#include <charconv>
#include <cstring>
#include <poll.h>
#include <pthread.h>
#include <sys/eventfd.h>
#include <sys/inotify.h>
#include <unistd.h>

namespace quarn {

namespace {

constexpr const char* kFileName = "lockstate";

// Writing in place is seen at close, so a half-written file is never read
// on its account; creation alone is not watched for the same reason.
constexpr std::uint32_t kWatchMask = IN_CLOSE_WRITE | IN_MOVED_TO | IN_MOVED_FROM | IN_DELETE |
                                     IN_DELETE_SELF | IN_MOVE_SELF | IN_ONLYDIR;

struct Drained {
    bool fileChanged = false;
    bool directoryGone = false;
};

// Reads every queued inotify event without blocking.
Drained drainEvents(int inotifyFd) {
    Drained result;
    alignas(inotify_event) char buffer[4096];
    for (;;) {
        const ssize_t n = ::read(inotifyFd, buffer, sizeof buffer);
        if (n <= 0) {
            return result; // EAGAIN: drained; EINTR: the next poll comes back
        }
        for (ssize_t offset = 0; offset < n;) {
            const auto* event = reinterpret_cast<const inotify_event*>(buffer + offset);
            offset += static_cast<ssize_t>(sizeof(inotify_event) + event->len);
            if (event->mask & IN_Q_OVERFLOW) {
                result.fileChanged = true; // events were lost: look again
            }
            if (event->mask & (IN_IGNORED | IN_DELETE_SELF | IN_MOVE_SELF)) {
                result.directoryGone = true;
            }
            if (event->len > 0 && std::strcmp(event->name, kFileName) == 0) {
                result.fileChanged = true;
            }
        }
    }
}

} // namespace

struct LinuxLockState::Watch {
    std::filesystem::path file;
    Callback callback;
    int inotifyFd = -1;
    int wakeFd = -1;
    std::atomic<bool> stopping{false};
    std::int32_t lastReported = 0; // owned by the watcher thread once it runs

    ~Watch() {
        for (int fd : {inotifyFd, wakeFd}) {
            if (fd >= 0) {
                ::close(fd);
            }
        }
    }

    // Tells the callback when the state differs from what it last heard.
    void reportIfChanged() {
        const std::int32_t now = readState(file);
        if (now != lastReported && !stopping.load()) {
            lastReported = now;
            callback(now);
        }
    }
};

LinuxLockState::LinuxLockState(Paths paths)
    : directory_(paths.runDirectory()), file_(directory_ / kFileName) {}

LinuxLockState::~LinuxLockState() {
    stopWatching();
}

std::optional<std::int32_t> LinuxLockState::parseState(std::string_view contents) {
    contents = ConfigFile::trimmed(contents);
    std::int32_t state = 0;
    const char* end = contents.data() + contents.size();
    const auto [stop, error] = std::from_chars(contents.data(), end, state, 10);
    if (contents.empty() || error != std::errc() || stop != end) {
        return std::nullopt;
    }
    return state;
}

std::int32_t LinuxLockState::state() const {
    return readState(file_);
}

std::int32_t LinuxLockState::readState(const std::filesystem::path& file) {
    auto contents = ConfigFile::read(file, ConfigFile::Links::Refuse, 64);
    if (!contents) {
        if (contents.error() == ENOENT) {
            return kUnlocked;
        }
        QRN_LOG_ERROR(LogCategory::Unspecified, "Failed to read lock state {}: {}", file.string(),
                      std::strerror(contents.error()));
        return kUnreadable;
    }
    auto parsed = parseState(*contents);
    if (!parsed) {
        QRN_LOG_ERROR(LogCategory::Unspecified, "Unreadable lock state in {}", file.string());
        return kUnreadable;
    }
    return *parsed;
}

Result<std::shared_ptr<LinuxLockState::Watch>> LinuxLockState::makeWatch(Callback callback) const {
    std::error_code ec;
    std::filesystem::create_directories(directory_, ec);
    auto watch = std::make_shared<Watch>();
    watch->file = file_;
    watch->callback = std::move(callback);
    watch->inotifyFd = ::inotify_init1(IN_NONBLOCK | IN_CLOEXEC);
    watch->wakeFd = ::eventfd(0, EFD_NONBLOCK | EFD_CLOEXEC);
    if (watch->inotifyFd < 0 || watch->wakeFd < 0) {
        return QRN_UNEXPECTED(
            QRN_POSIX_ERROR(errno, "Failed to set up lock state watch: {}", std::strerror(errno)));
    }
    if (::inotify_add_watch(watch->inotifyFd, directory_.c_str(), kWatchMask) < 0) {
        const int err = errno;
        return QRN_UNEXPECTED(QRN_POSIX_ERROR(err, "Failed to watch {}: {}", directory_.string(),
                                              std::strerror(err)));
    }
    // Read after the watch exists, so no change between the two is missed.
    watch->lastReported = readState(file_);
    return watch;
}

Status LinuxLockState::startWatching(Callback callback) {
    stopWatching();
    auto made = makeWatch(std::move(callback));
    if (!made) {
        return QRN_UNEXPECTED(made.error());
    }
    std::shared_ptr<Watch> previous;
    std::thread previousThread;
    {
        // Started under the lock, so a callback that stops the watch finds it.
        std::lock_guard guard(mutex_);
        previous = std::exchange(watch_, *made);
        previousThread = std::exchange(thread_, std::thread(&LinuxLockState::run, *made));
    }
    stop(previous, previousThread); // a watch started meanwhile by another thread
    return {};
}

void LinuxLockState::stopWatching() {
    std::shared_ptr<Watch> watch;
    std::thread thread;
    {
        std::lock_guard guard(mutex_);
        watch = std::move(watch_);
        thread = std::move(thread_);
    }
    stop(watch, thread);
}

void LinuxLockState::stop(const std::shared_ptr<Watch>& watch, std::thread& thread) {
    if (!watch) {
        return;
    }
    watch->stopping.store(true);
    const std::uint64_t one = 1;
    [[maybe_unused]] const ssize_t written = ::write(watch->wakeFd, &one, sizeof one);
    if (!thread.joinable()) {
        return;
    }
    if (thread.get_id() == std::this_thread::get_id()) {
        thread.detach(); // stopped from its own callback: it ends when that returns
    } else {
        thread.join();
    }
}

void LinuxLockState::run(const std::shared_ptr<Watch>& watch) {
    pthread_setname_np(pthread_self(), "quarnd.lockstate");
    pollfd fds[2] = {{watch->inotifyFd, POLLIN, 0}, {watch->wakeFd, POLLIN, 0}};
    while (!watch->stopping.load()) {
        const int ready = ::poll(fds, 2, -1);
        if (ready < 0 && errno == EINTR) {
            continue;
        }
        if (ready < 0) {
            QRN_LOG_ERROR(LogCategory::Unspecified, "Lock state watch failed: {}",
                          std::strerror(errno));
            return;
        }
        if (fds[1].revents & POLLIN) {
            return;
        }
        const Drained drained = drainEvents(watch->inotifyFd);
        if (drained.fileChanged || drained.directoryGone) {
            watch->reportIfChanged();
        }
        if (drained.directoryGone) {
            QRN_LOG_ERROR(LogCategory::Unspecified,
                          "Lock state directory went away; no longer following {}",
                          watch->file.string());
            return;
        }
    }
}

} // namespace quarn
