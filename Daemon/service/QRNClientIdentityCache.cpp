#include "Daemon/service/QRNClientIdentityCache.h"

#include "Daemon/model/QRNUserIdentitySharedCache.h"
#include "Daemon/platform/CodeSigningRegistry.h"
#include "Daemon/support/QRNDaemonContext.h"

#include <poll.h>

#include <algorithm>
#include <optional>

namespace quarn {

namespace {

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

bool QRNClientIdentityCache::isStillValid(const Entry& entry, CodeSigningRegistry& registry,
                                          std::uint64_t& registryGeneration) {
    // Whether the writer has exited (its pidfd turns readable) is asked in
    // the same system call as whether the registry changed: both are asked
    // on every message. A process whose pidfd cannot be polled counts as
    // gone: its pid might name another process by now.
    pollfd exit{entry.peer.pidfd(), POLLIN, 0};
    registryGeneration = registry.generationPolling(exit);
    if (entry.peer.pidfd() < 0 || exit.revents != 0 ||
        entry.registryGeneration != registryGeneration) {
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
    auto& registry = QRNDaemonContext::current().instance<CodeSigningRegistry>();
    // Read before the identity is made: a reload during the making shows
    // as a newer generation at the next request.
    std::uint64_t generation = 0;
    const auto found = std::find_if(entries_.begin(), entries_.end(),
                                    [&](const Entry& entry) { return entry.sender == sender; });
    if (found == entries_.end()) {
        generation = registry.generation();
    } else if (isStillValid(*found, registry, generation)) {
        return found->identity;
    } else {
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
