#pragma once
// One object per request that carries the client's rights and performs the
// container operations on its behalf; one shared, privileged instance does
// the daemon's own boot and upcall work.
//
// The operations are spread over files by concern:
// QRNClientConnection.cpp (construction, rights), +Lookup (the lookup
// entitlement), +Create (create or look up a container), +Staging (building
// a new container in staging), +Info (info values, metadata, listing and
// deletion of existing containers), +DeathRow (death row, new directory
// UUIDs), +Complete (running the request's queued commands), +Personas
// (the persona of a looked-up container), +Groups (group containers of an
// owner), +Usage (disk usage), +Boot (boot setup, restored system
// containers), +Cleanup (boot cleanup passes).

#include "Daemon/fs/QRNFileManager.h"
#include "Daemon/model/QRNContainerIdentity.h"
#include "Daemon/model/QRNUserIdentity.h"
#include "Daemon/operations/QRNClientIdentity.h"
#include "Daemon/support/QRNError.h"
#include "Daemon/support/Value.h"

#include <sys/types.h>

#include <atomic>
#include <cstdint>
#include <filesystem>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <set>
#include <string>
#include <string_view>
#include <vector>

namespace quarn {

class EnvFd;
class QRNCommandQueue;
class QRNDaemonContext;
class QRNMetadata;
class Queue;
using QRNMetadataPtr = std::shared_ptr<const QRNMetadata>;

class QRNClientConnection {
public:
    using IdentifierSet = std::set<std::string, std::less<>>;
    using IdentifierSetPtr = std::shared_ptr<const IdentifierSet>;

    // The rights the request layer settled for this client. `lookup` is the
    // dictionary of the lookup entitlement (or none); `entitledWipeIdentifiers`
    // the identifiers whose data containers the client may wipe (or none).
    QRNClientConnection(QRNClientIdentityPtr clientIdentity, bool entitled, bool allowOtherIdLookup,
                        bool unrestricted, std::optional<Value> lookup,
                        std::optional<std::vector<std::string>> entitledWipeIdentifiers,
                        std::shared_ptr<QRNCommandQueue> commandQueue);
    // The context's privileged connection (anonymous privileged identity,
    // every right, its own command queue).
    explicit QRNClientConnection(QRNDaemonContext& context);
    ~QRNClientConnection();
    QRNClientConnection(const QRNClientConnection&) = delete;
    QRNClientConnection& operator=(const QRNClientConnection&) = delete;

    // The current daemon context's privileged connection.
    static QRNClientConnection& sharedClientConnection();
    // A privileged connection acting for one user identity.
    static std::shared_ptr<QRNClientConnection>
    privilegedClientConnectionWithUserIdentity(QRNUserIdentityPtr userIdentity);

    // --- Rights -----------------------------------------------------------

    const QRNClientIdentityPtr& clientIdentity() const { return clientIdentity_; }
    // The client's bundle identifier; empty without a client identity.
    const std::string& clientBundleIdentifier() const;
    QRNUserIdentityPtr userIdentity() const;
    bool entitled() const { return entitled_; }
    bool allowOtherIdLookup() const { return allowOtherIdLookup_; }
    bool allowGroupIdLookup() const { return allowGroupIdLookup_; }
    bool unrestricted() const { return unrestricted_; }
    const std::optional<Value>& lookup() const { return lookup_; }
    const std::optional<std::vector<std::string>>& entitledWipeIdentifiers() const {
        return entitledWipeIdentifiers_;
    }
    const std::shared_ptr<QRNCommandQueue>& commandQueue() const { return commandQueue_; }

    void setAllowOtherIdLookup(bool allow) { allowOtherIdLookup_ = allow; }
    void setAllowGroupIdLookup(bool allow) { allowGroupIdLookup_ = allow; }
    void setUnrestricted(bool unrestricted) { unrestricted_ = unrestricted; }

    // Whether the lookup entitlement lists `identifier` for the class.
    bool isEntitledForLookupWithClass(std::uint64_t containerClass, std::string_view identifier);
    // The identifiers the lookup entitlement grants for the class, made on
    // first use per class; none for an invalid class or without entitlement.
    IdentifierSetPtr _lookupForContainerClass(std::uint64_t containerClass);
    // The string members of an array; anything else gives an empty set.
    static IdentifierSet _setOfStringsFromArray(const Value& array);

    // --- Create or look up ------------------------------------------------

    // The container's metadata, created on disk when asked and absent.
    // `existed` (when given) tells whether it was found rather than made now.
    CodeResult<QRNMetadataPtr>
    createOrLookupContainerWithContainerIdentity(const QRNContainerIdentityPtr& identity,
                                                 bool createIfNecessary, bool transient,
                                                 bool useLocking, bool* existed = nullptr);

    // Answers the new directory open, for building the container below it.
    Result<EnvFd> _createTopLevelContainerDirectory(const std::filesystem::path& url,
                                                    std::uint64_t containerClass, uid_t owner);
    CodeResult<void> _createSubDirectories(const std::filesystem::path& containerURL,
                                           const QRNMetadata& metadata);
    // The same in the container directory already open as `container`.
    CodeResult<void> _createSubDirectories(const EnvFd& container,
                                           const std::filesystem::path& containerURL,
                                           const QRNMetadata& metadata);
    std::int32_t _dataProtectionClassForContainerMetadata(const QRNMetadata& metadata);

    // --- Reading and touching one container; listing --------------------

    // Every container of the class for the client's user identity.
    CodeResult<std::vector<QRNMetadataPtr>> containersWithClass(std::uint64_t containerClass,
                                                                bool transient);
    // `key` must be a string; a none `value` removes the key. The metadata
    // file is rewritten and the cache updated.
    CodeResult<void> setInfoValue(const Value& value, const Value* key,
                                  const QRNContainerIdentityPtr& containerIdentity,
                                  bool useLocking);
    CodeResult<Value> infoValueForKey(const Value* key,
                                      const QRNContainerIdentityPtr& containerIdentity,
                                      bool useLocking);
    CodeResult<QRNMetadataPtr>
    metadataWithContainerIdentity(const QRNContainerIdentityPtr& containerIdentity);
    // Makes missing subdirectories again; system containers get their ACLs back.
    CodeResult<void>
    recreateDefaultStructureWithContainerIdentity(const QRNContainerIdentityPtr& containerIdentity);
    // Queues a staged delete of the container; it goes when the request completes.
    CodeResult<void>
    deleteContainerWithContainerIdentity(const QRNContainerIdentityPtr& containerIdentity,
                                         bool transient);

    // --- Death row and directory UUIDs ------------------------------------

    // Moves the item into its own unique directory on death row; a missing
    // item is success and starts nothing.
    Status _moveItemAtURLToDeathRow(const std::filesystem::path& url, bool isDir,
                                    bool startDeletionThread);
    // The same for `name` of the open `directory` (whose path is
    // `directoryURL`): the entry moved is the one in that directory, whatever
    // has become of its path since it was opened.
    Status _moveItemInDirectoryToDeathRow(const EnvFd& directory,
                                          const std::filesystem::path& directoryURL,
                                          const std::string& name, bool isDir,
                                          bool startDeletionThread);
    // Destroys everything on death row in the background; the completion
    // (may be empty) hears the pass's error.
    void
    deleteContainersOnDeathRowWithCompletion(std::function<void(std::optional<Error>)> completion);
    Status _removeItemOrMoveToTempAtURL(const std::filesystem::path& url);
    CodeResult<void>
    regenerateDirectoryUUIDWithContainerIdentity(const QRNContainerIdentityPtr& identity);
    void _regenerateAllSystemContainerPaths();

    // Runs the commands queued during the request; may overwrite `error`.
    bool completeWithError(std::uint64_t& error);

    // --- Personas, group containers, disk usage ---------------------------
    // (+Personas, +Groups, +Usage)

    // The user identity in which a container of the identifier lives: for a
    // client without a specific persona and a data class, the one persona
    // that holds the bundle (or its parent for plug-in and VPN data);
    // otherwise, and whenever that choice is not clear, the client's own.
    // Code 76 only without a client identity.
    CodeResult<QRNUserIdentityPtr> userIdentityForContainerIdentifier(const std::string& identifier,
                                                                      std::uint64_t containerClass);
    // The same choice for the owner of group containers, except that finding
    // no persona for the owner fails with 76.
    CodeResult<QRNUserIdentityPtr> userIdentityForGroupOwner(const std::string& owner);

    using GroupContainers = std::map<std::string, QRNMetadataPtr, std::less<>>;
    // The owner's group containers of the class (7 or 13) by group
    // identifier, made when missing. Grants group lookups for the rest of the
    // request. A group that cannot be made is logged and left out.
    CodeResult<GroupContainers>
    groupContainersForOwnerIdentifier(const std::string& owner, QRNUserIdentityPtr userIdentity,
                                      std::uint64_t groupContainerClass);
    // The group manager's answer, under the owner's identifier lock when asked.
    CodeResult<std::vector<std::string>>
    groupContainerIdentifiersForOwnerIdentifier(const std::string& owner,
                                                std::uint64_t groupContainerClass, bool useLocking);
    // Bytes the container takes on disk.
    CodeResult<std::uint64_t>
    diskUsageWithContainerIdentity(const QRNContainerIdentityPtr& containerIdentity);

    // Process-wide serial queues: moves into death row, the deletion pass,
    // other background work.
    static std::shared_ptr<Queue> _sharedDeathrowQueue();
    static std::shared_ptr<Queue> _sharedDeathrowBackgroundQueue();
    static std::shared_ptr<Queue> _sharedBackgroundQueue();

    // --- Boot setup and cleanup (+Boot, +Cleanup) -------------------------

    // Every start, before requests are served.
    void quarnManagerSetup();
    // The first start after the first-boot marker went missing, before
    // quarnManagerSetup.
    void rebootQuarnManagerSetup();
    // Background passes over staging, transient and orphaned data; each
    // returns at once and calls its completion once, after all its steps.
    void quarnManagerCleanupWithCompletion(std::function<void()> completion);
    void rebootQuarnManagerCleanupWithCompletion(std::function<void()> completion);
    // Sends the entries of a class directory that are no containers of the
    // class (a bad name, no metadata file) to death row.
    // Entries are moved from the listed directory's descriptor.
    void _cleanupOrphanedDataForDirectories(const QRNFileManager::Listing& listing,
                                            std::uint64_t containerClass);
    void _cleanupOprhanedCodeSigningMappingData();
    // Merges one restored system container (class 12 or 13, named by its
    // identifier) into the live container of that identifier.
    CodeResult<void> _moveSystemContainerIntoPlace(const std::filesystem::path& url,
                                                   std::uint64_t containerClass);
    // Keeps a restored item that could not be merged for inspection.
    void _moveFailedPathAside(const std::filesystem::path& url);

private:
    struct CreateAttempt;

    CodeResult<QRNMetadataPtr> _createOrLookup(const QRNContainerIdentityPtr& identity,
                                               bool createIfNecessary, bool transient,
                                               bool useLocking, CreateAttempt& attempt,
                                               bool& existed);
    CodeResult<void> _checkAccess(const QRNContainerIdentity& identity);
    CodeResult<void> _checkSystemContainerAccess(const QRNContainerIdentity& identity);
    CodeResult<QRNMetadataPtr> _lookupUnderReadLock(const QRNContainerIdentityPtr& identity,
                                                    bool useLocking);
    CodeResult<QRNMetadataPtr> _lookupUnderWriteLock(const QRNContainerIdentityPtr& identity,
                                                     bool transient);
    CodeResult<QRNMetadataPtr> _createContainer(const QRNContainerIdentity& identity,
                                                bool transient, CreateAttempt& attempt);
    // Sets `stagingURL` once the staging directory exists.
    CodeResult<QRNMetadataPtr> _buildInStaging(const QRNContainerIdentity& identity,
                                               const UUID& uuid,
                                               std::optional<std::filesystem::path>& stagingURL);
    std::optional<std::filesystem::path> _liveURL(const QRNContainerIdentity& identity,
                                                  bool transient, const std::string& uuidString);
    void _cleanUpStaging(CreateAttempt& attempt, CodeResult<QRNMetadataPtr>& result);
    // The cached container of a permanent identity, or code 21 with `message`.
    CodeResult<QRNMetadataPtr> _cachedContainer(const QRNContainerIdentityPtr& identity,
                                                std::string_view message);

    const QRNClientIdentityPtr clientIdentity_;
    const bool entitled_;
    // Rights a request may widen while it runs; atomics, since handlers may
    // read them from the command queue's thread.
    std::atomic<bool> allowOtherIdLookup_;
    std::atomic<bool> allowGroupIdLookup_{false};
    std::atomic<bool> unrestricted_;
    const std::optional<Value> lookup_;
    const std::optional<std::vector<std::string>> entitledWipeIdentifiers_;
    const std::shared_ptr<QRNCommandQueue> commandQueue_;
    // References to the process-wide queues, kept for the connection's life.
    std::shared_ptr<Queue> deathrowQueue_;
    std::shared_ptr<Queue> deathrowBackgroundQueue_;
    std::shared_ptr<Queue> backgroundQueue_;

    // Guards lookupCache_ only.
    std::mutex lookupCacheMutex_;
    // Class short name -> identifiers of the lookup entitlement.
    std::map<std::string, IdentifierSetPtr, std::less<>> lookupCache_;
};

} // namespace quarn
