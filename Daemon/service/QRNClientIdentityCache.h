#pragma once
// The identities of the processes that write on one client connection, so
// that a request does not look its writer up in /proc and the code-signing
// registry again. Each message names its writer (pid, uid, gid as the kernel
// stamped them); a writer is identified at its first message and keeps that
// identity while its process lives, its ids stay the same, the registry has
// not changed and its user identity is the same.
//
// A process that execs another program after its first message keeps the
// identity it had: rights never grow by exec. A process that forks keeps
// nothing: the child's bytes carry the child's pid, and the child is
// identified on its own.
//
// Not thread-safe: a connection's messages are handled one at a time, and
// each connection has its own cache.

#include "Daemon/operations/QRNClientIdentity.h"
#include "Daemon/platform/IpcConnection.h"

#include <cstddef>
#include <cstdint>
#include <vector>

namespace quarn {

class QRNClientIdentityCache {
public:
    // A connection is written by one process, or a few sharing it.
    static constexpr std::size_t kMaxWriters = 8;

    // The identity of the writer of the message being handled on
    // `connection`, nullptr when it has none (see
    // QRNClientIdentity::clientIdentityWithVellConnection).
    QRNClientIdentityPtr identityFor(const IpcConnection& connection);

private:
    struct Entry {
        IpcConnection::Sender sender;
        std::uint64_t registryGeneration = 0;
        IpcPeer peer; // holds the writer's pidfd, which tells when it has exited
        QRNClientIdentityPtr identity;
    };

    // Also answers the registry's current generation.
    static bool isStillValid(const Entry& entry, CodeSigningRegistry& registry,
                             std::uint64_t& registryGeneration);

    std::vector<Entry> entries_;
};

} // namespace quarn
