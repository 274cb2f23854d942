#pragma once
// One typed call per command the daemon serves: build the request, send it
// on a QRNClient, read the typed result. Failures come back as ClientError:
// the daemon's code, or why no usable reply came.

#include "Client/ClientError.h"
#include "Client/QRNClient.h"
#include "Client/QRNClientReplies.h"
#include "Client/QRNClientRequests.h"

#include <optional>
#include <span>
#include <string>
#include <vector>

namespace quarn {

class QRNContainerClient {
public:
    // `client` must outlive this object.
    explicit QRNContainerClient(QRNClient& client) : client_(client) {}

    ClientResult<QRNContainerReply> createOrLookup(const std::optional<std::string>& identifier,
                                                   std::uint64_t containerClass,
                                                   bool createIfNecessary, bool transient);
    ClientResult<QRNContainerList> containersOfClass(std::uint64_t containerClass, bool transient);
    ClientResult<void> stageForDelete(std::span<const QRNStagedContainer> containers);
    ClientResult<void> deleteContainersOnDeathRow();
    ClientResult<void> setInfoValue(const QRNContainerRef& container, const std::string& key,
                                    Value value);
    ClientResult<Value> infoValue(const QRNContainerRef& container, const std::string& key);
    ClientResult<QRNMetadataReply> metadata(const QRNContainerRef& container,
                                            bool infoDictRequested);
    ClientResult<void> recreateDefaultStructure(const QRNContainerRef& container);
    // The same operation under its second command number.
    ClientResult<void> recreateDefaultStructureSecondNumber(const QRNContainerRef& container);
    ClientResult<void> regenerateDirectoryUUID(const QRNContainerRef& container);
    ClientResult<void> deleteContainer(const std::optional<std::string>& identifier,
                                       std::uint64_t containerClass, bool transient);
    ClientResult<QRNGroupContainers> groupContainers(const std::optional<std::string>& owner);
    ClientResult<std::vector<std::string>>
    groupIdentifiers(const std::optional<std::string>& owner);
    ClientResult<std::string> systemContainerPath(const std::optional<std::string>& identifier);
    ClientResult<std::map<std::string, std::string>>
    systemGroupContainers(const std::optional<std::string>& owner);
    ClientResult<std::string> systemGroupContainerPath(const std::string& groupIdentifier);
    ClientResult<std::uint64_t> diskUsage(const QRNContainerRef& container);
    // Kept for numbering; the daemon always answers 49.
    ClientResult<void> retired();
    ClientResult<std::vector<std::string>> personaUniqueStrings();

    // Sends any request; a transport failure becomes a Transport error.
    ClientResult<Value> exchange(const Value& request);

private:
    ClientResult<void> exchangeForStatus(const Value& request);

    QRNClient& client_;
};

} // namespace quarn
