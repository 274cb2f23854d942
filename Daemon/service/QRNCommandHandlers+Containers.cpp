// Commands that create, find, list and delete containers.

#include "Daemon/service/QRNCommandHandlers.h"

#include "Daemon/model/QRNConcreteContainerIdentity.h"
#include "Daemon/model/QRNContainerClass.h"
#include "Daemon/model/QRNUserIdentitySharedCache.h"
#include "Daemon/model/QRNWhitelist.h"
#include "Daemon/operations/QRNClientConnection.h"
#include "Daemon/operations/QRNCommandQueue.h"
#include "Daemon/operations/QRNCommandStageForDelete.h"
#include "Daemon/service/QRNVellReply.h"
#include "Daemon/support/Log.h"

namespace quarn {

namespace {

const Value::Array kNoElements;

const Value::Array& arrayValue(const Value& request, std::string_view key) {
    const Value* value = request.get(key);
    const Value::Array* array = value ? value->asArray() : nullptr;
    return array ? *array : kNoElements;
}

// One staged-delete identity from the elements at one index of command 3's
// arrays; the identity's own checks refuse elements of the wrong type.
CodeResult<QRNContainerIdentityPtr> stagedIdentity(const Value& uuid, const Value& containerClass,
                                                   const Value& identifier,
                                                   const QRNUserIdentityPtr& userIdentity) {
    std::optional<UUID> parsed = QRNCommandHandlers::uuidValue(&uuid);
    if (!parsed && uuid.asString()) {
        parsed = UUID::parse(*uuid.asString());
    }
    const Value uuidArgument = parsed ? Value(*parsed) : uuid;
    const std::uint64_t cls =
        containerClass.kind() == Value::Kind::UInt64 ? containerClass.asUInt64().value_or(0) : 0;
    auto made = QRNConcreteContainerIdentity::containerIdentityWithUUID(&uuidArgument, userIdentity,
                                                                        &identifier, cls);
    if (!made) {
        return QRN_CODE(made.error());
    }
    return QRNContainerIdentityPtr(*made);
}

} // namespace

void QRNCommandHandlers::createOrLookupContainer(const Value& request, QRNVellReply& reply,
                                                 QRNClientConnection& client,
                                                 std::uint64_t& error) {
    auto identity = identityFromRequest(request, client);
    if (!identity) {
        return setError(error, identity.error());
    }
    bool existed = false;
    auto found = client.createOrLookupContainerWithContainerIdentity(
        *identity, boolValue(request, "CreateIfNecessary"), boolValue(request, "Transient"), true,
        &existed);
    if (!found) {
        return setError(error, found.error());
    }
    const QRNMetadata& metadata = **found;
    reply.set("ReplyUUID", metadata.uuid());
    reply.set("ReplyExisted", existed);
    reply.set("ReplyPath", metadata.url().string());
    reply.set("ReplyIdentifier", metadata.identifier());
    addPersonaAndToken(reply, client, metadata, "ReplySandboxToken");
}

void QRNCommandHandlers::containersWithClass(const Value& request, QRNVellReply& reply,
                                             QRNClientConnection& client, std::uint64_t& error) {
    auto containers = client.containersWithClass(unsignedValue(request, "ContainerClass"),
                                                 boolValue(request, "Transient"));
    if (!containers) {
        return setError(error, containers.error());
    }
    Value identifiers = Value::array();
    Value uuids = Value::array();
    Value personas = Value::array();
    for (const QRNMetadataPtr& metadata : *containers) {
        identifiers.append(metadata->identifier());
        uuids.append(metadata->uuid());
        // No persona adds nothing, so this array may be the shorter one.
        if (metadata->userIdentity() && metadata->userIdentity()->personaUniqueString()) {
            personas.append(*metadata->userIdentity()->personaUniqueString());
        }
    }
    reply.set("ReplyIdsArray", std::move(identifiers));
    reply.set("ReplyUUIDsArray", std::move(uuids));
    reply.set("ReplyPersonaUniqueStringsArray", std::move(personas));
}

void QRNCommandHandlers::stageContainersForDelete(const Value& request, QRNVellReply&,
                                                  QRNClientConnection& client,
                                                  std::uint64_t& error) {
    const Value::Array& classes = arrayValue(request, "ContainerClassesArray");
    const Value::Array& uuids = arrayValue(request, "UUIDsArray");
    const Value::Array& identifiers = arrayValue(request, "IdentifiersArray");
    // The persona strings only take part in the count check.
    const Value::Array& personas = arrayValue(request, "PersonaUniqueStringsArray");
    const std::size_t count = uuids.size();
    if (classes.size() != count || identifiers.size() != count || personas.size() != count) {
        QRN_ERROR(kQRNErrorBadRequestArgument,
                  "Can't act on an invalid input: UUIDString count: {}, class count: {}, ID count: "
                  "{}, persona string count: {}",
                  uuids.size(), classes.size(), identifiers.size(), personas.size());
        return setError(error, kQRNErrorBadRequestArgument);
    }
    const QRNUserIdentityPtr userIdentity =
        QRNUserIdentitySharedCache::sharedCache().userIdentityForCurrentContext();
    std::vector<QRNContainerIdentityPtr> identities;
    for (std::size_t i = 0; i < count; ++i) {
        auto identity = stagedIdentity(uuids[i], classes[i], identifiers[i], userIdentity);
        if (!identity) {
            // Nothing is staged unless every element is sound.
            return setError(error, identity.error());
        }
        identities.push_back(std::move(*identity));
    }
    if (!client.commandQueue()) {
        QRN_ERROR(kQRNErrorInvalidArgument, "No command queue to stage {} deletes", count);
        return setError(error, kQRNErrorInvalidArgument);
    }
    client.commandQueue()->insertCommand(
        QRNCommandStageForDelete::commandForStageForDeleteWithContainerIdentities(
            std::move(identities), true, nullptr));
}

void QRNCommandHandlers::deleteContainersOnDeathRow(const Value&, QRNVellReply& reply,
                                                    QRNClientConnection& client, std::uint64_t&) {
    // The dispatcher does not reply to this command when it succeeds: the
    // completion does, with its own copy of the reply.
    client.deleteContainersOnDeathRowWithCompletion([reply](std::optional<Error> failure) mutable {
        reply.sendWithError(failure ? failure->qrnCode(kQRNErrorDestroyFailed) : kQRNErrorNone);
    });
}

void QRNCommandHandlers::deleteContainer(const Value& request, QRNVellReply&,
                                         QRNClientConnection& client, std::uint64_t& error) {
    auto identity = identityFromRequest(request, client);
    if (!identity) {
        return setError(error, identity.error());
    }
    if (auto deleted =
            client.deleteContainerWithContainerIdentity(*identity, boolValue(request, "Transient"));
        !deleted) {
        setError(error, deleted.error());
    }
}

void QRNCommandHandlers::systemContainerPath(const Value& request, QRNVellReply& reply,
                                             QRNClientConnection& client, std::uint64_t& error) {
    auto identifier = identifierFromRequest(request, client);
    if (!identifier) {
        return setError(error, identifier.error());
    }
    // Anyone may reach a well-known system container.
    if (*identifier != client.clientBundleIdentifier() && !client.allowOtherIdLookup() &&
        QRNWhitelist::sharedWhitelist().systemContainerIdIsWellknown(*identifier)) {
        client.setAllowOtherIdLookup(true);
    }
    auto userIdentity =
        client.userIdentityForContainerIdentifier(*identifier, kQRNContainerClassSystemData);
    if (!userIdentity) {
        return setError(error, userIdentity.error());
    }
    auto identity = QRNContainerIdentity::containerIdentityWithUserIdentity(
        *userIdentity, *identifier, kQRNContainerClassSystemData);
    if (!identity) {
        return setError(error, identity.error());
    }
    auto found = client.createOrLookupContainerWithContainerIdentity(*identity, true, false, true);
    if (!found) {
        return setError(error, found.error());
    }
    reply.set("ReplyPath", (*found)->url().string());
}

} // namespace quarn
