#include "Daemon/operations/QRNCommandStageForDelete.h"

#include "Daemon/codesigning/QRNCodeSigningMapping.h"
#include "Daemon/fs/QRNFileManager.h"
#include "Daemon/model/QRNConcreteContainerIdentity.h"
#include "Daemon/model/QRNContainerCache.h"
#include "Daemon/model/QRNContainerClass.h"
#include "Daemon/model/QRNGlobalConfiguration.h"
#include "Daemon/operations/QRNGlobalIdentifierLock.h"
#include "Daemon/support/Log.h"

#include <exception>
#include <optional>
#include <typeinfo>
#include <utility>

namespace quarn {

namespace {

std::filesystem::path lastComponent(const std::filesystem::path& url) {
    return url.has_filename() ? url.filename() : url.parent_path().filename();
}

} // namespace

std::shared_ptr<QRNCommandStageForDelete>
QRNCommandStageForDelete::commandForStageForDeleteWithContainerIdentities(
    std::vector<QRNContainerIdentityPtr> containerIdentities, bool useLocking, ErrorBlock onError) {
    return std::make_shared<QRNCommandStageForDelete>(std::move(containerIdentities), useLocking,
                                                      std::move(onError));
}

QRNCommandStageForDelete::QRNCommandStageForDelete(
    std::vector<QRNContainerIdentityPtr> containerIdentities, bool useLocking, ErrorBlock onError)
    : containerIdentities_(std::move(containerIdentities)), useLocking_(useLocking),
      onError_(std::move(onError)) {}

bool QRNCommandStageForDelete::fromQueue(const std::weak_ptr<QRNCommandQueue>& queue,
                                         std::uint64_t& error) {
    Status staged;
    try {
        // The global write lock for the whole command.
        std::optional<QRNGlobalIdentifierLock> lock;
        if (useLocking_) {
            lock.emplace(QRNGlobalIdentifierLock::Mode::Write);
        }
        staged = stageAll(queue.lock());
    } catch (const std::exception& exception) {
        // The lock is already released; whoever runs the queue decides.
        QRN_ERROR(kQRNErrorException, "Got exception: {} : {}", typeid(exception).name(),
                  exception.what());
        throw;
    }
    if (staged) {
        return true;
    }
    const std::uint64_t code = staged.error().qrnCode(kQRNErrorCacheRemoveFailed);
    if (onError_) {
        onError_(code);
    }
    error = code;
    return false;
}

Status QRNCommandStageForDelete::stageAll(const std::shared_ptr<QRNCommandQueue>& queue) {
    for (const QRNContainerIdentityPtr& identity : containerIdentities_) {
        if (!identity) {
            continue;
        }
        std::optional<Found> found = findContainer(identity);
        if (!found) {
            continue;
        }
        if (QRNContainerClass::isBundle(identity->containerClass())) {
            removeCodeSigningRecords(*identity, *found, queue);
        }
        moveToDeathRowOrRemove(found->metadata->url());
        if (auto removed = removeFromCache(*identity, found->transient); !removed) {
            return QRN_UNEXPECTED(QRN_ERROR_UNDERLYING(
                removed.error(), kQRNErrorCacheRemoveFailed,
                "Failed to remove from cache id: {}, class: {}, transient: {}",
                identity->identifier(), identity->containerClass(), found->transient ? 1 : 0));
        }
    }
    return {};
}

std::optional<QRNCommandStageForDelete::Found>
QRNCommandStageForDelete::findContainer(const QRNContainerIdentityPtr& identity) {
    QRNContainerCache& cache = QRNContainerCache::sharedInstance();
    if (dynamic_cast<const QRNConcreteContainerIdentity*>(identity.get()) == nullptr) {
        auto found = cache.containerForContainerIdentity(identity, false, true);
        return found ? std::optional<Found>(Found{*found, false}) : std::nullopt;
    }
    // A UUID names one directory, which may be a transient container's.
    if (auto permanent = cache.containerForContainerIdentity(identity); permanent) {
        return Found{*permanent, false};
    }
    if (auto transient = cache.containerForContainerIdentity(identity, true); transient) {
        return Found{*transient, true};
    }
    return std::nullopt;
}

void QRNCommandStageForDelete::removeCodeSigningRecords(
    const QRNContainerIdentity& identity, const Found& found,
    const std::shared_ptr<QRNCommandQueue>& queue) {
    // The records describe the installed bundle: a transient copy going away
    // must not take them from the permanent one.
    if (found.transient && permanentCopyExists(identity, found)) {
        return;
    }
    // The mapping logs its own failures; the delete goes on regardless.
    QRNCodeSigningMapping::sharedInstance()
        .removeCodeSigningDictionariesForIdentifierAndItsChildren(identity.identifier(), queue);
}

bool QRNCommandStageForDelete::permanentCopyExists(const QRNContainerIdentity& identity,
                                                   const Found& found) {
    auto plain = QRNContainerIdentity::containerIdentityWithUserIdentity(
        identity.userIdentity(), identity.identifier(), identity.containerClass());
    if (!plain) {
        QRN_LOG_ERROR(LogCategory::CodeSigningMapping,
                      "Could not construct container identity from {} to check for permanent "
                      "copy: {}",
                      found.metadata->description(), plain.error());
        return false;
    }
    auto permanent = QRNContainerCache::sharedInstance().containerForContainerIdentity(*plain);
    if (!permanent) {
        return false;
    }
    QRN_LOG_NOTICE(LogCategory::CodeSigningMapping,
                   "Skipping removal of code sign mapping since container to be deleted [{}] is "
                   "transient and there's a permanent one; error = {}",
                   found.metadata->description(), "(null)");
    return true;
}

void QRNCommandStageForDelete::moveToDeathRowOrRemove(const std::filesystem::path& url) {
    QRNFileManager& fileManager = QRNFileManager::defaultManager();
    // Container directories are named by UUID, so the name alone is unique
    // on death row.
    const std::filesystem::path destination =
        QRNGlobalConfiguration::sharedInstance().deathrowDirectory() / lastComponent(url);
    auto moved = fileManager.moveItemAtURL(url, destination);
    if (moved) {
        return;
    }
    QRN_LOG_DEBUG(LogCategory::Lifecycle, "Couldn't stage for deletion from {} to {}: {}",
                  url.string(), destination.string(), moved.error().description());
    if (auto removed = fileManager.removeItemAtURL(url); !removed) {
        // Logged but not reported, deliberately: the container still leaves
        // the cache and the other identities are still staged.
        QRN_ERROR_UNDERLYING(removed.error(), kQRNErrorDeleteContainerFailed,
                             "Failed to delete container at {}: {}", url.string(),
                             removed.error().description());
    }
}

Status QRNCommandStageForDelete::removeFromCache(const QRNContainerIdentity& identity,
                                                 bool transient) {
    return QRNContainerCache::sharedInstance().removeContainerForUserIdentity(
        identity.userIdentity(), identity.containerClass(), identity.identifier(), transient);
}

} // namespace quarn
