#include "Daemon/platform/LinuxNotifications.h"

#include "Daemon/support/Log.h"

#include <fmt/chrono.h>

#include <cerrno>
#include <chrono>
#include <cstdlib>
#include <cstring>
#include <fcntl.h>
#include <sys/stat.h>
#include <systemd/sd-daemon.h>
#include <unistd.h>

namespace quarn {

namespace {

constexpr const char* kDirectoryName = "notifications";
constexpr mode_t kDirectoryMode = 0755;
constexpr mode_t kFileMode = 0644;

// Opens (making it first when missing) the directory `name` inside `parentFd`,
// never through a link. Closes `parentFd`.
Expected<int, int> descend(int parentFd, const char* name) {
    if (::mkdirat(parentFd, name, kDirectoryMode) != 0 && errno != EEXIST) {
        const int err = errno;
        ::close(parentFd);
        return Unexpected<int>(err);
    }
    const int fd = ::openat(parentFd, name, O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC);
    const int err = errno;
    ::close(parentFd);
    if (fd < 0) {
        return Unexpected<int>(err);
    }
    return fd;
}

} // namespace

LinuxNotifications::LinuxNotifications(Paths paths) : paths_(std::move(paths)) {}

std::filesystem::path LinuxNotifications::directory() const {
    return paths_.runDirectory() / kDirectoryName;
}

std::string LinuxNotifications::lineFor(std::string_view name) {
    using namespace std::chrono;
    const auto now = time_point_cast<microseconds>(system_clock::now());
    const auto seconds = time_point_cast<std::chrono::seconds>(now);
    const auto micros = (now - seconds).count();
    return fmt::format("{:%Y-%m-%dT%H:%M:%S}.{:06}Z {}\n", seconds, micros, name);
}

Expected<int, int> LinuxNotifications::openDirectory() const {
    // The root prefix is trusted as given; everything below it is walked
    // component by component so a planted link cannot redirect the write.
    int fd = ::open(paths_.rootPrefix().c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
    if (fd < 0) {
        return Unexpected<int>(errno);
    }
    const auto relative = directory().lexically_relative(paths_.rootPrefix());
    for (const auto& component : relative) {
        auto next = descend(fd, component.c_str());
        if (!next) {
            return next;
        }
        fd = *next;
    }
    return fd;
}

Status LinuxNotifications::post(std::string_view name) {
    if (!isValidName(name)) {
        return QRN_UNEXPECTED(
            QRN_POSIX_ERROR(EINVAL, "Refusing to post notification named [{}]", name));
    }
    auto dir = openDirectory();
    if (!dir) {
        return QRN_UNEXPECTED(QRN_POSIX_ERROR(dir.error(), "Could not open {}: {}",
                                              directory().string(), std::strerror(dir.error())));
    }
    const std::string fileName(name);
    const int fd = ::openat(*dir, fileName.c_str(),
                            O_WRONLY | O_APPEND | O_CREAT | O_NOFOLLOW | O_CLOEXEC, kFileMode);
    int err = errno;
    ::close(*dir);
    if (fd >= 0) {
        // One write on an O_APPEND file: concurrent posts never interleave.
        const std::string line = lineFor(name);
        const ssize_t written = ::write(fd, line.data(), line.size());
        err = written == static_cast<ssize_t>(line.size()) ? 0 : (written < 0 ? errno : EIO);
        ::close(fd);
    }
    if (fd < 0 || err != 0) {
        return QRN_UNEXPECTED(
            QRN_POSIX_ERROR(err, "Could not post notification {}: {}", name, std::strerror(err)));
    }
    tellSystemd(name);
    return {};
}

void LinuxNotifications::tellSystemd(std::string_view name) {
    if (std::getenv("NOTIFY_SOCKET") == nullptr) {
        return;
    }
    const std::string status = fmt::format("STATUS=Posted {}", name);
    if (const int r = sd_notify(0, status.c_str()); r < 0) {
        QRN_LOG_ERROR(LogCategory::Unspecified, "sd_notify of [{}] failed: {}", status,
                      std::strerror(-r));
    }
}

} // namespace quarn
