#include "Daemon/model/QRNUserIdentity.h"

#include "Daemon/fs/QRNFileManager.h"
#include "Daemon/model/QRNContainerClass.h"
#include "Daemon/model/QRNPlatformConstants.h"

#include <functional>

namespace quarn {

QRNUserIdentity::QRNUserIdentity(std::uint32_t uid, std::uint32_t gid, std::filesystem::path home,
                                 std::optional<std::string> personaUniqueString,
                                 std::int32_t personaType, std::uint32_t kernelPersonaID)
    : homeDirectoryURL_(std::move(home)), kernelPersonaID_(kernelPersonaID), posixUID_(uid),
      posixGID_(gid), personaType_(personaType),
      personaUniqueString_(std::move(personaUniqueString)) {
    if (homeDirectoryURL_.empty()) {
        QRN_LOG_FAULT(LogCategory::Unspecified, "Home directory cannot be nil");
    }
    // Only an enterprise persona gets a data domain of its own; every other
    // identity of a user shares the uid's.
    if (personaUniqueString_ && personaType_ == kQRNPersonaTypeEnterprise) {
        identifier_ = *personaUniqueString_;
    } else {
        identifier_ = fmt::format("{}", posixUID_);
    }
}

QRNUserIdentityPtr QRNUserIdentity::initWithUID(std::uint32_t uid, std::uint32_t gid,
                                                std::filesystem::path homeDirectoryURL,
                                                std::optional<std::string> personaUniqueString,
                                                std::int32_t personaType,
                                                std::uint32_t kernelPersonaID) {
    if (uid < kMinimumUserUID) {
        QRN_LOG_ERROR(LogCategory::Unspecified,
                      "Attempt to create a QRNUserIdentity object with a role user uid is not "
                      "allowed: uid = {}, gid = {}",
                      uid, gid);
        return nullptr;
    }
    return QRNUserIdentityPtr(new QRNUserIdentity(uid, gid, std::move(homeDirectoryURL),
                                                  std::move(personaUniqueString), personaType,
                                                  kernelPersonaID));
}

QRNUserIdentityPtr QRNUserIdentity::init() {
    return initWithUID(kLegacyMobileUID, kLegacyMobileUID,
                       QRNFileManager::homeDirectoryURLForPOSIXUID(kLegacyMobileUID), std::nullopt,
                       kQRNPersonaTypePersonal, kLegacyMobileUID);
}

std::uint32_t QRNUserIdentity::posixUIDForContainerClass(std::uint64_t containerClass) const {
    if (QRNContainerClass::isBundle(containerClass)) {
        return QRNPlatformConstants::kInstallationUID;
    }
    if (QRNContainerClass::isSystem(containerClass)) {
        return QRNPlatformConstants::kSystemContainerUID;
    }
    return posixUID_;
}

std::uint32_t QRNUserIdentity::posixGIDForContainerClass(std::uint64_t containerClass) const {
    // Bundle and system owners have no group constant of their own: the gid
    // is deliberately the same number as the uid.
    if (QRNContainerClass::isBundle(containerClass)) {
        return QRNPlatformConstants::kInstallationUID;
    }
    if (QRNContainerClass::isSystem(containerClass)) {
        return QRNPlatformConstants::kSystemContainerUID;
    }
    return posixGID_;
}

bool QRNUserIdentity::isUserIdentityRequiredForContainerClass(std::uint64_t containerClass) {
    return QRNContainerClass::isUserIdentityRequired(containerClass);
}

const char* QRNUserIdentity::personaTypeDescription(std::int32_t personaType) {
    switch (personaType) {
    case kQRNPersonaTypePersonal:
        return "personal";
    case kQRNPersonaTypeEnterprise:
        return "enterprise";
    case kQRNPersonaTypeUnspecific:
        return "unspecific";
    default:
        return "unknown";
    }
}

Value QRNUserIdentity::plist() const {
    Value dict = Value::dictionary();
    dict.set("posixUID", posixUID_);
    dict.set("posixGID", posixGID_);
    dict.set("type", static_cast<std::uint64_t>(static_cast<std::uint32_t>(personaType_)));
    dict.set("version", "2");
    return dict;
}

QRNUserIdentityPtr QRNUserIdentity::copy() const {
    // A copy starts as the default identity and takes every field but the
    // kernel persona ID, which therefore stays the default's 501.
    return QRNUserIdentityPtr(new QRNUserIdentity(posixUID_, posixGID_, homeDirectoryURL_,
                                                  personaUniqueString_, personaType_,
                                                  kLegacyMobileUID));
}

std::size_t QRNUserIdentity::hash() const {
    return std::hash<std::string>()(identifier_);
}

std::string QRNUserIdentity::description() const {
    return fmt::format("<QRNUserIdentity: {}; posixUID = {}, posixGID = {}, identifier = {}, "
                       "homeDirectoryURL = {}>",
                       fmt::ptr(this), posixUID_, posixGID_, identifier_,
                       homeDirectoryURL_.string());
}

std::string QRNUserIdentity::shortDescription() const {
    return fmt::format("<QRNUserIdentity: {}; {}/{}/{}/{}/{}>", fmt::ptr(this), posixUID_,
                       posixGID_, identifier_, personaType_, kernelPersonaID_);
}

} // namespace quarn
