// Boot-time setup: the work done once per start, and once per first start
// after the first-boot marker went missing, before any request is served.
// Nothing here stops start-up: every failure is logged and the next step
// goes on.

#include "Daemon/operations/QRNClientConnection.h"

#include "Daemon/fs/QRNFileManager.h"
#include "Daemon/model/QRNContainerClass.h"
#include "Daemon/model/QRNGlobalConfiguration.h"
#include "Daemon/model/QRNMetadata.h"
#include "Daemon/model/QRNUserIdentitySharedCache.h"
#include "Daemon/platform/HostConfig.h"
#include "Daemon/support/Log.h"
#include "Daemon/support/QRNDaemonContext.h"

#include <cstdint>

namespace quarn {

namespace {

// The bit of the host's flags that marks a multi-user device.
constexpr std::uint32_t kHostMultiUserFlag = 0x80000000u;

std::filesystem::path inProgressPath(const std::filesystem::path& backup) {
    std::filesystem::path path = backup;
    path += ".inprogress";
    return path;
}

// Moves a restored backup to its "inprogress" sibling, so a start cut short
// while installing never meets a half-installed backup under the old name.
// Answers whether the backup is there now.
bool moveBackupToInProgress(const std::filesystem::path& backup, const char* movedFailure) {
    QRNFileManager& fileManager = QRNFileManager::defaultManager();
    const std::filesystem::path inProgress = inProgressPath(backup);
    if (auto removed = fileManager.removeItemAtURL(inProgress); !removed) {
        QRN_LOG_ERROR(LogCategory::Lifecycle,
                      "Failed to remove existing inprogress system containers: {}",
                      removed.error().description());
    }
    if (auto moved = fileManager.moveItemAtURL(backup, inProgress); !moved) {
        QRN_LOG_ERROR(LogCategory::Lifecycle, fmt::runtime(movedFailure),
                      moved.error().description());
        return false;
    }
    return true;
}

void installRestoredContainers(QRNClientConnection& connection,
                               const std::filesystem::path& inProgress, std::uint64_t cls,
                               const char* listingFailure) {
    auto items = QRNFileManager::defaultManager().urlsForItemsInDirectoryAtURL(inProgress);
    if (!items) {
        QRN_LOG_ERROR(LogCategory::Lifecycle, fmt::runtime(listingFailure), inProgress.string(),
                      items.error().description());
        return;
    }
    for (const QRNFileManager::Item& item : *items) {
        if (auto installed = connection._moveSystemContainerIntoPlace(item.url, cls); !installed) {
            QRN_LOG_ERROR(LogCategory::Lifecycle,
                          "Error processing restored system container {}: {}", item.url.string(),
                          installed.error());
            connection._moveFailedPathAside(item.url);
        }
    }
}

// System containers restored from a backup of the user's data are merged
// into the live containers of the same identifiers.
void QRNMoveSystemContainersIntoPlace(QRNClientConnection& connection) {
    QRNUserIdentityPtr userIdentity =
        QRNUserIdentitySharedCache::sharedCache().userIdentityForCurrentContext();
    QRNGlobalConfiguration& configuration = QRNGlobalConfiguration::sharedInstance();
    auto perUser = configuration.getPerUserConfigurationForUserIdentity(userIdentity);
    QRNFileManager& fileManager = QRNFileManager::defaultManager();
    const std::filesystem::path& backups = perUser->systemContainerBackupDirectory();
    const std::filesystem::path& groupBackups = perUser->systemGroupContainerBackupDirectory();

    const bool systemMoved =
        fileManager.itemExistsAtURL(backups) &&
        moveBackupToInProgress(backups, "Failed to move system containers to inprogress: {}");
    const bool groupMoved =
        fileManager.itemExistsAtURL(groupBackups) &&
        moveBackupToInProgress(groupBackups,
                               "Failed to move shared system containers to inprogress: {}");
    if (systemMoved) {
        QRN_LOG_NOTICE(LogCategory::Lifecycle, "Installing system containers");
        installRestoredContainers(connection, inProgressPath(backups), kQRNContainerClassSystemData,
                                  "Couldn't find any system containers at {}: {}");
    }
    if (groupMoved) {
        QRN_LOG_NOTICE(LogCategory::Lifecycle, "Installing system group containers");
        installRestoredContainers(connection, inProgressPath(groupBackups),
                                  kQRNContainerClassSystemGroup,
                                  "Couldn't find any system shared containers at {}: {}");
    }
    // Internal builds keep what was restored, for inspection.
    if (!configuration.isInternalImage()) {
        const std::filesystem::path& base = perUser->systemContainerBackupBaseDirectory();
        if (auto removed = fileManager.removeItemAtURL(base); !removed) {
            QRN_LOG_ERROR(LogCategory::Lifecycle,
                          "Failed to remove system container base dir {}: {}", base.string(),
                          removed.error().description());
        }
    }
}

bool isMultiUserHost() {
    auto flags = QRNDaemonContext::current().instance<HostConfig>().multiUserFlags();
    return flags && (*flags & kHostMultiUserFlag) != 0;
}

// Moves every entry of the restored item into the live container, replacing
// entries of the same name. Entries whose names begin with "." stay behind:
// the restored item's own metadata file must not replace the live one's.
CodeResult<void> mergeRestoredEntries(const std::string& identifier,
                                      const std::filesystem::path& restored,
                                      const std::filesystem::path& live) {
    QRNFileManager& fileManager = QRNFileManager::defaultManager();
    auto entries = fileManager.urlsForItemsInDirectoryAtURL(restored);
    if (!entries) {
        QRN_LOG_ERROR(LogCategory::Lifecycle,
                      "Failed to enumerate contents of restored system container {} at {}: {}",
                      identifier, restored.string(), entries.error().description());
        return QRN_CODE(kQRNErrorMoveItemFailed);
    }
    CodeResult<void> result;
    for (const QRNFileManager::Item& entry : *entries) {
        const std::filesystem::path destination = live / entry.url.filename();
        if (auto removed = fileManager.removeItemAtURL(destination); !removed) {
            QRN_LOG_ERROR(LogCategory::Lifecycle, "Failed to remove destination {}:{}: {}",
                          identifier, destination.string(), removed.error().description());
            result = QRN_CODE(kQRNErrorMoveItemFailed);
            continue;
        }
        if (auto moved = fileManager.moveItemAtURL(entry.url, destination); !moved) {
            QRN_LOG_ERROR(LogCategory::Lifecycle,
                          "Failed to move file in restored system container {}:{} to destination "
                          "{}: {}",
                          identifier, entry.url.string(), destination.string(),
                          moved.error().description());
            result = QRN_CODE(kQRNErrorMoveItemFailed);
        }
    }
    return result;
}

} // namespace

void QRNClientConnection::quarnManagerSetup() {
    // Recovery of unfinished replace operations comes with the replace operation.
    // Restarting pending data-protection changes comes with the data protection operations.
}

void QRNClientConnection::rebootQuarnManagerSetup() {
    // Upgrade detection and the build-upgrade migration come with the migration status.
    QRNMoveSystemContainersIntoPlace(*this);
    if (isMultiUserHost()) {
        QRN_LOG_DEBUG(LogCategory::Lifecycle, "Multi-user host");
        // Reconciling application group containers comes with the group manager.
    }
}

CodeResult<void>
QRNClientConnection::_moveSystemContainerIntoPlace(const std::filesystem::path& url,
                                                   std::uint64_t containerClass) {
    const std::string identifier = url.filename().string();
    auto identity =
        QRNContainerIdentity::containerIdentityWithIdentifier(identifier, containerClass);
    if (!identity) {
        QRN_LOG_ERROR(LogCategory::Lifecycle, "Failed to create container identity {}: {}",
                      identifier, identity.error());
        return QRN_CODE(identity.error());
    }
    auto live = createOrLookupContainerWithContainerIdentity(*identity, true, false, true);
    if (!live) {
        QRN_LOG_ERROR(LogCategory::Lifecycle, "Failed to create system container {}: {}",
                      identifier, live.error());
        return QRN_CODE(live.error());
    }
    const std::filesystem::path& liveURL = (*live)->url();
    QRN_LOG_NOTICE(LogCategory::Lifecycle, "Restoring container for {} at {} to {}", identifier,
                   url.string(), liveURL.string());
    auto merged = mergeRestoredEntries(identifier, url, liveURL);
    // Whatever came in, the container's own structure and ACLs must be right.
    auto recreated = recreateDefaultStructureWithContainerIdentity(*identity);
    if (!merged) {
        return merged;
    }
    return recreated;
}

void QRNClientConnection::_moveFailedPathAside(const std::filesystem::path& url) {
    // "<backup>.inprogress/<identifier>" goes to "<backup>.failed/<identifier>",
    // which the next start's "inprogress" clean-up leaves alone.
    QRNFileManager& fileManager = QRNFileManager::defaultManager();
    std::filesystem::path failedDirectory = url.parent_path();
    failedDirectory.replace_extension("failed");
    if (auto made = fileManager.createDirectoryAtURL(failedDirectory, true, 0755); !made) {
        QRN_LOG_ERROR(LogCategory::Lifecycle, "Failed to create {}: {}", failedDirectory.string(),
                      made.error().description());
        return;
    }
    const std::filesystem::path target = failedDirectory / url.filename();
    Status moved = fileManager.removeItemAtURL(target);
    if (moved) {
        moved = fileManager.moveItemAtURL(url, target);
    }
    if (!moved) {
        QRN_LOG_ERROR(LogCategory::Lifecycle, "Failed to move {} to {}: {}", url.string(),
                      target.string(), moved.error().description());
    }
}

} // namespace quarn
