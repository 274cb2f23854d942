#include "Daemon/model/QRNContainerCache.h"

#include "Daemon/fs/QRNFileManager.h"
#include "Daemon/model/QRNConcreteContainerIdentity.h"
#include "Daemon/model/QRNContainerClass.h"
#include "Daemon/model/QRNGlobalConfiguration.h"
#include "Daemon/model/QRNUserIdentityCache.h"
#include "Daemon/model/QRNUserIdentityCacheObserver.h"
#include "Daemon/model/QRNWhitelist.h"
#include "Daemon/platform/Notifications.h"
#include "Daemon/support/QRNDaemonContext.h"

#include <cstdlib>
#include <shared_mutex>

namespace quarn {

// Forwards the user identity cache's invalidations. The identity cache holds
// it weakly; the container cache detaches it before going away, so a
// callback already under way finishes before the cache is destroyed.
class QRNContainerCache::Observer final : public QRNUserIdentityCacheObserver {
public:
    explicit Observer(QRNContainerCache* cache) : cache_(cache) {}

    void userIdentityCache(QRNUserIdentityCache& cache,
                           const QRNUserIdentityPtr& didInvalidateUserIdentity) override {
        std::shared_lock guard(mutex_);
        if (cache_ != nullptr) {
            cache_->userIdentityCache(cache, didInvalidateUserIdentity);
        }
    }

    void detach() {
        std::unique_lock guard(mutex_);
        cache_ = nullptr;
    }

private:
    std::shared_mutex mutex_; // guards cache_: callbacks share it, detach excludes them
    QRNContainerCache* cache_;
};

QRNContainerCache::QRNContainerCache(QRNDaemonContext& context)
    : QRNContainerCache(context, context.sharedInstance<QRNUserIdentityCache>()) {}

QRNContainerCache::QRNContainerCache(QRNDaemonContext& context,
                                     std::shared_ptr<QRNUserIdentityCache> userIdentityCache)
    : userIdentityCache_(std::move(userIdentityCache)),
      configuration_(context.sharedInstance<QRNGlobalConfiguration>()),
      fileManager_(context.sharedInstance<QRNFileManager>()),
      whitelist_(context.sharedInstance<QRNWhitelist>()),
      sandbox_(context.sharedInstance<SandboxKernel>()),
      notifications_(context.sharedInstance<Notifications>()),
      observer_(std::make_shared<Observer>(this)) {
    userIdentityCache_->addObserver(observer_);
}

QRNContainerCache::~QRNContainerCache() {
    userIdentityCache_->removeObserver(observer_);
    observer_->detach();
}

QRNContainerCache& QRNContainerCache::sharedInstance() {
    return QRNDaemonContext::current().instance<QRNContainerCache>();
}

std::string QRNContainerCache::cacheKey(const QRNUserIdentity& userIdentity,
                                        std::uint64_t containerClass) {
    if (QRNContainerClass::isUserIdentityRequired(containerClass)) {
        return fmt::format("[{}]-{}", userIdentity.identifier(),
                           QRNContainerClass::shortName(containerClass));
    }
    return std::string(QRNContainerClass::shortName(containerClass));
}

void QRNContainerCache::lock() {
    mutex_.lock();
    owner_.store(std::this_thread::get_id());
}

void QRNContainerCache::unlock() {
    owner_.store(std::thread::id());
    mutex_.unlock();
}

void QRNContainerCache::_lock_assertOwned(const char* function) const {
    if (owner_.load() != std::this_thread::get_id()) {
        QRN_LOG_FAULT(LogCategory::Cache, "{}: container cache lock is not held", function);
        std::abort();
    }
}

void QRNContainerCache::assertNotOwned(const char* function) const {
    // The lock is not recursive: taking it again would hang the thread.
    if (owner_.load() == std::this_thread::get_id()) {
        QRN_LOG_FAULT(LogCategory::Cache, "{}: called with the container cache lock held",
                      function);
        std::abort();
    }
}

Result<QRNContainerCache::Entry*>
QRNContainerCache::_lock_entryFor(Locker& locked, const QRNUserIdentityPtr& userIdentity,
                                  std::uint64_t cls, bool transient, bool populateSandbox) {
    _lock_assertOwned(__func__);
    EntryMap& entries = transient ? transient_ : permanent_;
    const std::string key = cacheKey(*userIdentity, cls);
    // Looped: an entry published by the build waited for may be invalidated
    // again before this thread has the lock back.
    for (;;) {
        if (auto found = entries.find(key); found != entries.end()) {
            Entry& entry = found->second;
            if (populateSandbox && !transient && !entry.sandboxPopulated) {
                _lock_populateSandbox(entry, *userIdentity);
            }
            return &entry;
        }
        auto waited = _lock_awaitBuild(locked, key, transient);
        if (!waited) {
            return _lock_rebuild(locked, userIdentity, cls, transient, populateSandbox);
        }
        if (waited->failure) {
            return QRN_UNEXPECTED(*waited->failure);
        }
    }
}

std::shared_ptr<QRNContainerCache::Build>
QRNContainerCache::_lock_awaitBuild(Locker& locked, const std::string& key, bool transient) {
    _lock_assertOwned(__func__);
    std::shared_ptr<Build> waited;
    for (auto found = builds_.find(buildKey(key, transient)); found != builds_.end();
         found = builds_.find(buildKey(key, transient))) {
        waited = found->second;
        QRN_LOG_DEBUG(LogCategory::Cache, "Cache: {}{}: waiting for its rebuild", key,
                      transientSuffix(transient));
        buildDone_.wait(locked, [&] { return waited->done; });
    }
    return waited;
}

QRNContainerCache::MetadataPtr
QRNContainerCache::_lock_find(const Entry& entry, const QRNContainerIdentity& identity) const {
    _lock_assertOwned(__func__);
    auto found = entry.containers.find(identity.identifier());
    if (found == entry.containers.end()) {
        return nullptr;
    }
    const MetadataPtr& record = found->second.record;
    return uuidMatches(identity, *record) ? record : nullptr;
}

QRNContainerCache::Slot& QRNContainerCache::storeRecord(Entry& entry, MetadataPtr record) {
    auto found = entry.containers.find(record->identifier());
    if (found == entry.containers.end()) {
        const std::string_view key = record->identifier();
        Slot slot;
        slot.record = std::move(record);
        return entry.containers.emplace(key, std::move(slot)).first->second;
    }
    // The key views the old record's identifier: re-key before that record
    // may go (a pushed slot keeps it).
    auto node = entry.containers.extract(found);
    node.mapped().record = std::move(record);
    node.key() = node.mapped().record->identifier();
    return entry.containers.insert(std::move(node)).position->second;
}

bool QRNContainerCache::uuidMatches(const QRNContainerIdentity& identity,
                                    const QRNMetadata& metadata) {
    // A concrete identity names one directory: another container with the
    // same identifier is not it.
    const auto* concrete = dynamic_cast<const QRNConcreteContainerIdentity*>(&identity);
    return concrete == nullptr || concrete->uuid() == metadata.uuid();
}

Result<QRNContainerCache::MetadataPtr>
QRNContainerCache::containerForContainerIdentity(const QRNContainerIdentityPtr& identity,
                                                 bool transient, bool updateSandbox,
                                                 bool allowKernelLookup) {
    if (!identity || !identity->userIdentity()) {
        return QRN_UNEXPECTED(QRN_ERROR(kQRNErrorInvalidCacheInput, "Invalid Identifier: {}",
                                        identity ? identity->identifier() : "(null)"));
    }
    const auto& user = identity->userIdentity();
    const std::uint64_t cls = identity->containerClass();
    const std::string key = cacheKey(*user, cls);
    Locker locked(*this);
    // The kernel's mapping is consulted only while the entry is not built:
    // once it is, the entry is the cheaper and authoritative answer, and the
    // read-back exists to spare a class-directory scan.
    const bool built = (transient ? transient_ : permanent_).count(key) != 0;
    if (!built && !transient && allowKernelLookup) {
        if (auto fromKernel = _lock_containerFromKernelSandbox(*identity)) {
            return fromKernel;
        }
    }
    auto entry = _lock_entryFor(locked, user, cls, transient, updateSandbox);
    if (!entry) {
        return QRN_UNEXPECTED(entry.error());
    }
    MetadataPtr metadata = _lock_find(**entry, *identity);
    if (!metadata) {
        return QRN_UNEXPECTED(QRN_ERROR(kQRNErrorContainerNotFound,
                                        "Cache: {}{}: Container Not Found with ID: {}", key,
                                        transientSuffix(transient), identity->identifier()));
    }
    if (metadata->urlString().empty()) {
        return QRN_UNEXPECTED(QRN_ERROR(kQRNErrorInvalidCacheInput, "Cache: {}{}: nil URL from {}",
                                        key, transientSuffix(transient), identity->identifier()));
    }
    QRN_LOG_DEBUG(LogCategory::Cache, "Cache: {}{}: Found Identifier: {}", key,
                  transientSuffix(transient), identity->identifier());
    return metadata;
}

Status QRNContainerCache::prepareEntryForContainerIdentity(const QRNContainerIdentityPtr& identity,
                                                           bool transient, bool allowKernelLookup) {
    if (!identity || !identity->userIdentity()) {
        return QRN_UNEXPECTED(QRN_ERROR(kQRNErrorInvalidCacheInput, "Invalid Identifier: {}",
                                        identity ? identity->identifier() : "(null)"));
    }
    const auto& user = identity->userIdentity();
    const std::uint64_t cls = identity->containerClass();
    Locker locked(*this);
    const bool built = (transient ? transient_ : permanent_).count(cacheKey(*user, cls)) != 0;
    if (built || (!transient && allowKernelLookup && _lock_containerFromKernelSandbox(*identity))) {
        return {};
    }
    auto entry = _lock_entryFor(locked, user, cls, transient, false);
    if (!entry) {
        return QRN_UNEXPECTED(entry.error());
    }
    return {};
}

Result<std::vector<QRNContainerCache::MetadataPtr>>
QRNContainerCache::allContainersForUserIdentity(const QRNUserIdentityPtr& userIdentity,
                                                std::uint64_t contentClass, bool transient,
                                                bool populateSandboxCache) {
    if (!QRNContainerClass::isValid(contentClass) || !userIdentity) {
        return QRN_UNEXPECTED(
            QRN_ERROR(kQRNErrorInvalidCacheInput, "Invalid Content Class: {}", contentClass));
    }
    Locker locked(*this);
    auto entry =
        _lock_entryFor(locked, userIdentity, contentClass, transient, populateSandboxCache);
    if (!entry) {
        return QRN_UNEXPECTED(entry.error());
    }
    std::vector<MetadataPtr> all;
    all.reserve((*entry)->containers.size());
    for (const auto& [identifier, slot] : (*entry)->containers) {
        all.push_back(slot.record);
    }
    return all;
}

Status QRNContainerCache::addContainerMetadata(const MetadataPtr& metadata,
                                               const std::filesystem::path& url, bool transient,
                                               bool updateSandbox) {
    if (!metadata || !QRNContainerClass::isValid(metadata->containerClass())) {
        return QRN_UNEXPECTED(QRN_ERROR(kQRNErrorInvalidCacheInput,
                                        "Invalid Metadata Content Class: {}",
                                        metadata ? metadata->containerClass() : 0));
    }
    if (metadata->identifier().empty() || !metadata->userIdentity()) {
        return QRN_UNEXPECTED(QRN_ERROR(kQRNErrorInvalidCacheInput,
                                        "Invalid metadata Identifier: {}", metadata->identifier()));
    }
    if (url.empty() || !url.is_absolute()) {
        return QRN_UNEXPECTED(
            QRN_ERROR(kQRNErrorInvalidCacheInput, "Invalid input: URL: {}", url.string()));
    }
    MetadataPtr record = metadata;
    if (metadata->urlString() != url.native()) {
        record =
            std::make_shared<const QRNMetadata>(metadata->containerIdentity(), metadata->info(),
                                                url, metadata->userManagedAssetsDirName());
    }
    const auto& user = record->userIdentity();
    const std::uint64_t cls = record->containerClass();
    Locker locked(*this);
    auto entry = _lock_entryFor(locked, user, cls, transient, false);
    if (!entry) {
        return QRN_UNEXPECTED(entry.error());
    }
    Slot& slot = storeRecord(**entry, record);
    QRN_LOG_INFO(LogCategory::Cache, "Cache: {}{}: Added Identifier: {}", cacheKey(*user, cls),
                 transientSuffix(transient), record->identifier());
    if (updateSandbox && !transient &&
        shouldRegisterSandboxMappingWithUserIdentity(user, record->identifier(), cls)) {
        if (int err = _lock_mapContainer(slot, *user); err != 0) {
            QRN_LOG_ERROR(LogCategory::Sandbox, "Failed to set container mapping of {}, {}",
                          record->identifier(), err);
        }
    }
    return {};
}

Status QRNContainerCache::removeContainerForUserIdentity(const QRNUserIdentityPtr& userIdentity,
                                                         std::uint64_t contentClass,
                                                         const std::string& identifier,
                                                         bool transient) {
    if (!QRNContainerClass::isValid(contentClass) || !userIdentity) {
        return QRN_UNEXPECTED(
            QRN_ERROR(kQRNErrorInvalidCacheInput, "Invalid Content Class: {}", contentClass));
    }
    if (identifier.empty()) {
        return QRN_UNEXPECTED(
            QRN_ERROR(kQRNErrorInvalidCacheInput, "Invalid Identifier: {}", identifier));
    }
    const std::string key = cacheKey(*userIdentity, contentClass);
    Locker locked(*this);
    // A scan under way may have listed the container before it left its
    // class directory: the removal applies to the entry that build
    // publishes, not to none.
    _lock_awaitBuild(locked, key, transient);
    EntryMap& entries = transient ? transient_ : permanent_;
    std::optional<Slot> removed;
    if (auto found = entries.find(key); found != entries.end()) {
        if (auto node = found->second.containers.extract(identifier)) {
            removed = std::move(node.mapped());
            QRN_LOG_INFO(LogCategory::Cache, "Cache: {}{}: Removed Identifier: {}", key,
                         transientSuffix(transient), identifier);
        }
    }
    if (!transient) {
        _lock_unmapContainer(removed ? &*removed : nullptr, *userIdentity, contentClass,
                             identifier);
    }
    return {};
}

void QRNContainerCache::invalidateUserIdentity(const QRNUserIdentityPtr& userIdentity) {
    assertNotOwned(__func__);
    if (!userIdentity) {
        return;
    }
    {
        Locker locked(*this);
        for (std::uint64_t cls = kQRNContainerClassAppBundle; cls < kQRNContainerClassMax; ++cls) {
            const std::string key = cacheKey(*userIdentity, cls);
            if (auto found = permanent_.find(key); found != permanent_.end()) {
                for (const auto& [identifier, slot] : found->second.containers) {
                    if (!slot.pushed) {
                        continue;
                    }
                    if (int err = pullSandboxMapping(pushedMapping(slot)); err != 0) {
                        QRN_LOG_ERROR(LogCategory::Sandbox,
                                      "Failed to remove container mapping of [{}], class: {}",
                                      identifier, cls);
                    }
                }
                permanent_.erase(found);
            }
            transient_.erase(key);
            // A scan under way may have read what the invalidation drops.
            for (bool transient : {false, true}) {
                if (auto building = builds_.find(buildKey(key, transient));
                    building != builds_.end()) {
                    building->second->stale = true;
                }
            }
        }
    }
    if (auto posted = notifications_->post(Notifications::kUserInvalidated); !posted) {
        QRN_LOG_ERROR(LogCategory::Cache, "Could not post user-invalidated notification: {}",
                      static_cast<unsigned>(posted.error().code));
    }
}

void QRNContainerCache::userIdentityCache(QRNUserIdentityCache& /*cache*/,
                                          const QRNUserIdentityPtr& didInvalidateUserIdentity) {
    invalidateUserIdentity(didInvalidateUserIdentity);
}

void QRNContainerCache::setRebuildGate(RebuildGate gate) {
    std::lock_guard guard(gateMutex_);
    gate_ = std::move(gate);
}

} // namespace quarn
