#pragma once
// Request dictionaries of the commands the daemon serves, built from typed
// arguments. An identifier left empty (nullopt) is not sent, so the daemon
// takes the caller's own code-signing identifier.

#include "Daemon/support/UUID.h"
#include "Daemon/support/Value.h"

#include <cstdint>
#include <optional>
#include <span>
#include <string>

namespace quarn {

enum class QRNClientCommand : std::uint64_t {
    CreateOrLookup = 0,
    ContainersOfClass = 1,
    StageForDelete = 3,
    DeleteContainersOnDeathRow = 4,
    SetInfoValue = 5,
    GetInfoValue = 6,
    Metadata = 7,
    RecreateDefaultStructure = 8,
    RegenerateDirectoryUUID = 9,
    DeleteContainer = 10,
    GroupContainers = 13,
    GroupIdentifiers = 14,
    SystemContainerPath = 15,
    SystemGroupContainers = 16,
    SystemGroupContainerPath = 17,
    RecreateDefaultStructureSecondNumber = 22,
    DiskUsage = 23,
    Retired = 27,
    PersonaUniqueStrings = 32,
};

// A container named by identifier and class, and optionally its UUID.
struct QRNContainerRef {
    std::optional<std::string> identifier;
    std::uint64_t containerClass = 0;
    std::optional<UUID> uuid;
};

// One container of a stage-for-delete request.
struct QRNStagedContainer {
    std::uint64_t containerClass = 0;
    UUID uuid;
    std::string identifier;
    std::string personaUniqueString; // counted by the daemon, not used
};

class QRNClientRequests {
public:
    // {"Command": number}.
    static Value command(QRNClientCommand number);

    static Value createOrLookup(const std::optional<std::string>& identifier,
                                std::uint64_t containerClass, bool createIfNecessary,
                                bool transient);
    static Value containersOfClass(std::uint64_t containerClass, bool transient);
    static Value stageForDelete(std::span<const QRNStagedContainer> containers);
    static Value deleteContainersOnDeathRow();
    static Value setInfoValue(const QRNContainerRef& container, const std::string& key,
                              Value value);
    static Value infoValue(const QRNContainerRef& container, const std::string& key);
    static Value metadata(const QRNContainerRef& container, bool infoDictRequested);
    // Command 8, or its second number 22.
    static Value
    recreateDefaultStructure(const QRNContainerRef& container,
                             QRNClientCommand number = QRNClientCommand::RecreateDefaultStructure);
    static Value regenerateDirectoryUUID(const QRNContainerRef& container);
    static Value deleteContainer(const std::optional<std::string>& identifier,
                                 std::uint64_t containerClass, bool transient);
    static Value groupContainers(const std::optional<std::string>& owner);
    static Value groupIdentifiers(const std::optional<std::string>& owner);
    static Value systemContainerPath(const std::optional<std::string>& identifier);
    static Value systemGroupContainers(const std::optional<std::string>& owner);
    static Value systemGroupContainerPath(const std::string& groupIdentifier);
    static Value diskUsage(const QRNContainerRef& container);
    static Value retired();
    static Value personaUniqueStrings();

private:
    static Value withContainer(QRNClientCommand number, const QRNContainerRef& container);
    static Value withIdentifier(QRNClientCommand number,
                                const std::optional<std::string>& identifier);
};

} // namespace quarn
