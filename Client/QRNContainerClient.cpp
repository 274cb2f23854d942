#include "Client/QRNContainerClient.h"

namespace quarn {

namespace {

// Sends, then reads the reply with `parse` unless nothing came back.
template <class Parse>
auto exchangeAndParse(QRNContainerClient& client, const Value& request, Parse parse)
    -> decltype(parse(Value())) {
    auto reply = client.exchange(request);
    if (!reply) {
        return Unexpected(reply.error());
    }
    return parse(*reply);
}

} // namespace

ClientResult<Value> QRNContainerClient::exchange(const Value& request) {
    auto reply = client_.send(request);
    if (!reply) {
        return Unexpected(ClientError::transport(reply.error()));
    }
    return std::move(reply).value();
}

ClientResult<void> QRNContainerClient::exchangeForStatus(const Value& request) {
    return exchangeAndParse(*this, request, QRNClientReplies::status);
}

ClientResult<QRNContainerReply>
QRNContainerClient::createOrLookup(const std::optional<std::string>& identifier,
                                   std::uint64_t containerClass, bool createIfNecessary,
                                   bool transient) {
    return exchangeAndParse(
        *this,
        QRNClientRequests::createOrLookup(identifier, containerClass, createIfNecessary, transient),
        QRNClientReplies::container);
}

ClientResult<QRNContainerList> QRNContainerClient::containersOfClass(std::uint64_t containerClass,
                                                                     bool transient) {
    return exchangeAndParse(*this, QRNClientRequests::containersOfClass(containerClass, transient),
                            QRNClientReplies::containerList);
}

ClientResult<void>
QRNContainerClient::stageForDelete(std::span<const QRNStagedContainer> containers) {
    return exchangeForStatus(QRNClientRequests::stageForDelete(containers));
}

ClientResult<void> QRNContainerClient::deleteContainersOnDeathRow() {
    return exchangeForStatus(QRNClientRequests::deleteContainersOnDeathRow());
}

ClientResult<void> QRNContainerClient::setInfoValue(const QRNContainerRef& container,
                                                    const std::string& key, Value value) {
    return exchangeForStatus(QRNClientRequests::setInfoValue(container, key, std::move(value)));
}

ClientResult<Value> QRNContainerClient::infoValue(const QRNContainerRef& container,
                                                  const std::string& key) {
    return exchangeAndParse(*this, QRNClientRequests::infoValue(container, key),
                            QRNClientReplies::infoValue);
}

ClientResult<QRNMetadataReply> QRNContainerClient::metadata(const QRNContainerRef& container,
                                                            bool infoDictRequested) {
    return exchangeAndParse(*this, QRNClientRequests::metadata(container, infoDictRequested),
                            QRNClientReplies::metadata);
}

ClientResult<void> QRNContainerClient::recreateDefaultStructure(const QRNContainerRef& container) {
    return exchangeForStatus(QRNClientRequests::recreateDefaultStructure(container));
}

ClientResult<void>
QRNContainerClient::recreateDefaultStructureSecondNumber(const QRNContainerRef& container) {
    return exchangeForStatus(QRNClientRequests::recreateDefaultStructure(
        container, QRNClientCommand::RecreateDefaultStructureSecondNumber));
}

ClientResult<void> QRNContainerClient::regenerateDirectoryUUID(const QRNContainerRef& container) {
    return exchangeForStatus(QRNClientRequests::regenerateDirectoryUUID(container));
}

ClientResult<void> QRNContainerClient::deleteContainer(const std::optional<std::string>& identifier,
                                                       std::uint64_t containerClass,
                                                       bool transient) {
    return exchangeForStatus(
        QRNClientRequests::deleteContainer(identifier, containerClass, transient));
}

ClientResult<std::uint64_t> QRNContainerClient::diskUsage(const QRNContainerRef& container) {
    return exchangeAndParse(*this, QRNClientRequests::diskUsage(container),
                            QRNClientReplies::diskUsage);
}

ClientResult<void> QRNContainerClient::retired() {
    return exchangeForStatus(QRNClientRequests::retired());
}

ClientResult<std::vector<std::string>> QRNContainerClient::personaUniqueStrings() {
    return exchangeAndParse(
        *this, QRNClientRequests::personaUniqueStrings(), [](const Value& reply) {
            return QRNClientReplies::strings(reply, "ReplyPersonaUniqueStringsArray");
        });
}

} // namespace quarn
