#pragma once
// Who is on the other end of a client connection, read once at accept time.
//
// The audit token names the process so that a reused pid gives another
// token: eight little-endian u32 (login uid, euid, egid, ruid, rgid, pid,
// session id, low 32 bits of the process start time in clock ticks).

#include "Daemon/support/Descriptor.h"
#include "Daemon/support/QRNError.h"

#include <sys/types.h>

#include <array>
#include <cstdint>
#include <memory>
#include <optional>

namespace quarn {

class IpcPeer {
public:
    using AuditToken = std::array<std::uint8_t, 32>;

    // The fields of an audit token, in their order.
    struct TokenFields {
        std::uint32_t loginUID = 0;
        std::uint32_t euid = 0;
        std::uint32_t egid = 0;
        std::uint32_t ruid = 0;
        std::uint32_t rgid = 0;
        std::uint32_t pid = 0;
        std::uint32_t sessionID = 0;
        std::uint32_t startTime = 0;
    };

    // SO_PEERCRED of a connected Unix socket, the process pinned with a
    // pidfd, and the token fields read from /proc for that pid.
    static Result<IpcPeer> fromSocket(int socketFd);
    // The same for a process known only by pid (tests, the upcall peer).
    static Result<IpcPeer> fromPID(pid_t pid);

    static AuditToken makeAuditToken(const TokenFields& fields);
    static TokenFields fieldsOfAuditToken(const AuditToken& token);
    // The start time of a live process in clock ticks since boot, or none
    // when it is gone or /proc cannot be read.
    static std::optional<std::uint64_t> processStartTime(pid_t pid);

    pid_t pid() const { return pid_; }
    uid_t uid() const { return uid_; }
    gid_t gid() const { return gid_; }
    const AuditToken& auditToken() const { return auditToken_; }
    std::uint64_t startTime() const { return startTime_; }
    // -1 when the kernel gave no pidfd.
    int pidfd() const { return pidfd_ ? pidfd_->get() : -1; }

    IpcPeer(pid_t pid, uid_t uid, gid_t gid, const AuditToken& token, std::uint64_t startTime,
            std::shared_ptr<Descriptor> pidfd)
        : pid_(pid), uid_(uid), gid_(gid), auditToken_(token), startTime_(startTime),
          pidfd_(std::move(pidfd)) {}

private:
    pid_t pid_;
    uid_t uid_;
    gid_t gid_;
    AuditToken auditToken_;
    std::uint64_t startTime_;
    std::shared_ptr<Descriptor> pidfd_;
};

} // namespace quarn
