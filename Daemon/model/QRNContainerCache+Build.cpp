// Building a cache entry from its class directory.

#include "Daemon/fs/QRNFileManager.h"
#include "Daemon/model/QRNContainerCache.h"
#include "Daemon/model/QRNContainerClass.h"
#include "Daemon/model/QRNGlobalConfiguration.h"
#include "Daemon/model/QRNWhitelist.h"
#include "Daemon/support/Signpost.h"
#include "Daemon/support/UUID.h"

#include <malloc.h>

#include <cerrno>
#include <exception>
#include <typeinfo>

namespace quarn {

bool QRNContainerCache::containerURL(const std::filesystem::path& url,
                                     std::uint64_t isValidForContainerClass) const {
    return containerName(url.filename().native(), isValidForContainerClass);
}

bool QRNContainerCache::containerName(std::string_view name, std::uint64_t cls) const {
    if (UUID::parse(name)) {
        return true;
    }
    switch (cls) {
    case kQRNContainerClassSystemData:
        return whitelist_->systemContainerIdIsWellknown(name);
    case kQRNContainerClassSystemGroup:
        return whitelist_->systemGroupContainerIdIsWellknown(name);
    default:
        return false;
    }
}

void QRNContainerCache::runRebuildGate(std::uint64_t cls) {
    RebuildGate gate;
    {
        std::lock_guard guard(gateMutex_);
        gate = gate_;
    }
    if (gate) {
        gate(cls);
    }
}

Result<QRNContainerCache::Entry*>
QRNContainerCache::_lock_rebuild(const QRNUserIdentityPtr& userIdentity, std::uint64_t cls,
                                 bool transient, bool populateSandbox) {
    _lock_assertOwned(__func__);
    const std::string key = cacheKey(*userIdentity, cls);
    QRN_LOG_INFO(LogCategory::Cache, "Rebuilding container class cache: {}{}", key,
                 transientSuffix(transient));
    Signpost interval(LogCategory::Cache, "RebuildingCache", fmt::format("class: {}", cls));
    runRebuildGate(cls);
    try {
        auto built = _lock_scanClassDirectory(userIdentity, cls, transient, populateSandbox);
        if (!built) {
            return QRN_UNEXPECTED(built.error());
        }
        interval.end(fmt::format("{} containers", built->containers.size()));
        EntryMap& entries = transient ? transient_ : permanent_;
        auto [stored, inserted] = entries.insert_or_assign(key, std::move(*built));
        // The scan's reads leave freed memory behind (the listing, every
        // parsed file) that the allocator keeps resident unless told.
        ::malloc_trim(0);
        return &stored->second;
    } catch (const std::exception& e) {
        return QRN_UNEXPECTED(
            QRN_ERROR(kQRNErrorException, "Got exception: {} : {}", typeid(e).name(), e.what()));
    }
}

Result<QRNContainerCache::Entry>
QRNContainerCache::_lock_scanClassDirectory(const QRNUserIdentityPtr& userIdentity,
                                            std::uint64_t cls, bool transient,
                                            bool populateSandbox) {
    _lock_assertOwned(__func__);
    const std::string key = cacheKey(*userIdentity, cls);
    const char* suffix = transientSuffix(transient);
    auto failed = [&](std::optional<Error> underlying) {
        const auto shortName = QRNContainerClass::shortName(cls);
        return underlying
                   ? QRN_ERROR_UNDERLYING(*underlying, kQRNErrorCacheRebuildFailed,
                                          "Cache: [{}]-{}{}: Failed to rebuild",
                                          userIdentity->identifier(), shortName, suffix)
                   : QRN_ERROR(kQRNErrorCacheRebuildFailed, "Cache: [{}]-{}{}: Failed to rebuild",
                               userIdentity->identifier(), shortName, suffix);
    };
    auto directory =
        configuration_->containerDirectoryURLForUserIdentity(userIdentity, cls, transient);
    if (!directory) {
        return QRN_UNEXPECTED(failed(std::nullopt));
    }
    auto items = fileManager_->urlsForItemsInDirectoryAtURL(*directory);
    if (!items && !items.error().isPOSIX(ENOENT)) {
        return QRN_UNEXPECTED(failed(items.error()));
    }
    Entry entry;
    entry.sandboxPopulated = populateSandbox && !transient;
    // By reference: a conditional with a temporary on one side would copy
    // the whole listing.
    static const std::vector<QRNFileManager::Item> kNoItems;
    QRNMetadata::ReadMemo memo;
    std::string file; // reused: no path object per container
    for (const auto& item : items ? *items : kNoItems) {
        const std::string& url = item.url.native();
        const std::string_view name = std::string_view(url).substr(url.rfind('/') + 1);
        if (!containerName(name, cls)) {
            continue;
        }
        if (!item.isDirectory) {
            // A link or file under a container's name is never trusted as one.
            QRN_LOG_DEBUG(LogCategory::Cache, "Cache: {}{}: skipping non-directory {}", key, suffix,
                          url);
            continue;
        }
        // The reader has made sure the record's user is this entry's; a record
        // of this entry's class then lies in its class directory, since that
        // is the directory listed. Only a record of another class needs the
        // path check (which reports it), and the check is most of a read.
        file.assign(url).append("/").append(QRNMetadata::kFileName);
        auto metadata =
            QRNMetadata::readAndValidateMetadataAtFilePath(file, userIdentity, false, &memo);
        if (metadata && (*metadata)->containerClass() != cls) {
            metadata =
                QRNMetadata::readAndValidateMetadataAtFilePath(file, userIdentity, true, &memo);
        }
        if (!metadata) {
            // Reported (making the error logs it) and left out of the entry.
            QRN_ERROR(kQRNErrorNoMetadata,
                      "Cache: {}{}: INCONSISTENT-No Metadata at: {} for id: {}, "
                      "class: {}",
                      key, suffix, url, name, cls);
            continue;
        }
        // A later record with the same identifier replaces the earlier.
        Slot& slot = storeRecord(entry, std::move(*metadata));
        const std::string& identifier = slot.record->identifier();
        if (entry.sandboxPopulated &&
            shouldRegisterSandboxMappingWithUserIdentity(userIdentity, identifier, cls)) {
            if (int err = _lock_mapContainer(slot, *userIdentity); err != 0) {
                QRN_LOG_ERROR(LogCategory::Sandbox,
                              "Failed to set container mapping during create/lookup operation "
                              "of {}, {}",
                              identifier, err);
            }
        }
    }
    return entry;
}

} // namespace quarn
