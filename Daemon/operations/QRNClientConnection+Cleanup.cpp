// Boot-time cleanup passes: whatever a crash left in staging, the transient
// containers of the last boot and the orphaned entries of class directories
// go to death row, and a deletion pass destroys them. They only start during
// initialisation and finish in the background while requests are served;
// they touch nothing that a live container owns. A missing directory is
// nothing to clean, never an error.

#include "Daemon/operations/QRNClientConnection.h"

#include "Daemon/codesigning/QRNCodeSigningMapping.h"
#include "Daemon/fs/QRNFileManager.h"
#include "Daemon/model/QRNContainerCache.h"
#include "Daemon/model/QRNContainerClass.h"
#include "Daemon/model/QRNGlobalConfiguration.h"
#include "Daemon/model/QRNMetadata.h"
#include "Daemon/model/QRNUserIdentitySharedCache.h"
#include "Daemon/support/Log.h"
#include "Daemon/support/ProcessTransaction.h"
#include "Daemon/support/Queue.h"

#include <cerrno>
#include <utility>

namespace quarn {

namespace {

using URLs = std::vector<std::filesystem::path>;

// The per-user classes whose class directories may hold orphans.
constexpr std::uint64_t kPerUserDataClasses[] = {
    kQRNContainerClassAppData,  kQRNContainerClassPluginData,  kQRNContainerClassVPNData,
    kQRNContainerClassAppGroup, kQRNContainerClassVellService, kQRNContainerClassInternalDaemon,
    kQRNContainerClassTempDir};

// Appends the directory's items; a missing directory adds nothing and logs
// nothing. Answers the listing error otherwise.
std::optional<Error> appendItems(const std::filesystem::path& directory, URLs& urls) {
    auto items = QRNFileManager::defaultManager().urlsForItemsInDirectoryAtURL(directory);
    if (!items) {
        if (items.error().isPOSIX(ENOENT)) {
            return std::nullopt;
        }
        return items.error();
    }
    for (QRNFileManager::Item& item : *items) {
        urls.push_back(std::move(item.url));
    }
    return std::nullopt;
}

URLs stagingLeftovers() {
    QRNGlobalConfiguration& configuration = QRNGlobalConfiguration::sharedInstance();
    URLs urls;
    const std::filesystem::path& global = configuration.stagingDirectory();
    if (auto failed = appendItems(global, urls)) {
        QRN_LOG_ERROR(LogCategory::Lifecycle, "Failed to get items at global staging URL: {} : {}",
                      global.string(), failed->description());
    }
    QRNUserIdentitySharedCache::sharedCache()
        .forEachAccessibleUserIdentitySynchronouslyExecuteBlock(
            [&](const QRNUserIdentityPtr& userIdentity) {
                auto staging = configuration.stagingDirectoryURLForUserIdentity(
                    userIdentity, kQRNContainerClassAppData);
                if (!staging) {
                    return;
                }
                if (auto failed = appendItems(*staging, urls)) {
                    QRN_LOG_ERROR(LogCategory::Lifecycle,
                                  "Failed to get items at per-user staging URL: {} : {}",
                                  staging->string(), failed->description());
                }
            });
    return urls;
}

} // namespace

void QRNClientConnection::quarnManagerCleanupWithCompletion(std::function<void()> completion) {
    URLs leftovers = stagingLeftovers();
    // The cleanups run on the shared connection, which lives as long as its
    // daemon context.
    backgroundQueue_->async([this, leftovers = std::move(leftovers),
                             completion = std::move(completion),
                             transaction = ProcessTransaction("quarnManagerCleanup")]() mutable {
        for (const std::filesystem::path& url : leftovers) {
            // A failed move is logged where its error is made; the others go on.
            (void)_moveItemAtURLToDeathRow(url, true, false);
        }
        deleteContainersOnDeathRowWithCompletion(
            [completion = std::move(completion)](const std::optional<Error>&) {
                if (completion) {
                    completion();
                }
            });
    });
}

namespace {

void sentenceToDeathRow(QRNClientConnection& connection, const std::filesystem::path& url,
                        const char* failure) {
    if (auto moved = connection._moveItemAtURLToDeathRow(url, true, false); !moved) {
        QRN_LOG_ERROR(LogCategory::Lifecycle, fmt::runtime(failure), url.string(),
                      moved.error().description());
    }
}

void sentenceTransientDirectories(QRNClientConnection& connection) {
    QRNGlobalConfiguration& configuration = QRNGlobalConfiguration::sharedInstance();
    QRNFileManager& fileManager = QRNFileManager::defaultManager();
    sentenceToDeathRow(connection, configuration.transientDirectory(),
                       "Failed to delete shared transient URL {} : {}");
    const std::filesystem::path& legacy = configuration.legacyTransientBundleDirectory();
    if (fileManager.itemExistsAtURL(legacy)) {
        QRN_LOG_NOTICE(LogCategory::Lifecycle,
                       "Sentencing legacy transient bundle directory [{}] to final deletion",
                       legacy.string());
        sentenceToDeathRow(connection, legacy,
                           "Failed to delete legacy shared transient bundle URL {} : {}");
    }
    sentenceToDeathRow(connection, configuration.transientBundleDirectory(),
                       "Failed to delete shared transient bundle URL {} : {}");
    QRNUserIdentitySharedCache::sharedCache()
        .forEachAccessibleUserIdentitySynchronouslyExecuteBlock(
            [&](const QRNUserIdentityPtr& userIdentity) {
                auto perUser = configuration.getPerUserConfigurationForUserIdentity(userIdentity);
                if (fileManager.itemExistsAtURL(perUser->userBaseDirectory())) {
                    sentenceToDeathRow(connection, perUser->transientDirectory(),
                                       "Failed to delete per-user transient URL {} : {}");
                }
            });
}

} // namespace

void QRNClientConnection::rebootQuarnManagerCleanupWithCompletion(
    std::function<void()> completion) {
    sentenceTransientDirectories(*this);
    QRNGlobalConfiguration& configuration = QRNGlobalConfiguration::sharedInstance();
    QRNUserIdentityPtr userIdentity = QRNUserIdentitySharedCache::defaultUserIdentity();
    for (std::uint64_t cls : kPerUserDataClasses) {
        auto directory =
            configuration.containerDirectoryURLForUserIdentity(userIdentity, cls, false);
        URLs urls;
        if (!directory) {
            continue;
        }
        if (auto failed = appendItems(*directory, urls)) {
            QRN_LOG_ERROR(LogCategory::Lifecycle, "Failed to get items : {}",
                          failed->description());
            continue;
        }
        backgroundQueue_->async([this, urls = std::move(urls), cls,
                                 transaction = ProcessTransaction("orphanedDataCleanup")] {
            _cleanupOrphanedDataForDirectories(urls, cls);
        });
    }
    backgroundQueue_->async([this, transaction = ProcessTransaction("codeSigningCleanup")] {
        _cleanupOprhanedCodeSigningMappingData();
    });
    // The background queue is serial: the completion runs after the steps.
    backgroundQueue_->async([completion = std::move(completion)] {
        if (completion) {
            completion();
        }
    });
}

void QRNClientConnection::_cleanupOrphanedDataForDirectories(const URLs& urls,
                                                             std::uint64_t containerClass) {
    QRNFileManager& fileManager = QRNFileManager::defaultManager();
    const QRNContainerCache& cache = QRNContainerCache::sharedInstance();
    const bool internal = QRNGlobalConfiguration::sharedInstance().isInternalImage();
    for (const std::filesystem::path& url : urls) {
        const bool validName = cache.containerURL(url, containerClass);
        if (!fileManager.itemExistsAtURL(url)) {
            QRN_LOG_DEBUG(LogCategory::Lifecycle,
                          "Ignoring deleted container path during cleanup: [{}]", url.string());
            continue;
        }
        if (validName) {
            if (fileManager.itemExistsAtURL(url / QRNMetadata::kFileName)) {
                continue;
            }
            QRN_LOG_NOTICE(LogCategory::Lifecycle,
                           "Deleting orphaned data missing a metadata file at: {}", url.string());
        }
        if (internal) {
            QRN_LOG_NOTICE(LogCategory::Lifecycle,
                           "\tSomeone is writing invalid data to a container, which has now been "
                           "orphaned. Here are the invalid files:");
            fileManager.printDirectoryStructureAtURL(url);
            QRN_LOG_NOTICE(LogCategory::Lifecycle, "***END INTERNAL BUILD REQUEST");
        }
        // A failed move is logged where its error is made.
        (void)_moveItemAtURLToDeathRow(url, true, false);
    }
}

void QRNClientConnection::_cleanupOprhanedCodeSigningMappingData() {
    if (auto removed = QRNCodeSigningMapping::sharedInstance().removeAllAdvanceCopiesWithError();
        !removed) {
        QRN_LOG_ERROR(LogCategory::Lifecycle,
                      "Could not remove advance copies of code sign data: {}",
                      removed.error().description());
    }
}

} // namespace quarn
