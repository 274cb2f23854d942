// Commands on group containers: an owner's application and system groups,
// and one system group by its identifier.

#include "Daemon/service/QRNCommandHandlers.h"

#include "Daemon/codesigning/QRNCodeSigningMapping.h"
#include "Daemon/model/QRNContainerClass.h"
#include "Daemon/model/QRNWhitelist.h"
#include "Daemon/operations/QRNClientConnection.h"
#include "Daemon/service/QRNSandboxTokens.h"
#include "Daemon/service/QRNVellReply.h"
#include "Daemon/support/Log.h"

#include <algorithm>

namespace quarn {

namespace {

// Any system group may be reached by this one identifier, entitled or not.
constexpr std::string_view kSharedLoggingGroup = "systemgroup.com.orvex.sharedpclogging";

// Commands 13 and 16: the owner's groups of one class, by group identifier.
void groupContainers(const Value& request, QRNVellReply& reply, QRNClientConnection& client,
                     std::uint64_t& error, std::uint64_t groupClass, bool withExtras) {
    auto owner = QRNCommandHandlers::identifierFromRequest(request, client);
    if (!owner) {
        return QRNCommandHandlers::setError(error, owner.error());
    }
    auto userIdentity = client.userIdentityForGroupOwner(*owner);
    if (!userIdentity) {
        return QRNCommandHandlers::setError(error, userIdentity.error());
    }
    auto groups = client.groupContainersForOwnerIdentifier(*owner, *userIdentity, groupClass);
    if (!groups) {
        return QRNCommandHandlers::setError(error, groups.error());
    }
    Value paths = Value::dictionary();
    Value tokens = Value::dictionary();
    Value personas = Value::dictionary();
    const bool sandboxed = client.clientIdentity() && client.clientIdentity()->isSandboxed();
    for (const auto& [group, metadata] : *groups) {
        paths.set(group, metadata->url().string());
        if (!withExtras || !sandboxed) {
            continue;
        }
        if (auto token = QRNSandboxTokens::sandboxTokenForContainer(client, *metadata)) {
            tokens.set(group, std::move(*token));
        }
        if (metadata->userIdentity() && metadata->userIdentity()->personaUniqueString()) {
            personas.set(group, *metadata->userIdentity()->personaUniqueString());
        }
    }
    reply.set("ReplyGroupContainerDict", std::move(paths));
    if (tokens.size() != 0) {
        reply.set("ReplySandboxTokenDict", std::move(tokens));
    }
    if (personas.size() != 0) {
        reply.set("ReplyPersonaUniqueStringDict", std::move(personas));
    }
}

std::string describe(const std::vector<std::string>& identifiers) {
    std::string text;
    for (const std::string& identifier : identifiers) {
        text += text.empty() ? "" : ", ";
        text += identifier;
    }
    return "[" + text + "]";
}

// The client's own system groups include `group`: look them all up and take it.
CodeResult<QRNMetadataPtr> entitledSystemGroup(QRNClientConnection& client,
                                               const QRNUserIdentityPtr& userIdentity,
                                               const std::string& group) {
    auto groups = client.groupContainersForOwnerIdentifier(
        client.clientBundleIdentifier(), userIdentity, kQRNContainerClassSystemGroup);
    if (!groups) {
        QRN_LOG_ERROR(LogCategory::Vell,
                      "No results returned for group container query for identity: {}, error: {}",
                      userIdentity->shortDescription(), groups.error());
        return QRN_CODE(groups.error());
    }
    auto found = groups->find(group);
    if (found == groups->end()) {
        return QRN_CODE(kQRNErrorContainerNotFound);
    }
    return found->second;
}

// A well-known system group, or the shared logging group: anyone may have it.
CodeResult<QRNMetadataPtr> openSystemGroup(QRNClientConnection& client,
                                           const QRNUserIdentityPtr& userIdentity,
                                           const std::string& group) {
    client.setAllowGroupIdLookup(true);
    auto identity = QRNContainerIdentity::containerIdentityWithUserIdentity(
        userIdentity, group, kQRNContainerClassSystemGroup);
    if (!identity) {
        QRN_LOG_ERROR(LogCategory::Vell,
                      "Could not generate a container identity for system group lookup "
                      "identifier: {}, class: {}, userIdentity: {}, error: {}",
                      group, kQRNContainerClassSystemGroup, userIdentity->shortDescription(),
                      identity.error());
        return QRN_CODE(identity.error());
    }
    auto found = client.createOrLookupContainerWithContainerIdentity(*identity, true, false, true);
    if (!found) {
        QRN_LOG_ERROR(LogCategory::Vell,
                      "No results returned for system group lookup identity: {}, error: {}",
                      (*identity)->description(), found.error());
    }
    return found;
}

} // namespace

void QRNCommandHandlers::groupContainersForOwner(const Value& request, QRNVellReply& reply,
                                                 QRNClientConnection& client,
                                                 std::uint64_t& error) {
    groupContainers(request, reply, client, error, kQRNContainerClassAppGroup, true);
}

void QRNCommandHandlers::systemGroupContainersForOwner(const Value& request, QRNVellReply& reply,
                                                       QRNClientConnection& client,
                                                       std::uint64_t& error) {
    groupContainers(request, reply, client, error, kQRNContainerClassSystemGroup, false);
}

void QRNCommandHandlers::groupIdentifiersForOwner(const Value&, QRNVellReply& reply,
                                                  QRNClientConnection& client,
                                                  std::uint64_t& error) {
    auto groups = client.groupContainerIdentifiersForOwnerIdentifier(
        client.clientBundleIdentifier(), kQRNContainerClassAppGroup, true);
    if (!groups) {
        return setError(error, groups.error());
    }
    Value identifiers = Value::array();
    for (const std::string& group : *groups) {
        identifiers.append(group);
    }
    reply.set("ReplyGroupIdentifiersArray", std::move(identifiers));
}

void QRNCommandHandlers::systemGroupContainerPath(const Value& request, QRNVellReply& reply,
                                                  QRNClientConnection& client,
                                                  std::uint64_t& error) {
    // A group never defaults to the client's own identifier.
    const std::string* group = stringValue(request, "GroupIdentifier");
    if (!group || group->empty()) {
        QRN_ERROR(kQRNErrorMissingIdentifier, "Invalid object: missing identifier");
        return setError(error, kQRNErrorMissingIdentifier);
    }
    const std::string& bundle = client.clientBundleIdentifier();
    std::vector<std::string> entitledGroups;
    if (auto groups = client.groupContainerIdentifiersForOwnerIdentifier(
            bundle, kQRNContainerClassSystemGroup, false)) {
        entitledGroups = std::move(*groups);
    }
    QRN_LOG_INFO(LogCategory::Vell, "Group ID: {}, bundle ID: {}, entitled group container IDs: {}",
                 *group, bundle, describe(entitledGroups));
    auto userIdentity =
        client.userIdentityForContainerIdentifier(bundle, kQRNContainerClassSystemGroup);
    if (!userIdentity) {
        QRN_LOG_ERROR(LogCategory::Vell,
                      "Could not generate a user identity for bundle: {}, class: {}, error: {}",
                      bundle, kQRNContainerClassSystemGroup, userIdentity.error());
        return setError(error, userIdentity.error());
    }
    CodeResult<QRNMetadataPtr> found = QRN_CODE(kQRNErrorNotEntitled);
    if (std::find(entitledGroups.begin(), entitledGroups.end(), *group) != entitledGroups.end()) {
        found = entitledSystemGroup(client, *userIdentity, *group);
    } else if (QRNWhitelist::sharedWhitelist().systemGroupContainerIdIsWellknown(*group) ||
               *group == kSharedLoggingGroup) {
        found = openSystemGroup(client, *userIdentity, *group);
    } else {
        QRN_ERROR(kQRNErrorNotEntitled,
                  "{} is not entitled for system group identifier: {}.  Only entitled for: {}",
                  bundle, *group, describe(entitledGroups));
        return setError(error, kQRNErrorNotEntitled);
    }
    if (!found) {
        QRN_LOG_ERROR(LogCategory::Vell,
                      "Did not find system group container with identifier: {} for {}", *group,
                      bundle);
        return setError(error, found.error());
    }
    reply.set("ReplyPath", (*found)->url().string());
}

} // namespace quarn
