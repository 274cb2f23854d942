#pragma once
// The identity of the process on one client connection. It is settled once,
// when the connection is handed over and before the client may write, for
// the process the listener pinned at accept; the transport lets only that
// process, still running the same program, write. It is made again (for
// the same process) only when the code-signing registry or the client's
// user identity has changed since.
//
// Not thread-safe: a connection's messages are handled one at a time, and
// each connection has its own cache.

#include "Daemon/operations/QRNClientIdentity.h"
#include "Daemon/platform/IpcConnection.h"

#include <cstdint>

namespace quarn {

class QRNClientIdentityCache {
public:
    // Settles the identity of `connection`'s peer.
    explicit QRNClientIdentityCache(const IpcConnection& connection);

    // The identity of the peer of `connection` (the one given at
    // construction), nullptr when it has none (see
    // QRNClientIdentity::clientIdentityWithPeer).
    QRNClientIdentityPtr identityFor(const IpcConnection& connection);

private:
    void settle(const IpcConnection& connection);
    bool isStillValid(const IpcConnection& connection) const;

    std::uint64_t registryGeneration_ = 0;
    QRNClientIdentityPtr identity_;
};

} // namespace quarn
