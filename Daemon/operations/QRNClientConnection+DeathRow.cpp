// Death row: containers and staging directories leave the live tree with one
// rename into a uniquely named directory on death row, and a background pass
// destroys whatever is there. Also new directory UUIDs for containers.

#include "Daemon/operations/QRNClientConnection.h"

#include "Daemon/fs/QRNFileManager.h"
#include "Daemon/model/QRNContainerCache.h"
#include "Daemon/model/QRNContainerClass.h"
#include "Daemon/model/QRNGlobalConfiguration.h"
#include "Daemon/model/QRNMetadata.h"
#include "Daemon/model/QRNWhitelist.h"
#include "Daemon/platform/Paths.h"
#include "Daemon/support/Log.h"
#include "Daemon/support/ProcessTransaction.h"
#include "Daemon/support/QRNDaemonContext.h"
#include "Daemon/support/Queue.h"
#include "Daemon/support/UUID.h"

#include <cerrno>
#include <cstring>
#include <exception>
#include <typeinfo>
#include <utility>

namespace quarn {

namespace {

// The three process-wide queues, one set per daemon context.
struct DeathRowQueues {
    // Moves into death row, run synchronously: unique directory creation and
    // moves never interleave.
    std::shared_ptr<Queue> deathrow = std::make_shared<Queue>(Queue::ownerLabel("deathrow"));
    // Deletion passes.
    std::shared_ptr<Queue> deathrowBackground =
        std::make_shared<Queue>(Queue::ownerLabel("deathrow.background"));
    // Other background work of the connections.
    std::shared_ptr<Queue> background = std::make_shared<Queue>(Queue::ownerLabel("background"));
};

DeathRowQueues& deathRowQueues() {
    return QRNDaemonContext::current().instance<DeathRowQueues>();
}

std::filesystem::path lastComponent(const std::filesystem::path& url) {
    return url.has_filename() ? url.filename() : url.parent_path().filename();
}

std::filesystem::path withoutTrailingSeparator(const std::filesystem::path& url) {
    return url.has_filename() ? url : url.parent_path();
}

// Shared by the connection's operation and the deletion pass, which must not
// depend on the connection still being alive.
Status removeItemOrMoveToTemp(QRNFileManager& fileManager, const std::filesystem::path& url,
                              const std::filesystem::path& temporaryDirectory) {
    auto removed = fileManager.removeItemAtURL(url);
    if (removed || removed.error().isPOSIX(ENOENT)) {
        return {};
    }
    QRN_LOG_DEBUG(LogCategory::Lifecycle, "Couldn't remove, so moving item to /tmp: {} : {}",
                  url.string(), removed.error().description());
    // An undeletable item should at least leave the container tree.
    const std::filesystem::path target = temporaryDirectory / lastComponent(url);
    if (auto moved = fileManager.moveItemAtURL(url, target); !moved) {
        return QRN_UNEXPECTED(QRN_ERROR_UNDERLYING(moved.error(), kQRNErrorMoveDirFailed,
                                                   "Failed to move dir: {} to: {}", url.string(),
                                                   target.string()));
    }
    return {};
}

// One deletion pass: the pass's error, or nothing when all went well.
std::optional<Error> destroyDeathRow(QRNFileManager& fileManager,
                                     const std::filesystem::path& deathrow,
                                     const std::filesystem::path& temporaryDirectory) {
    auto items = fileManager.urlsForItemsInDirectoryAtURL(deathrow);
    if (!items) {
        if (items.error().isPOSIX(ENOENT)) {
            return std::nullopt;
        }
        return QRN_ERROR_UNDERLYING(items.error(), kQRNErrorDeleteContainerFailed,
                                    "Failed to get items for deletion: {} : {}", deathrow.string(),
                                    items.error().description());
    }
    std::optional<Error> failure;
    for (const QRNFileManager::Item& item : *items) {
        // One bad item must not keep the others on death row.
        if (auto destroyed = removeItemOrMoveToTemp(fileManager, item.url, temporaryDirectory);
            !destroyed) {
            failure = QRN_ERROR_UNDERLYING(destroyed.error(), kQRNErrorDestroyFailed,
                                           "Failed to destroy item at: {}", item.url.string());
        }
    }
    return failure;
}

} // namespace

std::shared_ptr<Queue> QRNClientConnection::_sharedDeathrowQueue() {
    return deathRowQueues().deathrow;
}

std::shared_ptr<Queue> QRNClientConnection::_sharedDeathrowBackgroundQueue() {
    return deathRowQueues().deathrowBackground;
}

std::shared_ptr<Queue> QRNClientConnection::_sharedBackgroundQueue() {
    return deathRowQueues().background;
}

Status QRNClientConnection::_moveItemAtURLToDeathRow(const std::filesystem::path& url, bool isDir,
                                                     bool startDeletionThread) {
    // The item's directory is opened without following a link, and the
    // item is then moved by name from it.
    auto parent = QRNFileManager::defaultManager().resolver().openParent(url);
    if (!parent) {
        if (parent.error() == ENOENT) {
            return {};
        }
        return QRN_UNEXPECTED(QRN_ERROR(kQRNErrorMoveItemFailed,
                                        "Failed to open the directory of {} : {}", url.string(),
                                        std::strerror(parent.error())));
    }
    return _moveItemInDirectoryToDeathRow(parent->directory,
                                          withoutTrailingSeparator(url).parent_path(), parent->name,
                                          isDir, startDeletionThread);
}

Status QRNClientConnection::_moveItemInDirectoryToDeathRow(
    const EnvFd& directory, const std::filesystem::path& directoryURL, const std::string& name,
    bool isDir, bool startDeletionThread) {
    QRNFileManager& fileManager = QRNFileManager::defaultManager();
    const std::filesystem::path& deathrow =
        QRNGlobalConfiguration::sharedInstance().deathrowDirectory();
    const std::filesystem::path url = directoryURL / name;
    bool moved = false;
    Status status = deathrowQueue_->sync([&]() -> Status {
        // Keeping the name tells later what the item was.
        auto target = fileManager.moveItemInDirectoryToNewUniqueDirectory(directory, directoryURL,
                                                                          name, deathrow);
        if (target) {
            moved = true;
            QRN_LOG_DEBUG(LogCategory::Lifecycle, "Moved {} {} to death row at {}",
                          isDir ? "directory" : "item", url.string(), target->string());
            return {};
        }
        if (target.error().isPOSIX(ENOENT)) {
            return {};
        }
        return QRN_UNEXPECTED(QRN_ERROR_UNDERLYING(target.error(), kQRNErrorMoveItemFailed,
                                                   "Failed to move item at: {} to death row {}",
                                                   url.string(), deathrow.string()));
    });
    if (moved && startDeletionThread) {
        deleteContainersOnDeathRowWithCompletion(nullptr);
    }
    return status;
}

void QRNClientConnection::deleteContainersOnDeathRowWithCompletion(
    std::function<void(std::optional<Error>)> completion) {
    QRNDaemonContext& context = QRNDaemonContext::current();
    // The pass owns what it uses: it may outlive this connection.
    std::shared_ptr<QRNFileManager> fileManager = context.sharedInstance<QRNFileManager>();
    std::filesystem::path deathrow = QRNGlobalConfiguration::sharedInstance().deathrowDirectory();
    std::filesystem::path temporaryDirectory = context.instance<Paths>().resolve("/tmp");
    deathrowBackgroundQueue_->async(
        [fileManager, deathrow = std::move(deathrow),
         temporaryDirectory = std::move(temporaryDirectory), completion = std::move(completion),
         transaction = ProcessTransaction("deleteContainersOnDeathRow")]() mutable {
            std::optional<Error> error =
                destroyDeathRow(*fileManager, deathrow, temporaryDirectory);
            if (completion) {
                completion(std::move(error));
            }
            // Only now may the daemon be idled out.
            transaction.end();
        });
}

Status QRNClientConnection::_removeItemOrMoveToTempAtURL(const std::filesystem::path& url) {
    QRNDaemonContext& context = QRNDaemonContext::current();
    return removeItemOrMoveToTemp(context.instance<QRNFileManager>(), url,
                                  context.instance<Paths>().resolve("/tmp"));
}

namespace {

// The container and which cache holds it; code 21 when neither does.
CodeResult<std::pair<QRNMetadataPtr, bool>>
findForRegeneration(const QRNContainerIdentityPtr& identity) {
    QRNContainerCache& cache = QRNContainerCache::sharedInstance();
    if (identity) {
        if (auto permanent = cache.containerForContainerIdentity(identity); permanent) {
            return std::pair{*permanent, false};
        }
        if (auto transient = cache.containerForContainerIdentity(identity, true); transient) {
            return std::pair{*transient, true};
        }
    }
    QRN_ERROR(kQRNErrorContainerNotFound, "No Container with identity: {}",
              identity ? identity->description() : std::string("(null)"));
    return QRN_CODE(kQRNErrorContainerNotFound);
}

CodeResult<void> regenerateDirectoryUUID(const QRNContainerIdentityPtr& identity) {
    auto found = findForRegeneration(identity);
    if (!found) {
        return QRN_CODE(found.error());
    }
    const auto& [metadata, transient] = *found;
    const std::filesystem::path url = withoutTrailingSeparator(metadata->url());
    const std::string name = url.filename().string();
    if (!UUID::parse(name)) {
        QRN_ERROR(kQRNErrorInvalidArgument, "Non-UUID last path component: {} for {}", name,
                  identity->description());
        return QRN_CODE(kQRNErrorInvalidArgument);
    }
    const std::filesystem::path newURL = url.parent_path() / UUID::random().string();
    if (auto moved = QRNFileManager::defaultManager().moveItemAtURL(url, newURL); !moved) {
        QRN_ERROR_UNDERLYING(moved.error(), kQRNErrorMoveToNewUUIDFailed,
                             "Failed to move dir: {} to new UUID dir: {}", url.string(),
                             newURL.string());
        return QRN_CODE(kQRNErrorMoveToNewUUIDFailed);
    }
    if (auto added = QRNContainerCache::sharedInstance().addContainerMetadata(metadata, newURL,
                                                                              transient, true);
        !added) {
        QRN_ERROR_UNDERLYING(added.error(), kQRNErrorCacheAddFailed,
                             "Failed to add to cache: {}, url: {}, transient: {}",
                             metadata->description(), newURL.string(), transient ? 1 : 0);
        return QRN_CODE(kQRNErrorCacheAddFailed);
    }
    return {};
}

} // namespace

CodeResult<void> QRNClientConnection::regenerateDirectoryUUIDWithContainerIdentity(
    const QRNContainerIdentityPtr& identity) {
    try {
        return regenerateDirectoryUUID(identity);
    } catch (const std::exception& exception) {
        QRN_ERROR(kQRNErrorException, "Got exception: {} : {}", typeid(exception).name(),
                  exception.what());
        return QRN_CODE(kQRNErrorException);
    }
}

void QRNClientConnection::_regenerateAllSystemContainerPaths() {
    QRN_LOG_NOTICE(LogCategory::Lifecycle, "Rolling system container directory UUIDs on disk");
    QRNContainerCache& cache = QRNContainerCache::sharedInstance();
    const QRNWhitelist& whitelist = QRNWhitelist::sharedWhitelist();
    for (std::uint64_t cls : {kQRNContainerClassSystemData, kQRNContainerClassSystemGroup}) {
        auto all = cache.allContainersForUserIdentity(userIdentity(), cls, false, false);
        if (!all) {
            QRN_LOG_ERROR(LogCategory::Lifecycle,
                          "Failed to get list of system containers for migration: {}",
                          all.error().description());
            continue;
        }
        for (const QRNMetadataPtr& metadata : *all) {
            // Well-known containers live under fixed names; the analytics
            // group keeps its path on purpose.
            if (whitelist.containerIdIsWellknown(metadata->identifier(), cls) ||
                metadata->identifier() == "systemgroup.com.orvex.osanalytics") {
                continue;
            }
            if (auto regenerated =
                    regenerateDirectoryUUIDWithContainerIdentity(metadata->containerIdentity());
                !regenerated) {
                QRN_LOG_ERROR(LogCategory::Lifecycle,
                              "Failed to regenerate directory UUID for identifier: {}, class: {}",
                              metadata->identifier(), cls);
            }
        }
    }
}

} // namespace quarn
