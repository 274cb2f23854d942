// Which persona a looked-up container lives in. Only a client without a
// specific persona has to choose; whenever the choice is not clear it keeps
// its own identity rather than failing, on purpose: the lookup's access
// checks still apply to whatever it finds there.

#include "Daemon/operations/QRNClientConnection.h"

#include "Daemon/codesigning/QRNCodeSigningMapping.h"
#include "Daemon/model/QRNContainerClass.h"
#include "Daemon/model/QRNUserIdentitySharedCache.h"
#include "Daemon/support/Log.h"

#include <fmt/format.h>

namespace quarn {

namespace {

std::string describe(const std::vector<QRNUserIdentityPtr>& identities) {
    std::string text;
    for (const QRNUserIdentityPtr& identity : identities) {
        text += text.empty() ? "" : ", ";
        text += identity->shortDescription();
    }
    return text;
}

// One candidate: it. Several: the client's own, also when it is not among
// them (a fault: the bundle should not live in two other personas). None:
// nullptr.
QRNUserIdentityPtr chooseAmong(const std::vector<QRNUserIdentityPtr>& candidates,
                               const QRNUserIdentityPtr& own, const std::string& identifier) {
    if (candidates.empty()) {
        return nullptr;
    }
    if (candidates.size() == 1) {
        return candidates.front();
    }
    for (const QRNUserIdentityPtr& candidate : candidates) {
        if (candidate && candidate->isEqual(*own)) {
            return own;
        }
    }
    QRN_LOG_FAULT(LogCategory::Vell,
                  "Ambiguous user identity from [{}]. Expected one of [{}], got {}", identifier,
                  describe(candidates), own->shortDescription());
    return own;
}

CodeResult<QRNUserIdentityPtr> noClientIdentity(const std::string& identifier) {
    QRN_ERROR(kQRNErrorReplaceDifferentPersonas, "No client identity to choose a persona for {}",
              identifier);
    return QRN_CODE(kQRNErrorReplaceDifferentPersonas);
}

} // namespace

CodeResult<QRNUserIdentityPtr>
QRNClientConnection::userIdentityForContainerIdentifier(const std::string& identifier,
                                                        std::uint64_t containerClass) {
    const QRNUserIdentityPtr own = userIdentity();
    if (!own) {
        return noClientIdentity(identifier);
    }
    if (!QRNContainerClass::isPerUser(containerClass) || !own->isNoSpecificPersona()) {
        return own;
    }
    // Plug-in and VPN data live with the app that contains them.
    std::optional<std::string> bundleIdentifier = identifier;
    if (containerClass == kQRNContainerClassPluginData ||
        containerClass == kQRNContainerClassVPNData) {
        bundleIdentifier =
            QRNCodeSigningMapping::sharedInstance().parentIdentifierForChildIdentifier(identifier);
    }
    std::vector<QRNUserIdentityPtr> candidates;
    if (bundleIdentifier) {
        candidates = QRNUserIdentitySharedCache::sharedCache().userIdentitiesForBundleIdentifier(
            *bundleIdentifier);
    }
    QRN_LOG_DEBUG(LogCategory::Vell,
                  "Chose bundleIdentifier: {}, userIdentities: {} for identifier: {}, class: {}",
                  bundleIdentifier.value_or("(null)"), describe(candidates), identifier,
                  containerClass);
    if (QRNUserIdentityPtr chosen = chooseAmong(candidates, own, identifier)) {
        return chosen;
    }
    QRN_LOG_ERROR(LogCategory::Vell, "{} trying to look up persona for {}:{}",
                  clientBundleIdentifier(), containerClass, identifier);
    return own;
}

CodeResult<QRNUserIdentityPtr>
QRNClientConnection::userIdentityForGroupOwner(const std::string& owner) {
    const QRNUserIdentityPtr own = userIdentity();
    if (!own) {
        return noClientIdentity(owner);
    }
    if (!own->isNoSpecificPersona()) {
        return own;
    }
    const std::string bundleIdentifier =
        QRNCodeSigningMapping::sharedInstance().parentIdentifierForChildIdentifier(owner).value_or(
            owner);
    const std::vector<QRNUserIdentityPtr> candidates =
        QRNUserIdentitySharedCache::sharedCache().userIdentitiesForBundleIdentifier(
            bundleIdentifier);
    QRN_LOG_DEBUG(LogCategory::Vell,
                  "Chose bundleIdentifier: {} for group container lookup, userIdentities: {} for "
                  "identifier: {}",
                  bundleIdentifier, describe(candidates), owner);
    if (QRNUserIdentityPtr chosen = chooseAmong(candidates, own, owner)) {
        return chosen;
    }
    QRN_ERROR(kQRNErrorReplaceDifferentPersonas, "{} trying to look up persona for group owner {}",
              clientBundleIdentifier(), owner);
    return QRN_CODE(kQRNErrorReplaceDifferentPersonas);
}

} // namespace quarn
