// Reading request arguments (nothing from a client is trusted: every value
// is type-checked) and the reply keys shared by several handlers.

#include "Daemon/service/QRNCommandHandlers.h"

#include "Daemon/model/QRNConcreteContainerIdentity.h"
#include "Daemon/model/QRNContainerClass.h"
#include "Daemon/operations/QRNClientConnection.h"
#include "Daemon/service/QRNSandboxTokens.h"
#include "Daemon/service/QRNVellReply.h"

#include <algorithm>

namespace quarn {

const std::string* QRNCommandHandlers::stringValue(const Value& request, std::string_view key) {
    const Value* value = request.get(key);
    return value ? value->asString() : nullptr;
}

std::uint64_t QRNCommandHandlers::unsignedValue(const Value& request, std::string_view key) {
    const Value* value = request.get(key);
    return value && value->kind() == Value::Kind::UInt64 ? value->asUInt64().value_or(0) : 0;
}

bool QRNCommandHandlers::boolValue(const Value& request, std::string_view key) {
    const Value* value = request.get(key);
    return value && value->asBool().value_or(false);
}

std::optional<UUID> QRNCommandHandlers::uuidValue(const Value* value) {
    if (!value) {
        return std::nullopt;
    }
    if (std::optional<UUID> uuid = value->asUUID()) {
        return uuid;
    }
    const Value::Data* data = value->asData();
    if (!data || data->size() != UUID::Bytes().size()) {
        return std::nullopt;
    }
    UUID::Bytes bytes;
    std::copy(data->begin(), data->end(), bytes.begin());
    return UUID(bytes);
}

CodeResult<std::string> QRNCommandHandlers::identifierFromRequest(const Value& request,
                                                                  const QRNClientConnection& client,
                                                                  std::string_view key) {
    const Value* value = request.get(key);
    const std::string* identifier = value ? value->asString() : &client.clientBundleIdentifier();
    if (!identifier || identifier->empty()) {
        QRN_ERROR(kQRNErrorMissingIdentifier, "Invalid object: missing identifier");
        return QRN_CODE(kQRNErrorMissingIdentifier);
    }
    return *identifier;
}

CodeResult<QRNContainerIdentityPtr>
QRNCommandHandlers::identityFromRequest(const Value& request, QRNClientConnection& client,
                                        std::string_view identifierKey, std::string_view classKey) {
    auto identifier = identifierFromRequest(request, client, identifierKey);
    if (!identifier) {
        return QRN_CODE(identifier.error());
    }
    const std::uint64_t containerClass = unsignedValue(request, classKey);
    if (!QRNContainerClass::isValid(containerClass)) {
        QRN_ERROR(kQRNErrorUnexpectedContainerType, "Passed an unexpected container type: {}",
                  containerClass);
        return QRN_CODE(kQRNErrorUnexpectedContainerType);
    }
    auto userIdentity = client.userIdentityForContainerIdentifier(*identifier, containerClass);
    if (!userIdentity) {
        return QRN_CODE(userIdentity.error());
    }
    return QRNContainerIdentity::containerIdentityWithUserIdentity(*userIdentity, *identifier,
                                                                   containerClass);
}

CodeResult<QRNContainerIdentityPtr>
QRNCommandHandlers::concreteIdentityFromRequest(const Value& request,
                                                const QRNClientConnection& client) {
    auto identifier = identifierFromRequest(request, client);
    if (!identifier) {
        return QRN_CODE(identifier.error());
    }
    const std::uint64_t containerClass = unsignedValue(request, "ContainerClass");
    const Value* uuid = request.get("UUID");
    if (!uuid) {
        return QRNContainerIdentity::containerIdentityWithUserIdentity(client.userIdentity(),
                                                                       *identifier, containerClass);
    }
    // A malformed UUID is handed on as it came, so the identity refuses it.
    const std::optional<UUID> parsed = uuidValue(uuid);
    const Value uuidArgument = parsed ? Value(*parsed) : *uuid;
    const Value identifierArgument(*identifier);
    auto concrete = QRNConcreteContainerIdentity::containerIdentityWithUUID(
        &uuidArgument, client.userIdentity(), &identifierArgument, containerClass);
    if (!concrete) {
        return QRN_CODE(concrete.error());
    }
    return QRNContainerIdentityPtr(*concrete);
}

void QRNCommandHandlers::addPersonaAndToken(QRNVellReply& reply, const QRNClientConnection& client,
                                            const QRNMetadata& metadata,
                                            std::string_view tokenKey) {
    const QRNUserIdentityPtr& userIdentity = metadata.userIdentity();
    if (userIdentity && userIdentity->personaUniqueString()) {
        reply.set("ReplyPersonaUniqueString", *userIdentity->personaUniqueString());
    }
    if (auto token = QRNSandboxTokens::sandboxTokenForContainer(client, metadata)) {
        reply.set(std::string(tokenKey), std::move(*token));
    }
}

} // namespace quarn
