// Create or look up a container. New containers are built completely in a
// staging directory and moved into place with one rename, so a half-built
// container is never visible at its live path.

#include "Daemon/operations/QRNClientConnection.h"

#include "Daemon/codesigning/QRNCodeSigningMapping.h"
#include "Daemon/fs/QRNFileManager.h"
#include "Daemon/model/QRNContainerCache.h"
#include "Daemon/model/QRNContainerClass.h"
#include "Daemon/model/QRNGlobalConfiguration.h"
#include "Daemon/model/QRNMetadata.h"
#include "Daemon/model/QRNWhitelist.h"
#include "Daemon/operations/QRNGlobalIdentifierLock.h"
#include "Daemon/operations/QRNOperationGuard.h"
#include "Daemon/platform/Features.h"
#include "Daemon/support/Log.h"
#include "Daemon/support/QRNDaemonContext.h"
#include "Daemon/support/Signpost.h"
#include "Daemon/support/UUID.h"

#include <exception>

namespace quarn {

namespace {

bool isNotFound(const Error& error) {
    return error.isQRN(kQRNErrorContainerNotFound);
}

} // namespace

// What one call has taken and must give back on every exit.
struct QRNClientConnection::CreateAttempt {
    // Set once the staging directory exists, cleared once it has been moved
    // into place: while set, a failure sends it to death row.
    std::optional<std::filesystem::path> stagingURL;
    // The global write lock, when this call took it; held to the end.
    std::optional<QRNGlobalIdentifierLock> globalLock;
};

CodeResult<QRNMetadataPtr> QRNClientConnection::createOrLookupContainerWithContainerIdentity(
    const QRNContainerIdentityPtr& identity, bool createIfNecessary, bool transient,
    bool useLocking, bool* existed) {
    QRN_LOG_DEBUG(LogCategory::Unspecified,
                  "createOrLookup; identity: {}, createIfNecessary: {}, transient: {}, "
                  "allowOtherIdLookup: {}, unrestricted: {}, clientBundleIdentifier: {}",
                  identity ? identity->description() : std::string("(null)"),
                  createIfNecessary ? 1 : 0, transient ? 1 : 0, allowOtherIdLookup() ? 1 : 0,
                  unrestricted() ? 1 : 0, clientBundleIdentifier());
    CreateAttempt attempt;
    bool found = false;
    CodeResult<QRNMetadataPtr> result = QRN_CODE(kQRNErrorException);
    try {
        result =
            _createOrLookup(identity, createIfNecessary, transient, useLocking, attempt, found);
    } catch (const std::exception& exception) {
        QRNOperationGuard::reportException(exception);
    }
    _cleanUpStaging(attempt, result);
    attempt.globalLock.reset();
    if (result && existed) {
        *existed = found;
    }
    return result;
}

CodeResult<QRNMetadataPtr>
QRNClientConnection::_createOrLookup(const QRNContainerIdentityPtr& identity,
                                     bool createIfNecessary, bool transient, bool useLocking,
                                     CreateAttempt& attempt, bool& existed) {
    if (!identity) {
        QRN_ERROR(kQRNErrorBadRequestArgument, "Cannot lookup a nil container identity.");
        return QRN_CODE(kQRNErrorBadRequestArgument);
    }
    if (auto allowed = _checkAccess(*identity); !allowed) {
        return QRN_CODE(allowed.error());
    }
    if (auto allowed = _checkSystemContainerAccess(*identity); !allowed) {
        return QRN_CODE(allowed.error());
    }
    // The entry is built before any global lock is taken: a scan lasts as
    // long as the class directory's owner makes it, and a global hold meanwhile
    // would keep every creator waiting. A failure is met again under the lock.
    const bool isKernel = clientIdentity_ && clientIdentity_->isKernel();
    (void)QRNContainerCache::sharedInstance().prepareEntryForContainerIdentity(identity, transient,
                                                                               !isKernel);
    if (!transient) {
        auto found = _lookupUnderReadLock(identity, useLocking);
        if (found || found.error() != kQRNErrorContainerNotFound) {
            existed = found.has_value();
            return found;
        }
    }
    if (!createIfNecessary) {
        // Transient containers are never reused, so a transient request
        // without creation fails without looking.
        QRN_ERROR(kQRNErrorContainerNotFound, "Container with identifier: \"{}\" Not Found",
                  identity->identifier());
        return QRN_CODE(kQRNErrorContainerNotFound);
    }
    if (useLocking) {
        attempt.globalLock.emplace(QRNGlobalIdentifierLock::Mode::Write);
    }
    // Another request may have made it between the two locks.
    auto found = _lookupUnderWriteLock(identity, transient);
    if (found || found.error() != kQRNErrorContainerNotFound) {
        existed = found.has_value();
        return found;
    }
    existed = false;
    return _createContainer(*identity, transient, attempt);
}

CodeResult<void> QRNClientConnection::_checkAccess(const QRNContainerIdentity& identity) {
    const std::uint64_t cls = identity.containerClass();
    const std::string& identifier = identity.identifier();
    const bool own = !identifier.empty() && identifier == clientBundleIdentifier();
    if (own || allowOtherIdLookup() || (QRNContainerClass::isGroup(cls) && allowGroupIdLookup()) ||
        unrestricted() || isEntitledForLookupWithClass(cls, identifier) ||
        QRNWhitelist::sharedWhitelist().isLookupWhitelistedFromCodeSignIdentifier(
            clientBundleIdentifier(), cls, identifier)) {
        return {};
    }
    QRN_ERROR(kQRNErrorNotEntitled,
              "{} not entitled to retrieve container class {} with identifier {}",
              clientBundleIdentifier(), static_cast<std::int64_t>(cls), identifier);
    return QRN_CODE(kQRNErrorNotEntitled);
}

CodeResult<void>
QRNClientConnection::_checkSystemContainerAccess(const QRNContainerIdentity& identity) {
    const std::string& identifier = identity.identifier();
    if (identity.containerClass() != kQRNContainerClassSystemData || allowOtherIdLookup() ||
        unrestricted() || isEntitledForLookupWithClass(kQRNContainerClassSystemData, identifier)) {
        return {};
    }
    // A client has its own system container only when its code signature
    // declares one.
    if (QRNWhitelist::sharedWhitelist().isLookupWhitelistedFromCodeSignIdentifier(
            clientBundleIdentifier(), kQRNContainerClassSystemData, identifier) ||
        (!identifier.empty() && identifier == clientBundleIdentifier() &&
         QRNCodeSigningMapping::sharedInstance().identifierHasSystemContainer(identifier))) {
        return {};
    }
    QRN_ERROR(kQRNErrorNotEntitled, "{} not entitled for system container with identifier {}",
              clientBundleIdentifier(), identifier);
    return QRN_CODE(kQRNErrorNotEntitled);
}

CodeResult<QRNMetadataPtr>
QRNClientConnection::_lookupUnderReadLock(const QRNContainerIdentityPtr& identity,
                                          bool useLocking) {
    std::optional<QRNGlobalIdentifierLock> readLock;
    if (useLocking) {
        readLock.emplace(QRNGlobalIdentifierLock::Mode::Read);
    }
    // The kernel asks on behalf of the sandbox: its own mapping cannot answer it.
    const bool isKernel = clientIdentity_ && clientIdentity_->isKernel();
    auto found = QRNContainerCache::sharedInstance().containerForContainerIdentity(identity, false,
                                                                                   true, !isKernel);
    if (!found) {
        return QRN_CODE(found.error().qrnCode(kQRNErrorCacheRebuildFailed));
    }
    return *found;
}

CodeResult<QRNMetadataPtr>
QRNClientConnection::_lookupUnderWriteLock(const QRNContainerIdentityPtr& identity,
                                           bool transient) {
    const bool isKernel = clientIdentity_ && clientIdentity_->isKernel();
    auto found = QRNContainerCache::sharedInstance().containerForContainerIdentity(
        identity, transient, true, !isKernel);
    if (!found) {
        return QRN_CODE(isNotFound(found.error())
                            ? kQRNErrorContainerNotFound
                            : found.error().qrnCode(kQRNErrorCacheRebuildFailed));
    }
    if (!transient) {
        return *found;
    }
    // Transient containers are never reused: the old one goes.
    const std::filesystem::path& url = (*found)->url();
    if (auto moved = _moveItemAtURLToDeathRow(url, true, true); !moved) {
        QRN_ERROR(kQRNErrorRemoveTransientFailed, "Failed to remove transient container at {}",
                  url.string());
        return QRN_CODE(kQRNErrorRemoveTransientFailed);
    }
    return QRN_CODE(kQRNErrorContainerNotFound);
}

CodeResult<QRNMetadataPtr>
QRNClientConnection::_createContainer(const QRNContainerIdentity& identity, bool transient,
                                      CreateAttempt& attempt) {
    const UUID uuid = UUID::random();
    const std::string uuidString = uuid.string();
    Signpost(LogCategory::Lifecycle, "CreatingContainer",
             fmt::format(" uuid={}  identifier={}  class={} ", uuidString, identity.identifier(),
                         identity.containerClass()));

    auto staged = _buildInStaging(identity, uuid, attempt.stagingURL);
    if (!staged) {
        return staged;
    }
    const std::optional<std::filesystem::path> liveURL = _liveURL(identity, transient, uuidString);
    QRNFileManager& fileManager = QRNFileManager::defaultManager();
    if (!liveURL || !fileManager.moveItemAtURL(*attempt.stagingURL, *liveURL)) {
        QRN_ERROR(kQRNErrorMoveStagingToLiveFailed,
                  "Failed to move staging dir: {} to live dir: {}", attempt.stagingURL->string(),
                  liveURL ? liveURL->string() : "(null)");
        return QRN_CODE(kQRNErrorMoveStagingToLiveFailed);
    }
    attempt.stagingURL.reset();

    if (QRNDaemonContext::current().instance<Features>().isEnabled("quarnd",
                                                                   "fast_container_sizing")) {
        // Primes the size accounting; the value itself is not needed.
        fileManager.fastDiskUsageForURL(*liveURL);
    }
    auto live =
        std::make_shared<const QRNMetadata>((*staged)->containerIdentity(), (*staged)->info(),
                                            *liveURL, (*staged)->userManagedAssetsDirName());
    if (auto added = QRNContainerCache::sharedInstance().addContainerMetadata(live, *liveURL,
                                                                              transient, true);
        !added) {
        // The container stays where it is; the next rebuild finds it.
        QRN_ERROR(kQRNErrorCacheAddFailed, "Failed to add to cache : {}, url: {}, transient: {}",
                  live->description(), liveURL->string(), transient ? 1 : 0);
        return QRN_CODE(kQRNErrorCacheAddFailed);
    }
    return QRNMetadataPtr(live);
}

std::optional<std::filesystem::path>
QRNClientConnection::_liveURL(const QRNContainerIdentity& identity, bool transient,
                              const std::string& uuidString) {
    const std::uint64_t cls = identity.containerClass();
    std::optional<std::filesystem::path> directory =
        QRNGlobalConfiguration::sharedInstance().containerDirectoryURLForUserIdentity(
            identity.userIdentity(), cls, transient);
    if (!directory) {
        return std::nullopt;
    }
    // Well-known system containers live under fixed names, not UUIDs.
    std::optional<std::string> name;
    if (cls == kQRNContainerClassSystemGroup) {
        name = QRNWhitelist::sharedWhitelist().wellknownSystemGroupContainerForId(
            identity.identifier());
    } else if (cls == kQRNContainerClassSystemData) {
        name = QRNWhitelist::sharedWhitelist().wellknownSystemContainerForId(identity.identifier());
    }
    return *directory / name.value_or(uuidString);
}

void QRNClientConnection::_cleanUpStaging(CreateAttempt& attempt,
                                          CodeResult<QRNMetadataPtr>& result) {
    if (result || !attempt.stagingURL) {
        return;
    }
    if (auto moved = _moveItemAtURLToDeathRow(*attempt.stagingURL, true, true); !moved) {
        QRN_ERROR(kQRNErrorRemoveStagingFailed, "Failed to remove staging dir: {}",
                  attempt.stagingURL->string());
        result = QRN_CODE(kQRNErrorRemoveStagingFailed);
    }
    attempt.stagingURL.reset();
}

} // namespace quarn
