#include "Daemon/model/QRNUserIdentityCache.h"

#include "Daemon/fs/QRNFileManager.h"
#include "Daemon/model/QRNGlobalConfiguration.h"
#include "Daemon/support/QRNDaemonContext.h"

#include <algorithm>
#include <cstdlib>

namespace quarn {

QRNUserIdentityCache::QRNUserIdentityCache(QRNDaemonContext& context)
    : QRNUserIdentityCache(context, personasAreSupported()) {}

QRNUserIdentityCache::QRNUserIdentityCache(QRNDaemonContext& context, bool personasSupported)
    : context_(context), personasSupported_(personasSupported),
      flushQueue_(Queue::ownerLabel("QRNUserIdentityCache.flushQueue")) {
    auto def = defaultUserIdentity();
    Locker locked(*this);
    personal_ = def;
    unspecific_ = def;
}

void QRNUserIdentityCache::lock() {
    mutex_.lock();
    owner_.store(std::this_thread::get_id());
}

void QRNUserIdentityCache::unlock() {
    owner_.store(std::thread::id());
    mutex_.unlock();
}

void QRNUserIdentityCache::_lock_assertOwned() const {
    if (owner_.load() != std::this_thread::get_id()) {
        QRN_LOG_FAULT(LogCategory::Unspecified, "User identity cache lock is not held");
        std::abort();
    }
}

QRNUserIdentityPtr QRNUserIdentityCache::defaultUserIdentity() {
    std::call_once(defaultOnce_, [this] {
        auto& config = context_.instance<QRNGlobalConfiguration>();
        std::uint32_t uid = config.currentMobileUserId();
        if (uid < QRNUserIdentity::kMinimumUserUID) {
            // Without a mobile account there is no user to build it for.
            default_ = userIdentityForLegacyMobileUser();
            return;
        }
        default_ = QRNUserIdentity::initWithUID(uid, config.currentMobileGroupId(),
                                                QRNFileManager::homeDirectoryURLForPOSIXUID(uid),
                                                std::nullopt, kQRNPersonaTypePersonal, uid);
    });
    return default_;
}

QRNUserIdentityPtr QRNUserIdentityCache::userIdentityForLegacyMobileUser() {
    std::call_once(legacyOnce_, [this] { legacy_ = QRNUserIdentity::init(); });
    return legacy_;
}

void QRNUserIdentityCache::substituteRoleUID(std::uint32_t& uid, std::uint32_t& gid) {
    if (uid < QRNUserIdentity::kMinimumUserUID) {
        auto& config = context_.instance<QRNGlobalConfiguration>();
        uid = config.currentMobileUserId();
        gid = config.currentMobileGroupId();
    }
}

QRNUserIdentityPtr QRNUserIdentityCache::_updateUserIdentity(const QRNUserIdentityPtr& identity,
                                                             std::uint32_t uid, std::uint32_t gid) {
    // An enterprise persona's home is its own; every other identity lives in
    // the uid's home.
    auto home = identity->isEnterprise() ? identity->homeDirectoryURL()
                                         : QRNFileManager::homeDirectoryURLForPOSIXUID(uid);
    return QRNUserIdentity::initWithUID(uid, gid, std::move(home), identity->personaUniqueString(),
                                        identity->personaType(), identity->kernelPersonaID());
}

QRNUserIdentityPtr QRNUserIdentityCache::userIdentityForPersonalPersonaWithUID(std::uint32_t uid,
                                                                               std::uint32_t gid) {
    substituteRoleUID(uid, gid);
    QRNUserIdentityPtr personal = userIdentityForPersonalPersona();
    if (personal->posixUID() == uid && personal->posixGID() == gid) {
        return personal;
    }
    return _updateUserIdentity(personal, uid, gid);
}

QRNUserIdentityPtr
QRNUserIdentityCache::userIdentityForPersonaUniqueString(std::optional<std::string> persona,
                                                         std::uint32_t uid, std::uint32_t gid) {
    substituteRoleUID(uid, gid);
    if (!personasSupported_) {
        return userIdentityForPersonalPersonaWithUID(uid, gid);
    }
    QRNUserIdentityPtr found;
    {
        Locker locked(*this);
        _lock_resyncIfInvalid();
        if (!persona) {
            found = unspecific_;
        } else if (auto it = byPersonaString_.find(*persona); it != byPersonaString_.end()) {
            found = it->second;
            QRN_LOG_DEBUG(LogCategory::Unspecified, "Found {} for {}", found->shortDescription(),
                          *persona);
        }
    }
    if (found && (found->posixUID() != uid || found->posixGID() != gid)) {
        found = _updateUserIdentity(found, uid, gid);
    }
    return found;
}

QRNUserIdentityPtr QRNUserIdentityCache::userIdentityForCurrentContext() {
    auto& config = context_.instance<QRNGlobalConfiguration>();
    return userIdentityForCurrentContextWithUID(config.currentMobileUserId(),
                                                config.currentMobileGroupId());
}

QRNUserIdentityPtr QRNUserIdentityCache::userIdentityForCurrentContextWithUID(std::uint32_t uid,
                                                                              std::uint32_t gid) {
    substituteRoleUID(uid, gid);
    QRNUserIdentityPtr identity = userIdentityForPersonalPersonaWithUID(uid, gid);
    if (!personasSupported_) {
        QRN_LOG_INFO(LogCategory::Unspecified, "({}/{}) Personas not supported, using: {}", uid,
                     gid, identity ? identity->shortDescription() : "(null)");
    }
    return identity;
}

QRNUserIdentityPtr QRNUserIdentityCache::userIdentityWithPersonaID(std::uint32_t kernelPersonaID) {
    Locker locked(*this);
    _lock_resyncIfInvalid();
    auto it = byKernelPersonaID_.find(kernelPersonaID);
    return it == byKernelPersonaID_.end() ? nullptr : it->second;
}

QRNUserIdentityPtr QRNUserIdentityCache::userIdentityForPersonalPersona() {
    Locker locked(*this);
    _lock_resyncIfInvalid();
    return personal_;
}

QRNUserIdentityPtr QRNUserIdentityCache::unspecificUserIdentity() {
    Locker locked(*this);
    _lock_resyncIfInvalid();
    return unspecific_;
}

std::vector<QRNUserIdentityPtr>
QRNUserIdentityCache::userIdentitiesForBundleIdentifier(const std::string& bundleID) {
    Locker locked(*this);
    _lock_resyncIfInvalid();
    auto it = enterpriseByBundleID_.find(bundleID);
    return it == enterpriseByBundleID_.end() ? std::vector<QRNUserIdentityPtr>() : it->second;
}

bool QRNUserIdentityCache::isBundleIdentifier(
    const std::string& bundleID, const QRNUserIdentityPtr& associatedWithUserIdentity) {
    auto identities = userIdentitiesForBundleIdentifier(bundleID);
    return std::any_of(identities.begin(), identities.end(), [&](const QRNUserIdentityPtr& u) {
        return QRNUserIdentity::Equal()(u, associatedWithUserIdentity);
    });
}

void QRNUserIdentityCache::forEachAccessibleUserIdentitySynchronouslyExecuteBlock(
    const std::function<void(const QRNUserIdentityPtr&)>& block) {
    if (!personasSupported_) {
        block(defaultUserIdentity());
        return;
    }
    std::vector<QRNUserIdentityPtr> identities;
    {
        Locker locked(*this);
        _lock_resyncIfInvalid();
        for (const auto& [id, identity] : byKernelPersonaID_) {
            identities.push_back(identity);
        }
    }
    if (identities.empty()) {
        QRN_LOG_ERROR(LogCategory::Unspecified,
                      "Expected to find at least one persona; self = {}, personaAttributeList = {}",
                      fmt::ptr(this), "()");
    }
    for (const auto& identity : identities) {
        block(identity);
    }
}

void QRNUserIdentityCache::_lock_resyncIfInvalid() {
    _lock_assertOwned();
    if (cacheInvalid_) {
        _lock_resync();
    }
}

void QRNUserIdentityCache::_lock_resync() {
    _lock_assertOwned();
    // There is no persona service to ask: the maps stay as they are (empty
    // after a flush) and the stored identities stay the default.
    cacheInvalid_ = false;
}

} // namespace quarn
