#include "Daemon/model/QRNUserIdentitySharedCache.h"

#include "Daemon/support/QRNDaemonContext.h"

namespace quarn {

QRNUserIdentityCache& QRNUserIdentitySharedCache::sharedCache() {
    return QRNDaemonContext::current().instance<QRNUserIdentityCache>();
}

QRNUserIdentityPtr QRNUserIdentitySharedCache::defaultUserIdentity() {
    return sharedCache().defaultUserIdentity();
}

QRNUserIdentityPtr QRNUserIdentitySharedCache::userIdentityForLegacyMobileUser() {
    return sharedCache().userIdentityForLegacyMobileUser();
}

} // namespace quarn
