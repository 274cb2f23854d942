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

// The per-user classes whose class directories may hold orphans.
constexpr std::uint64_t kPerUserDataClasses[] = {
    kQRNContainerClassAppData,  kQRNContainerClassPluginData,  kQRNContainerClassVPNData,
    kQRNContainerClassAppGroup, kQRNContainerClassVellService, kQRNContainerClassInternalDaemon,
    kQRNContainerClassTempDir};

using Listings = std::vector<QRNFileManager::Listing>;

// The directory listed and kept open; a missing directory adds nothing and
// logs nothing. Answers the listing error otherwise.
std::optional<Error> appendListing(const std::filesystem::path& directory, Listings& listings) {
    auto listing = QRNFileManager::defaultManager().listDirectoryAtURL(directory);
    if (!listing) {
        if (listing.error().isPOSIX(ENOENT)) {
            return std::nullopt;
        }
        return listing.error();
    }
    listings.push_back(std::move(*listing));
    return std::nullopt;
}

Listings stagingLeftovers() {
    QRNGlobalConfiguration& configuration = QRNGlobalConfiguration::sharedInstance();
    Listings listings;
    const std::filesystem::path& global = configuration.stagingDirectory();
    if (auto failed = appendListing(global, listings)) {
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
                if (auto failed = appendListing(*staging, listings)) {
                    QRN_LOG_ERROR(LogCategory::Lifecycle,
                                  "Failed to get items at per-user staging URL: {} : {}",
                                  staging->string(), failed->description());
                }
            });
    return listings;
}

std::string nameOf(const QRNFileManager::Item& item) {
    return item.url.filename().string();
}

} // namespace

void QRNClientConnection::quarnManagerCleanupWithCompletion(std::function<void()> completion) {
    Listings leftovers = stagingLeftovers();
    // The cleanups run on the shared connection, which lives as long as its
    // daemon context.
    backgroundQueue_->async([this, leftovers = std::move(leftovers),
                             completion = std::move(completion),
                             transaction = ProcessTransaction("quarnManagerCleanup")]() mutable {
        for (const QRNFileManager::Listing& listing : leftovers) {
            for (const QRNFileManager::Item& item : listing.items) {
                // A failed move is logged where its error is made; the others go on.
                (void)_moveItemInDirectoryToDeathRow(listing.directory, listing.url, nameOf(item),
                                                     true, false);
            }
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
        Listings listings;
        if (!directory) {
            continue;
        }
        if (auto failed = appendListing(*directory, listings)) {
            QRN_LOG_ERROR(LogCategory::Lifecycle, "Failed to get items : {}",
                          failed->description());
            continue;
        }
        if (listings.empty()) {
            continue;
        }
        backgroundQueue_->async([this, listing = std::move(listings.front()), cls,
                                 transaction = ProcessTransaction("orphanedDataCleanup")] {
            _cleanupOrphanedDataForDirectories(listing, cls);
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

void QRNClientConnection::_cleanupOrphanedDataForDirectories(const QRNFileManager::Listing& listing,
                                                             std::uint64_t containerClass) {
    QRNFileManager& fileManager = QRNFileManager::defaultManager();
    const QRNContainerCache& cache = QRNContainerCache::sharedInstance();
    const bool internal = QRNGlobalConfiguration::sharedInstance().isInternalImage();
    const std::string metadataFile(QRNMetadata::kFileName);
    for (const QRNFileManager::Item& item : listing.items) {
        const std::filesystem::path& url = item.url;
        const std::string name = nameOf(item);
        const bool validName = cache.containerURL(url, containerClass);
        if (!fileManager.itemExistsInDirectory(listing.directory, name)) {
            QRN_LOG_DEBUG(LogCategory::Lifecycle,
                          "Ignoring deleted container path during cleanup: [{}]", url.string());
            continue;
        }
        if (validName) {
            // Asked below the listed directory: an entry that is a link has
            // no metadata of its own and goes.
            if (fileManager.itemExistsInDirectory(listing.directory, name + "/" + metadataFile)) {
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
        (void)_moveItemInDirectoryToDeathRow(listing.directory, listing.url, name, true, false);
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
