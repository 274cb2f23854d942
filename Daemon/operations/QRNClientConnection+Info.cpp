// Reading and touching one existing container: metadata, info values, the
// default structure, and deletion through the request's command queue; and
// listing the containers of a class.

#include "Daemon/operations/QRNClientConnection.h"

#include "Daemon/fs/QRNFileManager.h"
#include "Daemon/model/QRNContainerCache.h"
#include "Daemon/model/QRNContainerClass.h"
#include "Daemon/model/QRNMetadata.h"
#include "Daemon/operations/QRNCommandQueue.h"
#include "Daemon/operations/QRNCommandStageForDelete.h"
#include "Daemon/operations/QRNLocks.h"
#include "Daemon/operations/QRNOperationGuard.h"
#include "Daemon/support/Log.h"

namespace quarn {

namespace {

// One identifier's lock, read or write, for one scope. Info operations take
// it so that they wait for a creation of the container (which holds the
// global write lock) and writers of one container go one at a time.
class IdentifierLockHold {
public:
    IdentifierLockHold(const std::string& identifier, bool writing) : identifier_(identifier) {
        if (writing) {
            write_lock_identifier(identifier_);
        } else {
            read_lock_identifier(identifier_);
        }
    }
    ~IdentifierLockHold() { unlock_identifier(identifier_); }
    IdentifierLockHold(const IdentifierLockHold&) = delete;
    IdentifierLockHold& operator=(const IdentifierLockHold&) = delete;

private:
    Value identifier_;
};

// The key as a request hands it: anything but a string is refused.
CodeResult<std::string> infoKey(const Value* key) {
    if (const std::string* name = key ? key->asString() : nullptr) {
        return *name;
    }
    QRN_ERROR(kQRNErrorBadRequestArgument, "Invalid info key: {}",
              key ? key->description() : std::string("(null)"));
    return QRN_CODE(kQRNErrorBadRequestArgument);
}

} // namespace

CodeResult<QRNMetadataPtr>
QRNClientConnection::_cachedContainer(const QRNContainerIdentityPtr& identity,
                                      std::string_view message) {
    if (!identity) {
        QRN_ERROR(kQRNErrorBadRequestArgument, "Cannot lookup a nil container identity.");
        return QRN_CODE(kQRNErrorBadRequestArgument);
    }
    auto found = QRNContainerCache::sharedInstance().containerForContainerIdentity(identity);
    if (found) {
        return *found;
    }
    if (found.error().isQRN(kQRNErrorContainerNotFound)) {
        QRN_ERROR(kQRNErrorContainerNotFound, "{}{}", message, identity->description());
        return QRN_CODE(kQRNErrorContainerNotFound);
    }
    return QRN_CODE(found.error().qrnCode(kQRNErrorCacheRebuildFailed));
}

CodeResult<std::vector<QRNMetadataPtr>>
QRNClientConnection::containersWithClass(std::uint64_t containerClass, bool transient) {
    return QRNOperationGuard::run([&]() -> CodeResult<std::vector<QRNMetadataPtr>> {
        if (!QRNContainerClass::isValid(containerClass)) {
            QRN_ERROR(kQRNErrorInvalidArgument, "Can't act on an invalid container class: {}",
                      static_cast<std::int64_t>(containerClass));
            return QRN_CODE(kQRNErrorInvalidArgument);
        }
        auto all = QRNContainerCache::sharedInstance().allContainersForUserIdentity(
            userIdentity(), containerClass, transient);
        if (!all) {
            return QRN_CODE(all.error().qrnCode(kQRNErrorCacheRebuildFailed));
        }
        return std::move(*all);
    });
}

CodeResult<void> QRNClientConnection::setInfoValue(const Value& value, const Value* key,
                                                   const QRNContainerIdentityPtr& containerIdentity,
                                                   bool useLocking) {
    return QRNOperationGuard::run([&]() -> CodeResult<void> {
        auto name = infoKey(key);
        if (!name) {
            return QRN_CODE(name.error());
        }
        std::optional<IdentifierLockHold> lock;
        if (useLocking && containerIdentity) {
            lock.emplace(containerIdentity->identifier(), true);
        }
        auto found = _cachedContainer(containerIdentity, "No Container with identity: ");
        if (!found) {
            return QRN_CODE(found.error());
        }
        const QRNMetadata& old = **found;
        Value info = old.info().isDictionary() ? old.info() : Value::dictionary();
        if (value.isNone()) {
            info.erase(*name);
        } else {
            info.set(*name, value);
        }
        auto updated = std::make_shared<const QRNMetadata>(old.containerIdentity(), info, old.url(),
                                                           old.userManagedAssetsDirName());
        if (auto written = updated->writeMetadataToFileURL(old.url() / QRNMetadata::kFileName);
            !written) {
            return QRN_CODE(written.error().qrnCode(kQRNErrorWriteStateFileFailed));
        }
        if (auto added = QRNContainerCache::sharedInstance().addContainerMetadata(
                updated, old.url(), false, true);
            !added) {
            QRN_ERROR(kQRNErrorCacheAddFailed, "Failed to add to cache: {}, url: {}, transient: {}",
                      updated->description(), old.url().string(), 0);
            return QRN_CODE(kQRNErrorCacheAddFailed);
        }
        return {};
    });
}

CodeResult<Value> QRNClientConnection::infoValueForKey(
    const Value* key, const QRNContainerIdentityPtr& containerIdentity, bool useLocking) {
    return QRNOperationGuard::run([&]() -> CodeResult<Value> {
        auto name = infoKey(key);
        if (!name) {
            return QRN_CODE(name.error());
        }
        std::optional<IdentifierLockHold> lock;
        if (useLocking && containerIdentity) {
            lock.emplace(containerIdentity->identifier(), false);
        }
        auto found = _cachedContainer(containerIdentity, "No Container with identity: ");
        if (!found) {
            return QRN_CODE(found.error());
        }
        if (const Value* value = (*found)->info().get(*name)) {
            return *value;
        }
        QRN_ERROR(kQRNErrorInfoValueNotFound, "Didn't find info value for key: {}", *name);
        return QRN_CODE(kQRNErrorInfoValueNotFound);
    });
}

CodeResult<QRNMetadataPtr> QRNClientConnection::metadataWithContainerIdentity(
    const QRNContainerIdentityPtr& containerIdentity) {
    return QRNOperationGuard::run([&]() -> CodeResult<QRNMetadataPtr> {
        return _cachedContainer(containerIdentity, "No Container with user identity: ");
    });
}

CodeResult<void> QRNClientConnection::recreateDefaultStructureWithContainerIdentity(
    const QRNContainerIdentityPtr& containerIdentity) {
    return QRNOperationGuard::run([&]() -> CodeResult<void> {
        auto found = _cachedContainer(containerIdentity, "No Container with identity: ");
        if (!found) {
            return QRN_CODE(found.error());
        }
        const QRNMetadata& metadata = **found;
        if (auto made = _createSubDirectories(metadata.url(), metadata); !made) {
            return made;
        }
        if (QRNContainerClass::isSystem(metadata.containerClass())) {
            if (auto acl = QRNFileManager::defaultManager().standardizeACLsForSystemContainerAtURL(
                    metadata.url());
                !acl) {
                return QRN_CODE(acl.error().qrnCode(kQRNErrorSetACLFailed));
            }
        }
        return {};
    });
}

CodeResult<void> QRNClientConnection::deleteContainerWithContainerIdentity(
    const QRNContainerIdentityPtr& containerIdentity, bool transient) {
    return QRNOperationGuard::run([&]() -> CodeResult<void> {
        auto found =
            createOrLookupContainerWithContainerIdentity(containerIdentity, false, transient, true);
        if (!found) {
            QRN_LOG_ERROR(LogCategory::Lifecycle,
                          "Failed to lookup existing container to delete-identity: {}, "
                          "transient: {}",
                          containerIdentity ? containerIdentity->description() : "(null)",
                          transient ? 1 : 0);
            return QRN_CODE(found.error());
        }
        if (!commandQueue_) {
            QRN_ERROR(kQRNErrorInvalidArgument, "No command queue to stage the delete of {}",
                      containerIdentity->description());
            return QRN_CODE(kQRNErrorInvalidArgument);
        }
        // The concrete identity, so that exactly this directory goes.
        commandQueue_->insertCommand(
            QRNCommandStageForDelete::commandForStageForDeleteWithContainerIdentities(
                {(*found)->containerIdentity()}, true, nullptr));
        return {};
    });
}

} // namespace quarn
