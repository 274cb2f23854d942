#include "Daemon/platform/IpcExecFingerprint.h"

#include <fcntl.h>
#include <poll.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <charconv>
#include <cstring>
#include <string>

namespace quarn {

namespace {

// Field numbers (from 1) of stat that make up the layout.
constexpr std::array<int, 7> kLayoutFields{26, 27, 28, 48, 49, 50, 51};
constexpr std::size_t kStatBytes = 1024;

Error fingerprintError(int err, pid_t pid, std::string_view what) {
    return QRN_POSIX_ERROR(err, "Cannot fingerprint the program of pid {}: {}: {}", pid, what,
                           std::strerror(err));
}

} // namespace

Result<IpcExecFingerprint> IpcExecFingerprint::of(pid_t pid, int pidfd) {
    const std::string path = "/proc/" + std::to_string(pid);
    auto directory =
        std::make_shared<Descriptor>(::open(path.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    if (!directory->valid()) {
        return QRN_UNEXPECTED(fingerprintError(errno, pid, path));
    }
    // Alive after the open: the directory is the pinned process's, since its
    // pid cannot have been handed to another while it lives.
    pollfd exited{pidfd, POLLIN, 0};
    if (pidfd < 0 || ::poll(&exited, 1, 0) != 0) {
        return QRN_UNEXPECTED(fingerprintError(ESRCH, pid, "no live pidfd"));
    }
    auto stat = std::make_shared<Descriptor>(
        ::openat(directory->get(), "stat", O_RDONLY | O_CLOEXEC | O_NOFOLLOW));
    if (!stat->valid()) {
        return QRN_UNEXPECTED(fingerprintError(errno, pid, "stat"));
    }
    IpcExecFingerprint fingerprint(std::move(directory), std::move(stat));
    const auto now = fingerprint.read();
    if (!now) {
        return QRN_UNEXPECTED(fingerprintError(errno ? errno : EPROTO, pid, "exe or layout"));
    }
    fingerprint.taken_ = *now;
    return fingerprint;
}

bool IpcExecFingerprint::matches() const {
    const auto now = read();
    return now && *now == taken_;
}

std::optional<IpcExecFingerprint::Now> IpcExecFingerprint::read() const {
    char buffer[kStatBytes];
    const ssize_t n = ::pread(stat_->get(), buffer, sizeof buffer, 0);
    struct stat exe {};
    if (n <= 0 || static_cast<std::size_t>(n) == sizeof buffer ||
        ::fstatat(directory_->get(), "exe", &exe, 0) != 0) {
        return std::nullopt;
    }
    const auto layout = parseLayout(std::string_view(buffer, static_cast<std::size_t>(n)));
    if (!layout) {
        errno = EPROTO;
        return std::nullopt;
    }
    return Now{exe.st_dev, exe.st_ino, *layout};
}

std::optional<IpcExecFingerprint::Layout> IpcExecFingerprint::parseLayout(std::string_view stat) {
    // The command name may hold blanks and parentheses: fields are counted
    // from the last ')', which ends field 2.
    const std::size_t close = stat.rfind(')');
    if (close == std::string_view::npos) {
        return std::nullopt;
    }
    Layout layout{};
    std::size_t next = 0;
    int field = 2;
    const char* p = stat.data() + close + 1;
    const char* end = stat.data() + stat.size();
    while (next < layout.size()) {
        while (p < end && *p == ' ') {
            ++p;
        }
        if (p == end || *p == '\n') {
            return std::nullopt;
        }
        ++field;
        const char* token = p;
        while (p < end && *p != ' ' && *p != '\n') {
            ++p;
        }
        if (field != kLayoutFields[next]) {
            continue;
        }
        const auto parsed = std::from_chars(token, p, layout[next]);
        if (parsed.ec != std::errc() || parsed.ptr != p) {
            return std::nullopt;
        }
        ++next;
    }
    return layout;
}

} // namespace quarn
