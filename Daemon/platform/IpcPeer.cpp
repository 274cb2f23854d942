#include "Daemon/platform/IpcPeer.h"

#include "Daemon/platform/ProcessInfo.h"

#include <cerrno>
#include <cstring>
#include <poll.h>
#include <sys/socket.h>
#include <sys/syscall.h>
#include <unistd.h>

#ifndef SO_PEERPIDFD
#define SO_PEERPIDFD 77 // Linux 6.5
#endif

namespace quarn {

namespace {

constexpr std::size_t kTokenFieldCount = 8;

// A pidfd of the process at the other end of `socketFd`, or nullptr when the
// kernel has none to give.
Expected<std::shared_ptr<Descriptor>, int> peerPidfd(int socketFd, pid_t pid) {
    int fd = -1;
    socklen_t length = sizeof fd;
    if (::getsockopt(socketFd, SOL_SOCKET, SO_PEERPIDFD, &fd, &length) == 0 && fd >= 0) {
        return std::make_shared<Descriptor>(fd);
    }
    // Older kernels (Debian 12's 6.1) cannot name the peer by pidfd; pin the
    // pid now. Should the peer have exited and its pid been reused before
    // this call, the token records the newcomer's start time, so it never
    // matches a token of the process that connected.
    fd = static_cast<int>(::syscall(SYS_pidfd_open, pid, 0));
    if (fd >= 0) {
        return std::make_shared<Descriptor>(fd);
    }
    if (errno == ENOSYS) {
        return std::shared_ptr<Descriptor>();
    }
    return Unexpected<int>(errno);
}

// A pidfd turns readable once its process has exited.
bool hasExited(const Descriptor& pidfd) {
    pollfd p{pidfd.get(), POLLIN, 0};
    return ::poll(&p, 1, 0) > 0;
}

std::uint32_t readLE32(const IpcPeer::AuditToken& token, std::size_t index) {
    const std::size_t at = index * 4;
    return static_cast<std::uint32_t>(token[at]) | static_cast<std::uint32_t>(token[at + 1]) << 8 |
           static_cast<std::uint32_t>(token[at + 2]) << 16 |
           static_cast<std::uint32_t>(token[at + 3]) << 24;
}

void writeLE32(IpcPeer::AuditToken& token, std::size_t index, std::uint32_t value) {
    for (std::size_t i = 0; i < 4; ++i) {
        token[index * 4 + i] = static_cast<std::uint8_t>(value >> (8 * i));
    }
}

Error peerError(int err, pid_t pid, std::string_view what) {
    return QRN_POSIX_ERROR(err, "Cannot identify client pid {}: {}: {}", pid, what,
                           std::strerror(err));
}

// Token fields and start time of `pid`, read while `pidfd` shows that the
// pid still names the pinned process.
Result<IpcPeer> describe(pid_t pid, uid_t uid, gid_t gid, std::shared_ptr<Descriptor> pidfd) {
    auto process = ProcessInfo::open(pid);
    if (!process) {
        return QRN_UNEXPECTED(peerError(process.error(), pid, "/proc"));
    }
    const auto startTime = process->startTime();
    const auto ids = process->ids();
    const auto loginUID = process->loginUID();
    const pid_t session = ::getsid(pid);
    const int sessionErr = errno;
    if (!startTime || !ids || !loginUID) {
        const int err = !startTime ? startTime.error() : !ids ? ids.error() : loginUID.error();
        return QRN_UNEXPECTED(peerError(err, pid, "stat, status or loginuid"));
    }
    if (session < 0) {
        return QRN_UNEXPECTED(peerError(sessionErr, pid, "session"));
    }
    if (pidfd && hasExited(*pidfd)) {
        return QRN_UNEXPECTED(peerError(ESRCH, pid, "exited while being identified"));
    }
    IpcPeer::TokenFields fields;
    fields.loginUID = *loginUID;
    fields.euid = ids->effectiveUID;
    fields.egid = ids->effectiveGID;
    fields.ruid = ids->realUID;
    fields.rgid = ids->realGID;
    fields.pid = static_cast<std::uint32_t>(pid);
    fields.sessionID = static_cast<std::uint32_t>(session);
    fields.startTime = static_cast<std::uint32_t>(*startTime);
    return IpcPeer(pid, uid, gid, IpcPeer::makeAuditToken(fields), *startTime, std::move(pidfd));
}

} // namespace

Result<IpcPeer> IpcPeer::fromSocket(int socketFd) {
    ucred credentials{};
    socklen_t length = sizeof credentials;
    if (::getsockopt(socketFd, SOL_SOCKET, SO_PEERCRED, &credentials, &length) != 0) {
        const int err = errno;
        return QRN_UNEXPECTED(
            QRN_POSIX_ERROR(err, "No peer credentials on the socket: {}", std::strerror(err)));
    }
    // A peer in another pid namespace shows as pid 0: it cannot be described.
    if (credentials.pid <= 0) {
        return QRN_UNEXPECTED(peerError(ESRCH, credentials.pid, "not in this pid namespace"));
    }
    auto pidfd = peerPidfd(socketFd, credentials.pid);
    if (!pidfd) {
        return QRN_UNEXPECTED(peerError(pidfd.error(), credentials.pid, "pidfd"));
    }
    return describe(credentials.pid, credentials.uid, credentials.gid, std::move(*pidfd));
}

Result<IpcPeer> IpcPeer::fromPID(pid_t pid) {
    if (pid <= 0) {
        return QRN_UNEXPECTED(peerError(EINVAL, pid, "not a process id"));
    }
    std::shared_ptr<Descriptor> pidfd;
    if (const int fd = static_cast<int>(::syscall(SYS_pidfd_open, pid, 0)); fd >= 0) {
        pidfd = std::make_shared<Descriptor>(fd);
    } else if (errno != ENOSYS) {
        return QRN_UNEXPECTED(peerError(errno, pid, "pidfd"));
    }
    auto process = ProcessInfo::open(pid);
    if (!process) {
        return QRN_UNEXPECTED(peerError(process.error(), pid, "/proc"));
    }
    const auto ids = process->ids();
    if (!ids) {
        return QRN_UNEXPECTED(peerError(ids.error(), pid, "status"));
    }
    return describe(pid, ids->effectiveUID, ids->effectiveGID, std::move(pidfd));
}

IpcPeer::AuditToken IpcPeer::makeAuditToken(const TokenFields& fields) {
    AuditToken token{};
    const std::uint32_t values[kTokenFieldCount] = {fields.loginUID,  fields.euid,     fields.egid,
                                                    fields.ruid,      fields.rgid,     fields.pid,
                                                    fields.sessionID, fields.startTime};
    for (std::size_t i = 0; i < kTokenFieldCount; ++i) {
        writeLE32(token, i, values[i]);
    }
    return token;
}

IpcPeer::TokenFields IpcPeer::fieldsOfAuditToken(const AuditToken& token) {
    TokenFields fields;
    fields.loginUID = readLE32(token, 0);
    fields.euid = readLE32(token, 1);
    fields.egid = readLE32(token, 2);
    fields.ruid = readLE32(token, 3);
    fields.rgid = readLE32(token, 4);
    fields.pid = readLE32(token, 5);
    fields.sessionID = readLE32(token, 6);
    fields.startTime = readLE32(token, 7);
    return fields;
}

std::optional<std::uint64_t> IpcPeer::processStartTime(pid_t pid) {
    auto process = ProcessInfo::open(pid);
    if (!process) {
        return std::nullopt;
    }
    auto startTime = process->startTime();
    return startTime ? std::optional<std::uint64_t>(*startTime) : std::nullopt;
}

} // namespace quarn
