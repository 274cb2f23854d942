#include "Daemon/platform/UnixSocketFile.h"

#include "Daemon/support/Descriptor.h"

#include <systemd/sd-daemon.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <fcntl.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>
#include <vector>

namespace quarn {

namespace {

constexpr mode_t kSocketDirectoryMode = 0755;
constexpr mode_t kSocketMode = 0666;

Error posixError(int err, std::string_view what, const std::filesystem::path& path) {
    return QRN_POSIX_ERROR(err, "Request service socket: {} {}: {}", what, path.string(),
                           std::strerror(err));
}

} // namespace

Status UnixSocketFile::makeParent(const std::filesystem::path& directory) {
    // The missing directories, innermost first.
    std::vector<std::filesystem::path> missing;
    for (auto at = directory; !at.empty() && at != at.root_path(); at = at.parent_path()) {
        struct stat st {};
        if (::lstat(at.c_str(), &st) == 0) {
            if (!S_ISDIR(st.st_mode)) {
                return QRN_UNEXPECTED(posixError(ENOTDIR, "not a directory:", at));
            }
            break;
        }
        missing.push_back(at);
    }
    for (auto it = missing.rbegin(); it != missing.rend(); ++it) {
        if (::mkdir(it->c_str(), kSocketDirectoryMode) != 0) {
            if (errno == EEXIST) {
                continue;
            }
            return QRN_UNEXPECTED(posixError(errno, "cannot make", *it));
        }
        // Whatever the umask, clients must reach the socket inside.
        if (::chmod(it->c_str(), kSocketDirectoryMode) != 0) {
            return QRN_UNEXPECTED(posixError(errno, "cannot open up", *it));
        }
    }
    return {};
}

Status UnixSocketFile::removeStale(const std::filesystem::path& path) {
    struct stat st {};
    if (::lstat(path.c_str(), &st) != 0) {
        return errno == ENOENT ? Status{} : QRN_UNEXPECTED(posixError(errno, "cannot see", path));
    }
    if (!S_ISSOCK(st.st_mode)) {
        return QRN_UNEXPECTED(posixError(EEXIST, "a file that is no socket is at", path));
    }
    // A socket file nobody listens on is what a stopped daemon left behind.
    Descriptor probe(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    std::strncpy(address.sun_path, path.c_str(), sizeof address.sun_path - 1);
    if (probe.valid() &&
        ::connect(probe.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address) == 0) {
        return QRN_UNEXPECTED(posixError(EADDRINUSE, "another service listens on", path));
    }
    if (::unlink(path.c_str()) != 0 && errno != ENOENT) {
        return QRN_UNEXPECTED(posixError(errno, "cannot remove the stale", path));
    }
    return {};
}

Result<int> UnixSocketFile::listen(const std::filesystem::path& path) {
    if (!path.is_absolute() || path.native().size() >= sizeof(sockaddr_un::sun_path)) {
        return QRN_UNEXPECTED(posixError(ENAMETOOLONG, "no socket path:", path));
    }
    if (auto made = makeParent(path.parent_path()); !made) {
        return QRN_UNEXPECTED(made.error());
    }
    if (auto removed = removeStale(path); !removed) {
        return QRN_UNEXPECTED(removed.error());
    }
    const int fd = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    if (fd < 0) {
        return QRN_UNEXPECTED(posixError(errno, "cannot make a socket for", path));
    }
    if (auto bound = bindAndListen(fd, path); !bound) {
        ::close(fd);
        return QRN_UNEXPECTED(bound.error());
    }
    return fd;
}

Status UnixSocketFile::bindAndListen(int fd, const std::filesystem::path& path) {
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    std::memcpy(address.sun_path, path.c_str(), path.native().size());
    if (::bind(fd, reinterpret_cast<const sockaddr*>(&address), sizeof address) != 0) {
        return QRN_UNEXPECTED(posixError(errno, "cannot bind", path));
    }
    // Every client may connect; what it may do is decided per request.
    if (::chmod(path.c_str(), kSocketMode) != 0) {
        return QRN_UNEXPECTED(posixError(errno, "cannot open up", path));
    }
    if (::listen(fd, SOMAXCONN) != 0) {
        return QRN_UNEXPECTED(posixError(errno, "cannot listen on", path));
    }
    return {};
}

bool UnixSocketFile::isListeningStream(int fd) {
    return fd >= 0 && sd_is_socket_unix(fd, SOCK_STREAM, 1, nullptr, 0) > 0;
}

int UnixSocketFile::fromSystemd(std::string_view name) {
    char** names = nullptr;
    const int count = sd_listen_fds_with_names(0, &names);
    int found = -1;
    for (int i = 0; i < count; ++i) {
        const int fd = SD_LISTEN_FDS_START + i;
        if (found < 0 && names != nullptr && name == names[i] && isListeningStream(fd)) {
            found = fd;
        }
    }
    for (int i = 0; names != nullptr && i < count; ++i) {
        std::free(names[i]);
    }
    std::free(names);
    if (found >= 0) {
        ::fcntl(found, F_SETFD, FD_CLOEXEC);
    }
    return found;
}

} // namespace quarn
