// Group and system containers: paths by owner, group identifiers, and the
// system container and system group paths.

#include "Client/QRNContainerClient.h"

namespace quarn {

ClientResult<QRNGroupContainers>
QRNContainerClient::groupContainers(const std::optional<std::string>& owner) {
    auto reply = exchange(QRNClientRequests::groupContainers(owner));
    if (!reply) {
        return Unexpected(reply.error());
    }
    return QRNClientReplies::groupContainers(*reply);
}

ClientResult<std::vector<std::string>>
QRNContainerClient::groupIdentifiers(const std::optional<std::string>& owner) {
    auto reply = exchange(QRNClientRequests::groupIdentifiers(owner));
    if (!reply) {
        return Unexpected(reply.error());
    }
    return QRNClientReplies::strings(*reply, "ReplyGroupIdentifiersArray");
}

ClientResult<std::string>
QRNContainerClient::systemContainerPath(const std::optional<std::string>& identifier) {
    auto reply = exchange(QRNClientRequests::systemContainerPath(identifier));
    if (!reply) {
        return Unexpected(reply.error());
    }
    return QRNClientReplies::path(*reply);
}

ClientResult<std::map<std::string, std::string>>
QRNContainerClient::systemGroupContainers(const std::optional<std::string>& owner) {
    auto reply = exchange(QRNClientRequests::systemGroupContainers(owner));
    if (!reply) {
        return Unexpected(reply.error());
    }
    auto groups = QRNClientReplies::groupContainers(*reply);
    if (!groups) {
        return Unexpected(groups.error());
    }
    return std::move(groups->paths);
}

ClientResult<std::string>
QRNContainerClient::systemGroupContainerPath(const std::string& groupIdentifier) {
    auto reply = exchange(QRNClientRequests::systemGroupContainerPath(groupIdentifier));
    if (!reply) {
        return Unexpected(reply.error());
    }
    return QRNClientReplies::path(*reply);
}

} // namespace quarn
