#pragma once
// Told when the user identity cache drops an identity, so that state keyed
// by that identity (cached containers, sandbox mappings) can be let go.

#include "Daemon/model/QRNUserIdentity.h"

namespace quarn {

class QRNUserIdentityCache;

class QRNUserIdentityCacheObserver {
public:
    virtual ~QRNUserIdentityCacheObserver() = default;
    // Called once per dropped identity, outside the cache's lock.
    virtual void userIdentityCache(QRNUserIdentityCache& cache,
                                   const QRNUserIdentityPtr& didInvalidateUserIdentity) = 0;
};

} // namespace quarn
