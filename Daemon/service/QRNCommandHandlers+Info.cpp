// Commands on one existing container, named by identifier, class and
// optionally its UUID in the client's own user identity; and the list of
// personas a client reaches.

#include "Daemon/service/QRNCommandHandlers.h"

#include "Daemon/model/QRNGlobalConfiguration.h"
#include "Daemon/model/QRNUserIdentitySharedCache.h"
#include "Daemon/operations/QRNClientConnection.h"
#include "Daemon/service/QRNVellReply.h"

namespace quarn {

namespace {

// Whether the container lives in its class's transient directory.
bool isTransient(const QRNMetadata& metadata) {
    auto transientDirectory =
        QRNGlobalConfiguration::sharedInstance().containerDirectoryURLForUserIdentity(
            metadata.userIdentity(), metadata.containerClass(), true);
    return transientDirectory && metadata.url().parent_path() == *transientDirectory;
}

} // namespace

void QRNCommandHandlers::setInfoValue(const Value& request, QRNVellReply&,
                                      QRNClientConnection& client, std::uint64_t& error) {
    auto identity = concreteIdentityFromRequest(request, client);
    if (!identity) {
        return setError(error, identity.error());
    }
    // An absent "Value" removes the key.
    const Value* value = request.get("Value");
    if (auto set =
            client.setInfoValue(value ? *value : Value(), request.get("Key"), *identity, true);
        !set) {
        setError(error, set.error());
    }
}

void QRNCommandHandlers::infoValue(const Value& request, QRNVellReply& reply,
                                   QRNClientConnection& client, std::uint64_t& error) {
    auto identity = concreteIdentityFromRequest(request, client);
    if (!identity) {
        return setError(error, identity.error());
    }
    auto value = client.infoValueForKey(request.get("Key"), *identity, true);
    if (!value) {
        return setError(error, value.error());
    }
    reply.set("ReplyInfoValue", std::move(*value));
}

void QRNCommandHandlers::containerMetadata(const Value& request, QRNVellReply& reply,
                                           QRNClientConnection& client, std::uint64_t& error) {
    auto identity = concreteIdentityFromRequest(request, client);
    if (!identity) {
        return setError(error, identity.error());
    }
    auto found = client.metadataWithContainerIdentity(*identity);
    if (!found) {
        return setError(error, found.error());
    }
    const QRNMetadata& metadata = **found;
    reply.set("ReplyPath", metadata.url().string());
    reply.set("ReplyTransient", isTransient(metadata));
    if (boolValue(request, "InfoDictRequested")) {
        reply.set("ReplyInfoDictionary",
                  metadata.info().isDictionary() ? metadata.info() : Value::dictionary());
    }
    addPersonaAndToken(reply, client, metadata, "ReplySandboxToken");
}

void QRNCommandHandlers::recreateDefaultStructure(const Value& request, QRNVellReply&,
                                                  QRNClientConnection& client,
                                                  std::uint64_t& error) {
    auto identity = concreteIdentityFromRequest(request, client);
    if (!identity) {
        return setError(error, identity.error());
    }
    if (auto made = client.recreateDefaultStructureWithContainerIdentity(*identity); !made) {
        setError(error, made.error());
    }
}

void QRNCommandHandlers::regenerateDirectoryUUID(const Value& request, QRNVellReply&,
                                                 QRNClientConnection& client,
                                                 std::uint64_t& error) {
    auto identity = concreteIdentityFromRequest(request, client);
    if (!identity) {
        return setError(error, identity.error());
    }
    if (auto moved = client.regenerateDirectoryUUIDWithContainerIdentity(*identity); !moved) {
        setError(error, moved.error());
    }
}

void QRNCommandHandlers::diskUsage(const Value& request, QRNVellReply& reply,
                                   QRNClientConnection& client, std::uint64_t& error) {
    auto identity = concreteIdentityFromRequest(request, client);
    if (!identity) {
        return setError(error, identity.error());
    }
    auto bytes = client.diskUsageWithContainerIdentity(*identity);
    if (!bytes) {
        return setError(error, bytes.error());
    }
    reply.set("ReplyDiskUsage", *bytes);
}

void QRNCommandHandlers::personaUniqueStrings(const Value&, QRNVellReply& reply,
                                              QRNClientConnection& client, std::uint64_t& error) {
    const QRNUserIdentityPtr own = client.userIdentity();
    if (!own) {
        QRN_ERROR(kQRNErrorReplaceDifferentPersonas, "No client identity to list personas for");
        return setError(error, kQRNErrorReplaceDifferentPersonas);
    }
    Value personas = Value::array();
    auto append = [&personas](const QRNUserIdentityPtr& identity) {
        if (identity && identity->personaUniqueString()) {
            personas.append(*identity->personaUniqueString());
        }
    };
    // Only a client without a specific persona reaches the others.
    if (own->isNoSpecificPersona()) {
        QRNUserIdentitySharedCache::sharedCache()
            .forEachAccessibleUserIdentitySynchronouslyExecuteBlock(append);
    } else {
        append(own);
    }
    reply.set("ReplyPersonaUniqueStringsArray", std::move(personas));
}

} // namespace quarn
