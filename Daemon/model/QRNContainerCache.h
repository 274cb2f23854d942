#pragma once
// The containers on disk, per user and class, so that a lookup need not scan
// a class directory each time: for each (user, class) an identifier ->
// validated metadata map, built lazily from the class directory on first use
// and dropped again when the user identity is invalidated. Permanent and
// transient containers are kept apart.
//
// The cache also keeps the kernel sandbox's container mapping in step with
// the permanent data and group containers it knows, so processes can be
// confined to them, and may read that mapping back to answer a lookup
// without scanning a class directory at all.
//
// The code-signing mapping is not an input: nothing here consults it, and it
// lives in a layer above this one.
//
// The operations are spread over files by concern: QRNContainerCache.cpp
// (lookups, insertion, removal, invalidation), +Build (scanning a class
// directory), +Sandbox (the kernel sandbox mapping and its read-back).
//
// A class directory is scanned without the cache's lock: a user chooses how
// much their own directories hold, so one entry's build must not hold up
// requests for any other entry. Requests for the entry being built wait for
// that build and share its result.

#include "Daemon/model/QRNContainerIdentity.h"
#include "Daemon/model/QRNMetadata.h"
#include "Daemon/model/QRNUserIdentity.h"
#include "Daemon/platform/SandboxKernel.h"
#include "Daemon/support/QRNError.h"

#include <atomic>
#include <condition_variable>
#include <cstdint>
#include <filesystem>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <thread>
#include <unordered_map>
#include <vector>

namespace quarn {

class Notifications;
class QRNDaemonContext;
class QRNFileManager;
class QRNGlobalConfiguration;
class QRNUserIdentityCache;
class QRNWhitelist;

class QRNContainerCache {
public:
    using MetadataPtr = std::shared_ptr<const QRNMetadata>;
    // Runs just before a class directory is scanned, without the cache's
    // lock; test facilities use it to hold a rebuild at that point.
    using RebuildGate = std::function<void(std::uint64_t containerClass)>;

    // With the context's shared user identity cache.
    explicit QRNContainerCache(QRNDaemonContext& context);
    QRNContainerCache(QRNDaemonContext& context,
                      std::shared_ptr<QRNUserIdentityCache> userIdentityCache);
    ~QRNContainerCache();
    QRNContainerCache(const QRNContainerCache&) = delete;
    QRNContainerCache& operator=(const QRNContainerCache&) = delete;

    // The current daemon context's instance.
    static QRNContainerCache& sharedInstance();

    // "[<user identifier>]-<short name>" for per-user classes, the short name
    // alone for global ones (one entry shared by every user).
    static std::string cacheKey(const QRNUserIdentity& userIdentity, std::uint64_t containerClass);

    // The container with the identity's identifier in its user's and class's
    // entry; for a concrete identity also its UUID. Not found: code 21.
    // `updateSandbox` makes sure every permanent container of the entry is
    // in the kernel sandbox mapping; `allowKernelLookup` lets a lookup whose
    // entry is not built yet be answered from that mapping.
    Result<MetadataPtr> containerForContainerIdentity(const QRNContainerIdentityPtr& identity,
                                                      bool transient = false,
                                                      bool updateSandbox = false,
                                                      bool allowKernelLookup = false);

    // Builds the identity's entry if it is not built yet and the lookup
    // would not be answered from the kernel's mapping; waits for a build
    // under way. Lets a caller scan before taking locks others wait for.
    Status prepareEntryForContainerIdentity(const QRNContainerIdentityPtr& identity, bool transient,
                                            bool allowKernelLookup);

    Result<std::vector<MetadataPtr>>
    allContainersForUserIdentity(const QRNUserIdentityPtr& userIdentity, std::uint64_t contentClass,
                                 bool transient, bool populateSandboxCache = false);

    // Inserts the record (replacing one with the same identifier) as living
    // at `url`; with `updateSandbox` a permanent container is also mapped.
    Status addContainerMetadata(const MetadataPtr& metadata, const std::filesystem::path& url,
                                bool transient, bool updateSandbox);
    // Drops the record and, for a permanent container, its sandbox mapping.
    // An identifier the cache does not hold is no error.
    Status removeContainerForUserIdentity(const QRNUserIdentityPtr& userIdentity,
                                          std::uint64_t contentClass, const std::string& identifier,
                                          bool transient);

    // Whether a class directory's item may be a container of the class: a
    // UUID name, or in the system classes a well-known container's name.
    bool containerURL(const std::filesystem::path& url,
                      std::uint64_t isValidForContainerClass) const;

    // Pushes one mapping; 0 or the sandbox's errno. Bundle classes are not
    // mapped and answer 0.
    int setSandboxContainerMappingForUserIdentity(const QRNUserIdentityPtr& userIdentity,
                                                  const std::string& identifier,
                                                  std::uint64_t containerClass,
                                                  const std::filesystem::path& url);
    bool shouldRegisterSandboxMappingWithUserIdentity(const QRNUserIdentityPtr& userIdentity,
                                                      const std::string& identifier,
                                                      std::uint64_t containerClass) const;

    // Forgets every entry keyed for the user (and so every global entry),
    // removing their sandbox mappings, then posts the user-invalidated
    // notification. Must not be called with the cache's lock held.
    void invalidateUserIdentity(const QRNUserIdentityPtr& userIdentity);
    // The user identity cache's observer callback: invalidates.
    void userIdentityCache(QRNUserIdentityCache& cache,
                           const QRNUserIdentityPtr& didInvalidateUserIdentity);

    void setRebuildGate(RebuildGate gate);

private:
    // A mapping to push or remove.
    struct SandboxMapping {
        std::uint32_t uid = 0;
        SandboxItem item;
    };
    // One container of an entry: its record and, once its mapping is pushed,
    // the record and owner it was pushed with, so exactly that mapping can be
    // removed again (the record is shared, not copied).
    struct Slot {
        MetadataPtr record;
        MetadataPtr pushed;
        std::uint32_t pushedUID = 0;
        std::int32_t pushedPersona = 0;
    };
    struct Entry {
        // By identifier; each key views its slot's record's identifier, so a
        // record is replaced together with its key (storeRecord).
        std::map<std::string_view, Slot, std::less<>> containers;
        bool sandboxPopulated = false;
    };
    using EntryMap = std::unordered_map<std::string, Entry>;
    // An entry's build under way. Other requests for the entry wait until
    // `done` and then use the published entry, or fail with `failure`.
    struct Build {
        bool done = false;
        // Set when the user was invalidated during the scan: the scan may
        // predate the invalidation and is redone before publishing.
        bool stale = false;
        std::optional<Error> failure;
    };
    class Observer;
    class BuildRecord;

    // Holds the lock for a scope and records the owner for the `_lock_`
    // assertions.
    class Locker {
    public:
        explicit Locker(QRNContainerCache& cache) : cache_(cache) { cache_.lock(); }
        ~Locker() { cache_.unlock(); }
        Locker(const Locker&) = delete;
        Locker& operator=(const Locker&) = delete;
        // For condition waits and for leaving the lock during a scan.
        void lock() { cache_.lock(); }
        void unlock() { cache_.unlock(); }

    private:
        QRNContainerCache& cache_;
    };

    void lock();
    void unlock();
    void _lock_assertOwned(const char* function) const;
    void assertNotOwned(const char* function) const;
    static const char* transientSuffix(bool transient) { return transient ? "(transient)" : ""; }

    // --- Entries (QRNContainerCache.cpp) ---
    // The entry, built first if need be; waits for a build of it that is
    // under way (leaving the lock meanwhile).
    Result<Entry*> _lock_entryFor(Locker& locked, const QRNUserIdentityPtr& userIdentity,
                                  std::uint64_t cls, bool transient, bool populateSandbox);
    // Waits until no build of the entry is under way; the last one waited
    // for, if any.
    std::shared_ptr<Build> _lock_awaitBuild(Locker& locked, const std::string& key, bool transient);
    MetadataPtr _lock_find(const Entry& entry, const QRNContainerIdentity& identity) const;
    // Inserts or replaces the identifier's record; the slot of the record.
    static Slot& storeRecord(Entry& entry, MetadataPtr record);
    // False only for a concrete identity whose UUID is not the record's.
    static bool uuidMatches(const QRNContainerIdentity& identity, const QRNMetadata& metadata);

    // --- Building (+Build) ---
    // Scans with the lock left, then publishes the entry (mapping it into
    // the sandbox if asked) under the lock.
    Result<Entry*> _lock_rebuild(Locker& locked, const QRNUserIdentityPtr& userIdentity,
                                 std::uint64_t cls, bool transient, bool populateSandbox);
    // Runs the gate and scans; takes no lock of the cache's.
    Result<Entry> buildEntry(const QRNUserIdentityPtr& userIdentity, std::uint64_t cls,
                             bool transient);
    Result<Entry> scanClassDirectory(const QRNUserIdentityPtr& userIdentity, std::uint64_t cls,
                                     bool transient);
    void runRebuildGate(std::uint64_t cls);
    // Builds are keyed apart for permanent and transient entries.
    static std::string buildKey(const std::string& key, bool transient) {
        return key + transientSuffix(transient);
    }
    // containerURL for an item's last component.
    bool containerName(std::string_view name, std::uint64_t cls) const;

    // --- Sandbox (+Sandbox) ---
    // The mapping for a container of the class; none for classes that are
    // not mapped.
    static std::optional<SandboxMapping> sandboxMappingFor(const QRNUserIdentity& userIdentity,
                                                           const std::string& identifier,
                                                           std::uint64_t cls,
                                                           const std::string& url);
    static std::uint64_t sandboxItemTypeForClass(std::uint64_t cls);
    int pushSandboxMapping(const SandboxMapping& mapping);
    int pullSandboxMapping(const SandboxMapping& mapping);
    // The mapping a slot's push made.
    static SandboxMapping pushedMapping(const Slot& slot);
    // Pushes the mapping of the slot's record and remembers it in the slot;
    // 0 or the sandbox's errno.
    int _lock_mapContainer(Slot& slot, const QRNUserIdentity& userIdentity);
    void _lock_populateSandbox(Entry& entry, const QRNUserIdentity& userIdentity);
    // Removes the mapping of a slot taken out of its entry, or of a
    // container the entry does not hold (`slot` null).
    void _lock_unmapContainer(const Slot* slot, const QRNUserIdentity& userIdentity,
                              std::uint64_t cls, const std::string& identifier);
    MetadataPtr _lock_containerFromKernelSandbox(const QRNContainerIdentity& identity);
    std::optional<SandboxItem> findKernelSandboxItem(std::uint32_t uid,
                                                     const SandboxMapping& wanted) const;

    std::shared_ptr<QRNUserIdentityCache> userIdentityCache_;
    std::shared_ptr<QRNGlobalConfiguration> configuration_;
    std::shared_ptr<QRNFileManager> fileManager_;
    std::shared_ptr<QRNWhitelist> whitelist_;
    std::shared_ptr<SandboxKernel> sandbox_;
    std::shared_ptr<Notifications> notifications_;
    std::shared_ptr<Observer> observer_; // registered (weakly) with the user identity cache

    // Guards permanent_, transient_ and builds_; owned by this cache. Never
    // held while a class directory is scanned.
    std::mutex mutex_;
    std::atomic<std::thread::id> owner_;
    EntryMap permanent_;
    EntryMap transient_;
    // Builds under way, by buildKey; a request that finds one waits on
    // buildDone_ instead of scanning again.
    std::unordered_map<std::string, std::shared_ptr<Build>> builds_;
    std::condition_variable_any buildDone_;

    // Guards gate_ only; never taken around mutex_.
    std::mutex gateMutex_;
    RebuildGate gate_;
};

} // namespace quarn
