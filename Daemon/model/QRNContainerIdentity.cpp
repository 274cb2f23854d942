#include "Daemon/model/QRNContainerIdentity.h"

#include "Daemon/model/QRNContainerClass.h"
#include "Daemon/model/QRNUserIdentitySharedCache.h"

#include <functional>

namespace quarn {

QRNContainerIdentity::QRNContainerIdentity(QRNUserIdentityPtr userIdentity, std::string identifier,
                                           std::uint64_t containerClass)
    : identifier_(std::move(identifier)), containerClass_(containerClass),
      userIdentity_(std::move(userIdentity)) {}

QRNContainerIdentityPtr QRNContainerIdentity::init() {
    QRN_LOG_ERROR(LogCategory::Unspecified, "You cannot init this class directly.");
    return nullptr;
}

std::uint64_t QRNContainerIdentity::initWithUserIdentity(const QRNUserIdentityPtr& userIdentity,
                                                         const Value* identifier,
                                                         std::uint64_t containerClass) {
    if (!userIdentity) {
        QRN_LOG_ERROR(LogCategory::Unspecified, "Invalid object: no user identity");
        return kQRNErrorInvalidArgument;
    }
    if (!identifier || identifier->isNone()) {
        QRN_LOG_ERROR(LogCategory::Unspecified, "Invalid object: missing identifier");
        return kQRNErrorMissingIdentifier;
    }
    if (!identifier->isString()) {
        QRN_LOG_ERROR(LogCategory::Unspecified, "Invalid object: identifier = [{}]",
                      identifier->description());
        return kQRNErrorInvalidArgument;
    }
    if (!QRNContainerClass::isValid(containerClass)) {
        QRN_LOG_ERROR(LogCategory::Unspecified, "Invalid object: container class = {}",
                      containerClass);
        return kQRNErrorInvalidArgument;
    }
    return kQRNErrorNone;
}

CodeResult<QRNContainerIdentityPtr> QRNContainerIdentity::containerIdentityWithUserIdentity(
    QRNUserIdentityPtr userIdentity, const Value* identifier, std::uint64_t containerClass) {
    std::uint64_t code = initWithUserIdentity(userIdentity, identifier, containerClass);
    if (code != kQRNErrorNone) {
        return QRN_CODE(code);
    }
    return QRNContainerIdentityPtr(
        new QRNContainerIdentity(std::move(userIdentity), *identifier->asString(), containerClass));
}

CodeResult<QRNContainerIdentityPtr> QRNContainerIdentity::containerIdentityWithUserIdentity(
    QRNUserIdentityPtr userIdentity, std::string identifier, std::uint64_t containerClass) {
    Value value(std::move(identifier));
    return containerIdentityWithUserIdentity(std::move(userIdentity), &value, containerClass);
}

CodeResult<QRNContainerIdentityPtr>
QRNContainerIdentity::containerIdentityWithIdentifier(std::string identifier,
                                                      std::uint64_t containerClass) {
    if (QRNContainerClass::isUserIdentityRequired(containerClass)) {
        QRN_LOG_FAULT(LogCategory::Unspecified,
                      "Attempt to create a container identity without a user identity when one is "
                      "required; identifier = [{}], class = {}",
                      identifier, containerClass);
        return QRN_CODE(kQRNErrorInvalidArgument);
    }
    return containerIdentityWithUserIdentity(QRNUserIdentitySharedCache::defaultUserIdentity(),
                                             std::move(identifier), containerClass);
}

bool QRNContainerIdentity::isEqualToContainerIdentity(const QRNContainerIdentity& other) const {
    return identifier_ == other.identifier_ &&
           QRNUserIdentity::Equal()(userIdentity_, other.userIdentity_) &&
           containerClass_ == other.containerClass_;
}

bool QRNContainerIdentity::isEqual(const QRNContainerIdentity& other) const {
    return this == &other || isEqualToContainerIdentity(other);
}

std::size_t QRNContainerIdentity::hash() const {
    return std::hash<std::string>()(identifier_) ^ userIdentity_->hash() ^
           static_cast<std::size_t>(containerClass_);
}

std::string QRNContainerIdentity::description() const {
    return fmt::format("<QRNContainerIdentity: {}; userIdentity = {}, identifier = {}, class = {}>",
                       fmt::ptr(this), userIdentity_->shortDescription(), identifier_,
                       containerClass_);
}

} // namespace quarn
