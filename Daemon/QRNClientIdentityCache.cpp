#include "Daemon/QRNClientIdentityCache.h"

#include "Daemon/model/QRNUserIdentitySharedCache.h"
#include "Daemon/platform/CodeSigningRegistry.h"
#include "Daemon/support/QRNDaemonContext.h"

#include <poll.h>

#include <algorithm>
#include <optional>

namespace quarn {

namespace {

// A process whose pidfd cannot be polled counts as gone: its entry is not
// trusted, since its pid might name another process by now.
bool hasExited(const IpcPeer& peer) {
    if (peer.pidfd() < 0) {
        return true;
    }
    pollfd p{peer.pidfd(), POLLIN, 0};
    return ::poll(&p, 1, 0) != 0;
}

// The writer as a peer: the connecting process as described at accept, as
// long as its ids are those it connected with; any other from its pid.
std::optional<IpcPeer> peerOf(const IpcConnection& connection,
                              const IpcConnection::Sender& sender) {
    const IpcPeer& connected = connection.peer();
    if (sender.pid == connected.pid() && sender.uid == connected.uid() &&
        sender.gid == connected.gid()) {
        return connected;
    }
    auto peer = IpcPeer::fromPID(sender.pid); // logs why it failed
    return peer ? std::optional<IpcPeer>(std::move(*peer)) : std::nullopt;
}

} // namespace

bool QRNClientIdentityCache::isStillValid(const Entry& entry, std::uint64_t registryGeneration) {
    if (entry.registryGeneration != registryGeneration || hasExited(entry.peer)) {
        return false;
    }
    if (!entry.identity) {
        return true;
    }
    // The user identity follows the current mobile user and the personas.
    const QRNUserIdentityPtr now =
        QRNUserIdentitySharedCache::sharedCache().userIdentityForCurrentContextWithUID(
            entry.peer.uid(), entry.peer.gid());
    return QRNUserIdentity::Equal()(now, entry.identity->userIdentity());
}

QRNClientIdentityPtr QRNClientIdentityCache::identityFor(const IpcConnection& connection) {
    const IpcPeer& connected = connection.peer();
    const IpcConnection::Sender sender = connection.messageSender().value_or(
        IpcConnection::Sender{connected.pid(), connected.uid(), connected.gid()});
    // Read before the identity is made: a reload during the making shows
    // as a newer generation at the next request.
    const std::uint64_t generation =
        QRNDaemonContext::current().instance<CodeSigningRegistry>().generation();
    const auto found = std::find_if(entries_.begin(), entries_.end(),
                                    [&](const Entry& entry) { return entry.sender == sender; });
    if (found != entries_.end()) {
        if (isStillValid(*found, generation)) {
            return found->identity;
        }
        entries_.erase(found);
    }
    std::optional<IpcPeer> peer = peerOf(connection, sender);
    if (!peer) {
        return nullptr;
    }
    QRNClientIdentityPtr identity = QRNClientIdentity::clientIdentityWithPeer(*peer);
    if (entries_.size() >= kMaxWriters) {
        entries_.erase(entries_.begin());
    }
    entries_.push_back(Entry{sender, generation, std::move(*peer), identity});
    return identity;
}

} // namespace quarn
