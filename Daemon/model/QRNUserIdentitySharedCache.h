#pragma once
// The process's one user identity cache: the current daemon context's.
// Every part of the daemon takes the cache from here.

#include "Daemon/model/QRNUserIdentityCache.h"

namespace quarn {

class QRNUserIdentitySharedCache {
public:
    static QRNUserIdentityCache& sharedCache();
    // The class-level forms of the cache's accessors.
    static QRNUserIdentityPtr defaultUserIdentity();
    static QRNUserIdentityPtr userIdentityForLegacyMobileUser();
};

} // namespace quarn
