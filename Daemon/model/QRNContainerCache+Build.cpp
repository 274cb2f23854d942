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

// Registers a build of an entry for its scope. Whichever way the build ends
// it leaves the register, is marked done and wakes the requests waiting for
// it, so none waits for a build that is gone. Made and destroyed with the
// cache's lock held.
class QRNContainerCache::BuildRecord {
public:
    BuildRecord(QRNContainerCache& cache, std::string key)
        : cache_(cache), key_(std::move(key)), build_(std::make_shared<Build>()) {
        cache_.builds_.insert_or_assign(key_, build_);
    }
    ~BuildRecord() {
        cache_.builds_.erase(key_);
        build_->done = true;
        cache_.buildDone_.notify_all();
    }
    BuildRecord(const BuildRecord&) = delete;
    BuildRecord& operator=(const BuildRecord&) = delete;

    Build* operator->() const { return build_.get(); }

private:
    QRNContainerCache& cache_;
    std::string key_;
    std::shared_ptr<Build> build_;
};

namespace {

// Leaves a held lock for a scope.
template <typename Lockable> class Unlocked {
public:
    explicit Unlocked(Lockable& locked) : locked_(locked) { locked_.unlock(); }
    ~Unlocked() { locked_.lock(); }
    Unlocked(const Unlocked&) = delete;
    Unlocked& operator=(const Unlocked&) = delete;

private:
    Lockable& locked_;
};

} // namespace

Result<QRNContainerCache::Entry*>
QRNContainerCache::_lock_rebuild(Locker& locked, const QRNUserIdentityPtr& userIdentity,
                                 std::uint64_t cls, bool transient, bool populateSandbox) {
    _lock_assertOwned(__func__);
    const std::string key = cacheKey(*userIdentity, cls);
    BuildRecord build(*this, buildKey(key, transient));
    std::optional<Result<Entry>> scanned;
    // An invalidation during the scan makes it stale: scanned again rather
    // than merged, since it may stand for a user identity that is gone and
    // what it dropped cannot be told apart from what the scan read. Adds and
    // removals cannot overlap a scan: they wait for the build and change the
    // published entry.
    while (!scanned || build->stale) {
        build->stale = false;
        QRN_LOG_INFO(LogCategory::Cache, "Rebuilding container class cache: {}{}", key,
                     transientSuffix(transient));
        Unlocked unlocked(locked);
        scanned.emplace(buildEntry(userIdentity, cls, transient));
    }
    Result<Entry>& built = *scanned;
    if (!built) {
        build->failure = built.error();
        return QRN_UNEXPECTED(built.error());
    }
    EntryMap& entries = transient ? transient_ : permanent_;
    auto [stored, inserted] = entries.insert_or_assign(key, std::move(*built));
    if (populateSandbox && !transient) {
        _lock_populateSandbox(stored->second, *userIdentity);
    }
    return &stored->second;
}

Result<QRNContainerCache::Entry>
QRNContainerCache::buildEntry(const QRNUserIdentityPtr& userIdentity, std::uint64_t cls,
                              bool transient) {
    Signpost interval(LogCategory::Cache, "RebuildingCache", fmt::format("class: {}", cls));
    try {
        runRebuildGate(cls);
        auto built = scanClassDirectory(userIdentity, cls, transient);
        if (built) {
            interval.end(fmt::format("{} containers", built->containers.size()));
        }
        // The scan's reads leave freed memory behind (the listing, every
        // parsed file) that the allocator keeps resident unless told.
        ::malloc_trim(0);
        return built;
    } catch (const std::exception& e) {
        return QRN_UNEXPECTED(
            QRN_ERROR(kQRNErrorException, "Got exception: {} : {}", typeid(e).name(), e.what()));
    }
}

Result<QRNContainerCache::Entry>
QRNContainerCache::scanClassDirectory(const QRNUserIdentityPtr& userIdentity, std::uint64_t cls,
                                      bool transient) {
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
        storeRecord(entry, std::move(*metadata));
    }
    return entry;
}

} // namespace quarn
