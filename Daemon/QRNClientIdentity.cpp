#include "Daemon/QRNClientIdentity.h"

#include "Daemon/model/QRNUserIdentitySharedCache.h"
#include "Daemon/support/Log.h"

#include <fmt/format.h>

#include <utility>

namespace quarn {

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

} // namespace quarn
