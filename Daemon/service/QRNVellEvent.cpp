#include "Daemon/service/QRNVellEvent.h"

#include "Daemon/codesigning/QRNCodeSigningMapping.h"
#include "Daemon/operations/QRNClientConnection.h"
#include "Daemon/operations/QRNCommandQueue.h"
#include "Daemon/operations/QRNOperationGuard.h"
#include "Daemon/service/QRNClientIdentityCache.h"
#include "Daemon/service/QRNCommandTable.h"
#include "Daemon/service/QRNVellReply.h"
#include "Daemon/support/Log.h"
#include "Daemon/support/Signpost.h"

#include <fmt/format.h>

#include <exception>
#include <optional>
#include <string>
#include <vector>

namespace quarn {

namespace {

constexpr const char* kUnknownClient = "<unknown>";

struct Rights {
    bool entitled = false;
    bool allowOtherIdLookup = false;
    bool unrestricted = false;
    std::optional<Value> lookup;
    std::optional<std::vector<std::string>> wipeIdentifiers;
};

// What "allowed" grants, or else the lesser lookup rights.
Rights baseRights(const QRNClientIdentity& identity, const QRNCommandTableEntry& entry) {
    Rights rights;
    if (identity.boolValueOfEntitlement(QRNCommandTable::kAllowed)) {
        // "allowed" does not reach the test commands.
        rights.unrestricted = entry.entitlement != QRNCommandTable::kTestability;
        rights.allowOtherIdLookup = true;
        return rights;
    }
    rights.allowOtherIdLookup = identity.boolValueOfEntitlement(QRNCommandTable::kOtherIdLookup);
    if (entry.honoursLookupEntitlement) {
        const Value* lookup = identity.entitlements().get(QRNCommandTable::kLookup);
        if (lookup && lookup->isDictionary()) {
            rights.lookup = *lookup;
        }
    }
    return rights;
}

std::vector<std::string> stringsOf(const Value::Array& elements) {
    std::vector<std::string> strings;
    for (const Value& element : elements) {
        if (const std::string* string = element.asString()) {
            strings.push_back(*string);
        }
    }
    return strings;
}

// Whether the client holds the command's entitlement; answers whether it
// is admitted far enough to have its entitlements registered.
bool settleEntitlement(const QRNClientIdentity& identity, const QRNCommandTableEntry& entry,
                       Rights& rights) {
    if (entry.entitlement == QRNCommandTable::kWipeContainer) {
        // Only a list of identifiers entitles to wipe; a plain true does not.
        const Value* wipe = identity.entitlements().get(QRNCommandTable::kWipeContainer);
        if (const Value::Array* identifiers = wipe ? wipe->asArray() : nullptr) {
            rights.entitled = true;
            rights.wipeIdentifiers = stringsOf(*identifiers);
            return true;
        }
        QRN_LOG_INFO(LogCategory::Vell, "No entitled containers to wipe");
        if (rights.unrestricted) {
            rights.entitled = true;
            return true;
        }
    } else if (rights.unrestricted || identity.boolValueOfEntitlement(entry.entitlement)) {
        rights.entitled = true;
        return true;
    }
    return entry.allowsUnentitled || rights.lookup.has_value();
}

void registerCallerEntitlements(const QRNClientIdentity& identity,
                                const std::shared_ptr<QRNCommandQueue>& commandQueue) {
    // A failure here never refuses the request.
    const std::uint64_t result =
        QRNCodeSigningMapping::sharedInstance().processCallerRegisteredEntitlements(
            identity.entitlements(), identity.bundleIdentifier(), commandQueue);
    if (result != kQRNErrorNone) {
        QRN_LOG_ERROR(LogCategory::Vell, "Error processing entitlements for {} : {}",
                      identity.bundleIdentifier(), result);
    }
}

// Runs an admitted client's handler and the commands it queued; answers
// the client's bundle identifier for the log.
std::string runCommand(const QRNCommandTableEntry& entry,
                       const std::shared_ptr<IpcConnection>& connection, const Value& request,
                       QRNClientIdentityCache& identities, QRNVellReply& reply,
                       std::uint64_t& error) {
    auto commandQueue = std::make_shared<QRNCommandQueue>();
    const QRNClientIdentityPtr identity = identities.identityFor(*connection);
    const std::shared_ptr<QRNClientConnection> client =
        checkEntitlementsAndInitClientObject(identity, entry, commandQueue, error);
    if (!client) {
        return kUnknownClient;
    }
    try {
        entry.handler(request, reply, *client, error);
    } catch (const std::exception& exception) {
        QRNOperationGuard::reportException(exception);
        error = kQRNErrorException;
    }
    client->completeWithError(error);
    const std::string& bundle = client->clientBundleIdentifier();
    return bundle.empty() ? kUnknownClient : bundle;
}

} // namespace

std::shared_ptr<QRNClientConnection> checkEntitlementsAndInitClientObject(
    const QRNClientIdentityPtr& identity, const QRNCommandTableEntry& entry,
    const std::shared_ptr<QRNCommandQueue>& commandQueue, std::uint64_t& error) {
    Rights rights;
    if (identity) {
        rights = baseRights(*identity, entry);
        if (settleEntitlement(*identity, entry, rights)) {
            registerCallerEntitlements(*identity, commandQueue);
        }
    }
    if (!entry.allowsUnentitled && !rights.lookup && !rights.entitled) {
        QRN_LOG_ERROR(LogCategory::Vell, "connection attempt from pid {} ({}) is not entitled",
                      identity ? identity->posixPID() : 0,
                      identity ? identity->bundleIdentifier() : std::string("(null)"));
        error = kQRNErrorNotEntitled;
        return nullptr;
    }
    return std::make_shared<QRNClientConnection>(
        identity, rights.entitled, rights.allowOtherIdLookup, rights.unrestricted,
        std::move(rights.lookup), std::move(rights.wipeIdentifiers), commandQueue);
}

void QRNProcessVellEvent(const std::shared_ptr<IpcConnection>& connection,
                         const IpcConnection::Event& event) {
    QRNClientIdentityCache identities(*connection);
    QRNProcessVellEvent(connection, event, identities);
}

void QRNProcessVellEvent(const std::shared_ptr<IpcConnection>& connection,
                         const IpcConnection::Event& event, QRNClientIdentityCache& identities) {
    if (event.kind == IpcConnection::Event::Kind::Invalidated) {
        return;
    }
    const Value& request = event.body;
    // Read as the wire reads an unsigned number: missing or of another type is 0.
    const Value* commandValue = request.get("Command");
    const std::uint64_t command = commandValue && commandValue->kind() == Value::Kind::UInt64
                                      ? commandValue->asUInt64().value_or(0)
                                      : 0;
    if (!event.expectsReply) {
        QRN_LOG_ERROR(LogCategory::Vell, "Dictionary does not have reply context");
        connection->cancel();
        return;
    }
    Signpost signpost(LogCategory::Vell, "VellEventProcessing",
                      fmt::format(" command={} ", command));
    QRNVellReply reply(connection);
    std::uint64_t error = kQRNErrorNone;
    const QRNCommandTableEntry* entry = nullptr;
    std::string client = kUnknownClient;
    if (!request.isDictionary()) {
        QRN_LOG_ERROR(LogCategory::Vell, "Request is not a dictionary: {}", request.kindName());
        error = kQRNErrorInvalidCommand;
    } else if (command >= QRNCommandTable::kCount) {
        QRN_LOG_ERROR(LogCategory::Vell, "Invalid command index: {}",
                      static_cast<std::int64_t>(command));
        error = kQRNErrorInvalidCommand;
    } else if (QRNCommandTable::entries()[command].command != command) {
        QRN_LOG_ERROR(LogCategory::Vell, "Invalid command at index {}", command);
        error = kQRNErrorInvalidCommand;
    } else {
        entry = &QRNCommandTable::entries()[command];
        client = runCommand(*entry, connection, request, identities, reply, error);
    }
    signpost.end(fmt::format(" command={}  clientIdentifier={} ", command, client));
    QRN_LOG_NOTICE(LogCategory::Vell, "command={}, client={}, error={}", command, client, error);
    // A command that replies from its own completion gets a reply here only
    // when it failed before getting that far.
    if (!entry || entry->replyBySender || error != kQRNErrorNone) {
        reply.sendWithError(error);
    }
}

} // namespace quarn
