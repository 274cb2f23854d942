// Dropping and rebuilding the cached personas, and telling observers about
// the identities that went away.

#include "Daemon/model/QRNUserIdentityCache.h"
#include "Daemon/support/ProcessTransaction.h"

#include <algorithm>

namespace quarn {

void QRNUserIdentityCache::addObserver(
    const std::shared_ptr<QRNUserIdentityCacheObserver>& observer) {
    std::lock_guard guard(observersMutex_);
    std::erase_if(observers_, [](const auto& weak) { return weak.expired(); });
    observers_.push_back(observer);
}

void QRNUserIdentityCache::removeObserver(
    const std::shared_ptr<QRNUserIdentityCacheObserver>& observer) {
    std::lock_guard guard(observersMutex_);
    std::erase_if(observers_, [&](const auto& weak) {
        auto strong = weak.lock();
        return !strong || strong == observer;
    });
}

void QRNUserIdentityCache::notifyObservers(const std::vector<QRNUserIdentityPtr>& dropped) {
    for (const auto& identity : dropped) {
        // A fresh copy per identity: an observer may add or remove observers.
        std::vector<std::shared_ptr<QRNUserIdentityCacheObserver>> observers;
        {
            std::lock_guard guard(observersMutex_);
            for (const auto& weak : observers_) {
                if (auto strong = weak.lock()) {
                    observers.push_back(std::move(strong));
                }
            }
        }
        for (const auto& observer : observers) {
            observer->userIdentityCache(*this, identity);
        }
    }
}

void QRNUserIdentityCache::flush() {
    auto def = defaultUserIdentity();
    std::vector<QRNUserIdentityPtr> dropped;
    {
        Locker locked(*this);
        for (const auto& [persona, identity] : byPersonaString_) {
            if (identity->isEnterprise()) {
                dropped.push_back(identity);
            }
        }
        cacheInvalid_ = true;
        byPersonaString_.clear();
        byKernelPersonaID_.clear();
        enterpriseByBundleID_.clear();
        personal_ = def;
        unspecific_ = def;
    }
    notifyObservers(dropped);
}

void QRNUserIdentityCache::flushAndRepopulateWithUserIdentities(
    const std::vector<QRNUserIdentityPtr>& identities) {
    auto def = defaultUserIdentity();
    IdentityMap byPersonaString;
    PersonaIDMap byKernelPersonaID;
    QRNUserIdentityPtr personal;
    QRNUserIdentityPtr unspecific;
    for (const auto& identity : identities) {
        if (!identity) {
            continue;
        }
        if (identity->isNoSpecificPersona()) {
            unspecific = identity;
        } else if (!identity->isEnterprise()) {
            personal = identity;
        }
        if (identity->personaUniqueString()) {
            byPersonaString[*identity->personaUniqueString()] = identity;
        }
        byKernelPersonaID[identity->kernelPersonaID()] = identity;
    }
    // A list without a personal persona keeps the device user's identity.
    if (!personal) {
        personal = def;
    }
    if (!unspecific) {
        unspecific = QRNUserIdentity::initWithUID(
            personal->posixUID(), personal->posixGID(), personal->homeDirectoryURL(),
            personal->personaUniqueString(), kQRNPersonaTypeUnspecific,
            personal->kernelPersonaID());
    }
    Locker locked(*this);
    enterpriseByBundleID_.clear();
    byPersonaString_ = std::move(byPersonaString);
    byKernelPersonaID_ = std::move(byKernelPersonaID);
    personal_ = std::move(personal);
    unspecific_ = std::move(unspecific);
    cacheInvalid_ = false;
}

void QRNUserIdentityCache::personaListDidUpdate() {
    QRN_LOG_INFO(LogCategory::Unspecified, "Persona list did update");
    // Keeps the daemon from exiting before the flush is done.
    ProcessTransaction transaction("com.orvex.quarnd.personaListDidUpdate");
    flushQueue_.async([this, transaction = std::move(transaction)]() mutable {
        QRN_LOG_INFO(LogCategory::Unspecified, "Flushing the user identity cache");
        flush();
        transaction.end();
    });
}

} // namespace quarn
