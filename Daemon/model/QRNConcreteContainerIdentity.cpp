#include "Daemon/model/QRNConcreteContainerIdentity.h"

namespace quarn {

QRNConcreteContainerIdentity::QRNConcreteContainerIdentity(const UUID& uuid,
                                                           QRNUserIdentityPtr userIdentity,
                                                           std::string identifier,
                                                           std::uint64_t containerClass)
    : QRNContainerIdentity(std::move(userIdentity), std::move(identifier), containerClass),
      uuid_(uuid) {}

QRNConcreteContainerIdentityPtr QRNConcreteContainerIdentity::init() {
    QRN_LOG_ERROR(LogCategory::Unspecified, "You cannot init this class directly.");
    return nullptr;
}

std::uint64_t QRNConcreteContainerIdentity::initWithUUID(const Value* uuid,
                                                         const QRNUserIdentityPtr& userIdentity,
                                                         const Value* identifier,
                                                         std::uint64_t containerClass) {
    std::uint64_t code = initWithUserIdentity(userIdentity, identifier, containerClass);
    if (code != kQRNErrorNone) {
        return code;
    }
    if (!uuid || uuid->kind() != Value::Kind::UUID) {
        QRN_LOG_ERROR(LogCategory::Unspecified, "Invalid object: uuid = [{}]",
                      uuid ? uuid->description() : "(null)");
        return kQRNErrorInvalidArgument;
    }
    return kQRNErrorNone;
}

CodeResult<QRNConcreteContainerIdentityPtr> QRNConcreteContainerIdentity::containerIdentityWithUUID(
    const Value* uuid, QRNUserIdentityPtr userIdentity, const Value* identifier,
    std::uint64_t containerClass) {
    std::uint64_t code = initWithUUID(uuid, userIdentity, identifier, containerClass);
    if (code != kQRNErrorNone) {
        return QRN_CODE(code);
    }
    return QRNConcreteContainerIdentityPtr(new QRNConcreteContainerIdentity(
        *uuid->asUUID(), std::move(userIdentity), *identifier->asString(), containerClass));
}

CodeResult<QRNConcreteContainerIdentityPtr> QRNConcreteContainerIdentity::containerIdentityWithUUID(
    const UUID& uuid, QRNUserIdentityPtr userIdentity, std::string identifier,
    std::uint64_t containerClass) {
    Value uuidValue(uuid);
    Value identifierValue(std::move(identifier));
    return containerIdentityWithUUID(&uuidValue, std::move(userIdentity), &identifierValue,
                                     containerClass);
}

bool QRNConcreteContainerIdentity::isEqualToConcreteContainerIdentity(
    const QRNConcreteContainerIdentity& other) const {
    return uuid_ == other.uuid_ && isEqualToContainerIdentity(other);
}

bool QRNConcreteContainerIdentity::isEqual(const QRNContainerIdentity& other) const {
    if (this == &other) {
        return true;
    }
    auto* concrete = dynamic_cast<const QRNConcreteContainerIdentity*>(&other);
    return concrete && isEqualToConcreteContainerIdentity(*concrete);
}

std::size_t QRNConcreteContainerIdentity::hash() const {
    return QRNContainerIdentity::hash() ^ uuid_.hash();
}

std::string QRNConcreteContainerIdentity::description() const {
    return fmt::format("<QRNConcreteContainerIdentity: {}; userIdentity = {}, identifier = {}, "
                       "class = {}, uuid = {}>",
                       fmt::ptr(this), userIdentity()->shortDescription(), identifier(),
                       containerClass(), uuid_.string());
}

} // namespace quarn
