#include "Daemon/platform/DirectoryChangeMonitor.h"

#include "Daemon/support/Log.h"

#include <poll.h>
#include <sys/inotify.h>

#include <cerrno>
#include <cstring>

namespace quarn {

namespace {

// Attribute changes count: ownership and mode decide whether a file is used.
constexpr std::uint32_t kDirectoryMask = IN_CREATE | IN_DELETE | IN_MOVED_TO | IN_MOVED_FROM |
                                         IN_CLOSE_WRITE | IN_ATTRIB | IN_DELETE_SELF |
                                         IN_MOVE_SELF | IN_ONLYDIR;
constexpr std::uint32_t kAncestorMask =
    IN_CREATE | IN_MOVED_TO | IN_DELETE_SELF | IN_MOVE_SELF | IN_ONLYDIR;

} // namespace

DirectoryChangeMonitor::DirectoryChangeMonitor(std::filesystem::path directory)
    : directory_(std::move(directory)), inotify_(::inotify_init1(IN_NONBLOCK | IN_CLOEXEC)) {
    if (!inotify_.valid()) {
        QRN_LOG_ERROR(LogCategory::Unspecified,
                      "Cannot watch {} ({}); it will be reread on every use", directory_.string(),
                      std::strerror(errno));
    }
}

bool DirectoryChangeMonitor::hasPendingChanges() const {
    if (!inotify_.valid() || !armed_.load()) {
        return true;
    }
    pollfd fd{inotify_.get(), POLLIN, 0};
    return ::poll(&fd, 1, 0) != 0; // an error too: look rather than miss a change
}

bool DirectoryChangeMonitor::hasPendingChangesPolling(pollfd& other) const {
    if (!inotify_.valid() || !armed_.load()) {
        ::poll(&other, 1, 0);
        return true;
    }
    pollfd fds[2] = {other, {inotify_.get(), POLLIN, 0}};
    const int ready = ::poll(fds, 2, 0);
    other.revents = fds[0].revents;
    return ready < 0 || fds[1].revents != 0;
}

bool DirectoryChangeMonitor::consumeChanges() {
    if (!inotify_.valid()) {
        return true;
    }
    if (!armed_) {
        arm();
        return true;
    }
    bool rearm = false;
    const bool changed = drain(rearm);
    if (rearm) {
        arm();
    }
    return changed;
}

bool DirectoryChangeMonitor::drain(bool& rearm) {
    bool any = false;
    alignas(inotify_event) char buffer[4096];
    for (;;) {
        const ssize_t n = ::read(inotify_.get(), buffer, sizeof buffer);
        if (n <= 0) {
            return any; // EAGAIN: drained
        }
        any = true;
        for (ssize_t offset = 0; offset < n;) {
            const auto* event = reinterpret_cast<const inotify_event*>(buffer + offset);
            offset += static_cast<ssize_t>(sizeof(inotify_event) + event->len);
            if (!watchingDirectory_ ||
                (event->mask & (IN_IGNORED | IN_DELETE_SELF | IN_MOVE_SELF | IN_Q_OVERFLOW))) {
                rearm = true;
            }
        }
    }
}

// Watches the directory itself, or else the nearest ancestor that exists.
void DirectoryChangeMonitor::arm() {
    if (watch_ >= 0) {
        ::inotify_rm_watch(inotify_.get(), watch_); // fails harmlessly when already gone
        watch_ = -1;
    }
    armed_ = true;
    for (std::filesystem::path target = directory_;; target = target.parent_path()) {
        const bool isDirectory = target == directory_;
        watch_ = ::inotify_add_watch(inotify_.get(), target.c_str(),
                                     isDirectory ? kDirectoryMask : kAncestorMask);
        if (watch_ >= 0) {
            watchingDirectory_ = isDirectory;
            return;
        }
        if ((errno != ENOENT && errno != ENOTDIR) || target == target.parent_path()) {
            QRN_LOG_ERROR(LogCategory::Unspecified, "Failed to watch {}: {}", target.string(),
                          std::strerror(errno));
            armed_ = false; // try again on the next call
            return;
        }
    }
}

} // namespace quarn
