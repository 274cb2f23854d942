#pragma once
// The user identities that exist on the device, by persona and by uid/gid,
// kept consistent when the persona list changes.
//
// Personas are unsupported on this platform: every lookup falls back to the
// personal identity of the mobile user. The persona-aware paths are kept
// (and reachable through `flushAndRepopulateWithUserIdentities` and a cache
// made with persona support) because the identity format depends on them.

#include "Daemon/model/QRNUserIdentity.h"
#include "Daemon/model/QRNUserIdentityCacheObserver.h"
#include "Daemon/support/Queue.h"

#include <atomic>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <thread>
#include <vector>

namespace quarn {

class QRNDaemonContext;

class QRNUserIdentityCache {
public:
    explicit QRNUserIdentityCache(QRNDaemonContext& context);
    // `personasSupported` turns on the persona-aware lookups; the daemon
    // always uses personasAreSupported().
    QRNUserIdentityCache(QRNDaemonContext& context, bool personasSupported);
    QRNUserIdentityCache(const QRNUserIdentityCache&) = delete;
    QRNUserIdentityCache& operator=(const QRNUserIdentityCache&) = delete;

    static bool personasAreSupported() { return false; }

    // The current mobile user's personal identity (kernel persona ID = uid),
    // built once. Falls back to the legacy mobile user when there is no
    // mobile account, since role uids never get an identity.
    QRNUserIdentityPtr defaultUserIdentity();
    // 501/501, built once, whoever the current mobile user is.
    QRNUserIdentityPtr userIdentityForLegacyMobileUser();

    // A uid below 501 is answered for the current mobile user instead.
    QRNUserIdentityPtr userIdentityForPersonalPersonaWithUID(std::uint32_t uid, std::uint32_t gid);
    QRNUserIdentityPtr userIdentityForPersonaUniqueString(std::optional<std::string> persona,
                                                          std::uint32_t uid, std::uint32_t gid);
    QRNUserIdentityPtr userIdentityForCurrentContext();
    QRNUserIdentityPtr userIdentityForCurrentContextWithUID(std::uint32_t uid, std::uint32_t gid);

    QRNUserIdentityPtr userIdentityWithPersonaID(std::uint32_t kernelPersonaID);
    QRNUserIdentityPtr userIdentityForPersonalPersona();
    QRNUserIdentityPtr unspecificUserIdentity();
    std::vector<QRNUserIdentityPtr> userIdentitiesForBundleIdentifier(const std::string& bundleID);
    bool isBundleIdentifier(const std::string& bundleID,
                            const QRNUserIdentityPtr& associatedWithUserIdentity);

    void forEachAccessibleUserIdentitySynchronouslyExecuteBlock(
        const std::function<void(const QRNUserIdentityPtr&)>& block);

    // Observers are held weakly.
    void addObserver(const std::shared_ptr<QRNUserIdentityCacheObserver>& observer);
    void removeObserver(const std::shared_ptr<QRNUserIdentityCacheObserver>& observer);

    // Drops every persona; observers hear of each enterprise identity
    // dropped, on the calling thread.
    void flush();
    void flushAndRepopulateWithUserIdentities(const std::vector<QRNUserIdentityPtr>& identities);
    // The persona list changed: flush in the background.
    void personaListDidUpdate();

private:
    using IdentityMap = std::map<std::string, QRNUserIdentityPtr>;
    using PersonaIDMap = std::map<std::uint32_t, QRNUserIdentityPtr>;
    // Holds the lock for a scope and records the owner for the `_lock_`
    // assertions.
    class Locker {
    public:
        explicit Locker(QRNUserIdentityCache& cache) : cache_(cache) { cache_.lock(); }
        ~Locker() { cache_.unlock(); }
        Locker(const Locker&) = delete;
        Locker& operator=(const Locker&) = delete;

    private:
        QRNUserIdentityCache& cache_;
    };

    void lock();
    void unlock();
    void _lock_assertOwned() const;
    void _lock_resyncIfInvalid();
    void _lock_resync();
    QRNUserIdentityPtr _updateUserIdentity(const QRNUserIdentityPtr& identity, std::uint32_t uid,
                                           std::uint32_t gid);
    // Replaces role uids with the current mobile user's ids.
    void substituteRoleUID(std::uint32_t& uid, std::uint32_t& gid);
    void notifyObservers(const std::vector<QRNUserIdentityPtr>& dropped);

    QRNDaemonContext& context_;
    const bool personasSupported_;

    std::once_flag defaultOnce_;
    QRNUserIdentityPtr default_; // written once under defaultOnce_
    std::once_flag legacyOnce_;
    QRNUserIdentityPtr legacy_; // written once under legacyOnce_

    // Guards everything below up to the observers; owned by this cache.
    std::mutex mutex_;
    std::atomic<std::thread::id> owner_;
    IdentityMap byPersonaString_;
    PersonaIDMap byKernelPersonaID_;
    std::map<std::string, std::vector<QRNUserIdentityPtr>> enterpriseByBundleID_;
    QRNUserIdentityPtr personal_;
    QRNUserIdentityPtr unspecific_;
    bool cacheInvalid_ = true;

    // Guards observers_ only; never held together with mutex_.
    std::mutex observersMutex_;
    std::vector<std::weak_ptr<QRNUserIdentityCacheObserver>> observers_;

    // Runs the flushes that persona list updates ask for. Last member: it is
    // destroyed (and drained) before the state its blocks use.
    Queue flushQueue_;
};

} // namespace quarn
