#include "Daemon/service/QRNClientIdentityCache.h"

#include "Daemon/model/QRNUserIdentitySharedCache.h"
#include "Daemon/platform/CodeSigningRegistry.h"
#include "Daemon/support/Log.h"
#include "Daemon/support/QRNDaemonContext.h"

namespace quarn {

QRNClientIdentityCache::QRNClientIdentityCache(const IpcConnection& connection) {
    settle(connection);
}

void QRNClientIdentityCache::settle(const IpcConnection& connection) {
    // Read before the identity is made: a reload during the making shows
    // as a newer generation at the next request.
    registryGeneration_ = QRNDaemonContext::current().instance<CodeSigningRegistry>().generation();
    identity_ = QRNClientIdentity::clientIdentityWithPeer(connection.peer());
    // The program was read from /proc: an execve since accept may have put
    // another one there, whose identity this is not.
    if (!connection.runsSameProgram()) {
        QRN_LOG_ERROR(LogCategory::Vell,
                      "pid {} runs another program than when it connected: no identity",
                      connection.peer().pid());
        identity_ = nullptr;
    }
}

bool QRNClientIdentityCache::isStillValid(const IpcConnection& connection) const {
    if (QRNDaemonContext::current().instance<CodeSigningRegistry>().generation() !=
        registryGeneration_) {
        return false;
    }
    if (!identity_) {
        return true;
    }
    // The user identity follows the current mobile user and the personas.
    const IpcPeer& peer = connection.peer();
    const QRNUserIdentityPtr now =
        QRNUserIdentitySharedCache::sharedCache().userIdentityForCurrentContextWithUID(peer.uid(),
                                                                                       peer.gid());
    return QRNUserIdentity::Equal()(now, identity_->userIdentity());
}

QRNClientIdentityPtr QRNClientIdentityCache::identityFor(const IpcConnection& connection) {
    if (!isStillValid(connection)) {
        settle(connection);
    }
    return identity_;
}

} // namespace quarn
