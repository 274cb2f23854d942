#include "Daemon/operations/QRNClientIdentity.h"

#include "Daemon/model/QRNPlatformConstants.h"
#include "Daemon/model/QRNUserIdentitySharedCache.h"
#include "Daemon/platform/IpcConnection.h"
#include "Daemon/support/Log.h"
#include "Daemon/support/QRNDaemonContext.h"

#include <fmt/format.h>

#include <cerrno>
#include <mutex>
#include <utility>

namespace quarn {

namespace {

// The installer service's last identity, one per daemon context. It sends
// many requests in a row; reusing its identity saves a registry lookup each.
struct InstallerIdentityMemory {
    // Guards identity: requests of different connections make identities
    // concurrently, and each may read or replace it.
    std::mutex mutex;
    QRNClientIdentityPtr identity;
};

} // namespace

QRNClientIdentity::QRNClientIdentity(std::string bundleIdentifier, std::uint32_t uid,
                                     std::uint32_t gid, std::int32_t pid,
                                     QRNUserIdentityPtr userIdentity, Value entitlements,
                                     bool sandboxed, const AuditToken& auditToken, bool kernel)
    : bundleIdentifier_(std::move(bundleIdentifier)), posixUID_(uid), posixGID_(gid),
      posixPID_(pid), userIdentity_(std::move(userIdentity)),
      entitlements_(entitlements.isDictionary() ? std::move(entitlements) : Value::dictionary()),
      sandboxed_(sandboxed), auditToken_(auditToken), kernel_(kernel) {}

QRNClientIdentityPtr QRNClientIdentity::init() {
    QRN_LOG_ERROR(LogCategory::Unspecified, "You cannot init this class directly.");
    return nullptr;
}

QRNClientIdentityPtr QRNClientIdentity::initWithBundleIdentifier(
    std::string bundleIdentifier, std::uint32_t uid, std::uint32_t gid, std::int32_t pid,
    QRNUserIdentityPtr userIdentity, Value entitlements, bool sandboxed,
    const AuditToken& auditToken, bool kernel) {
    if (!userIdentity) {
        return nullptr;
    }
    return QRNClientIdentityPtr(
        new QRNClientIdentity(std::move(bundleIdentifier), uid, gid, pid, std::move(userIdentity),
                              std::move(entitlements), sandboxed, auditToken, kernel));
}

QRNClientIdentityPtr
QRNClientIdentity::privilegedClientIdentityWithUserIdentity(QRNUserIdentityPtr userIdentity,
                                                            bool kernel) {
    return initWithBundleIdentifier(std::string(kPrivilegedBundleIdentifier), 0, 0, 0,
                                    std::move(userIdentity), Value::dictionary(), false,
                                    AuditToken{}, kernel);
}

QRNClientIdentityPtr QRNClientIdentity::anonymousPrivilegedClientIdentity() {
    return privilegedClientIdentityWithUserIdentity(
        QRNUserIdentitySharedCache::sharedCache().defaultUserIdentity(), false);
}

bool QRNClientIdentity::boolValueOfEntitlement(std::string_view name) const {
    // Booleans and numbers both count; strings, arrays and dictionaries do not.
    const Value* value = entitlements_.get(name);
    if (!value) {
        return false;
    }
    if (std::optional<bool> flag = value->asBool()) {
        return *flag;
    }
    return value->isNumber() && value->asDouble().value_or(0) != 0;
}

std::uint32_t QRNClientIdentity::posixUIDForContainerClass(std::uint64_t containerClass) const {
    return userIdentity_->posixUIDForContainerClass(containerClass);
}

std::uint32_t QRNClientIdentity::posixGIDForContainerClass(std::uint64_t containerClass) const {
    return userIdentity_->posixGIDForContainerClass(containerClass);
}

std::string QRNClientIdentity::description() const {
    return fmt::format("<QRNClientIdentity: {}; bundleIdentifier = {}, userIdentity = {}, "
                       "posixUID = {}, posixGID = {}, posixPID = {}, isSandboxed = {}, "
                       "entitlements = {}>",
                       static_cast<const void*>(this), bundleIdentifier_,
                       userIdentity_->description(), posixUID_, posixGID_,
                       static_cast<std::uint32_t>(posixPID_), sandboxed_ ? 1 : 0,
                       entitlements_.description());
}

Result<CodeSigningInfo>
QRNClientIdentity::_codeSigningInfoFromAuditToken(const AuditToken& auditToken) {
    auto& registry = QRNDaemonContext::current().instance<CodeSigningRegistry>();
    std::optional<CodeSigningInfo> info = registry.infoForAuditToken(auditToken);
    if (!info) {
        return QRN_UNEXPECTED(QRN_POSIX_ERROR(ESRCH, "No code-signing entry for pid {}",
                                              IpcPeer::fieldsOfAuditToken(auditToken).pid));
    }
    return std::move(*info);
}

Result<std::string>
QRNClientIdentity::_bundleIdentifierFromAuditToken(const AuditToken& auditToken) {
    auto info = _codeSigningInfoFromAuditToken(auditToken);
    if (!info) {
        return QRN_UNEXPECTED(info.error());
    }
    return std::move(info->identifier);
}

QRNClientIdentityPtr
QRNClientIdentity::clientIdentityWithVellConnection(const IpcConnection& connection) {
    return clientIdentityWithPeer(connection.peer());
}

QRNClientIdentityPtr QRNClientIdentity::clientIdentityWithPeer(const IpcPeer& peer) {
    const auto pid = static_cast<std::int32_t>(peer.pid());
    const AuditToken& token = peer.auditToken();
    QRNUserIdentityPtr userIdentity =
        QRNUserIdentitySharedCache::sharedCache().userIdentityForCurrentContextWithUID(peer.uid(),
                                                                                       peer.gid());
    // One registry lookup answers identifier, entitlements and sandbox state.
    Result<CodeSigningInfo> info = _codeSigningInfoFromAuditToken(token);
    const bool isInstaller = info && info->identifier == QRNPlatformConstants::kInstallerIdentifier;
    auto& installer = QRNDaemonContext::current().instance<InstallerIdentityMemory>();
    if (isInstaller) {
        std::lock_guard guard(installer.mutex);
        if (installer.identity && installer.identity->auditToken() == token) {
            return installer.identity;
        }
    }
    Value entitlements = Value::dictionary();
    if (info && info->entitlements && info->entitlements->isDictionary()) {
        entitlements = *info->entitlements;
    } else {
        QRN_LOG_ERROR(LogCategory::Vell, "Missing or malformed entitlements for pid {}", pid);
    }
    QRNClientIdentityPtr identity;
    if (info) {
        identity = initWithBundleIdentifier(info->identifier, peer.uid(), peer.gid(), pid,
                                            std::move(userIdentity), std::move(entitlements),
                                            info->sandboxed, token, false);
    } else {
        QRN_LOG_ERROR(LogCategory::Vell, "Failed to copy signing ID for pid {} : {}", pid,
                      info.error().description());
    }
    if (isInstaller) {
        std::lock_guard guard(installer.mutex);
        installer.identity = identity;
    }
    QRN_LOG_INFO(LogCategory::Vell, "[{}] Vell client identity: {}", __func__,
                 identity ? identity->description() : "(null)");
    return identity;
}

} // namespace quarn
