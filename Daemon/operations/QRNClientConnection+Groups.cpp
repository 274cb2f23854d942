// The group containers of an owner: which group identifiers its entitlements
// name, and those groups' containers, made when missing.

#include "Daemon/operations/QRNClientConnection.h"

#include "Daemon/codesigning/QRNGroupManager.h"
#include "Daemon/model/QRNMetadata.h"
#include "Daemon/model/QRNWhitelist.h"
#include "Daemon/operations/QRNGlobalIdentifierLock.h"
#include "Daemon/operations/QRNOperationGuard.h"
#include "Daemon/support/Log.h"

namespace quarn {

namespace {

// An identifier's read lock for one scope.
class OwnerLockHold {
public:
    explicit OwnerLockHold(const std::string& owner) : owner_(owner) {
        read_lock_identifier(owner_);
    }
    ~OwnerLockHold() { unlock_identifier(owner_); }
    OwnerLockHold(const OwnerLockHold&) = delete;
    OwnerLockHold& operator=(const OwnerLockHold&) = delete;

private:
    Value owner_;
};

} // namespace

CodeResult<std::vector<std::string>>
QRNClientConnection::groupContainerIdentifiersForOwnerIdentifier(const std::string& owner,
                                                                 std::uint64_t groupContainerClass,
                                                                 bool useLocking) {
    // The group manager sits below the lock module, so the lock it would
    // take for the owner is taken here, around its answer.
    std::optional<OwnerLockHold> lock;
    if (useLocking && !owner.empty()) {
        lock.emplace(owner);
    }
    return QRNGroupManager::defaultManager().groupContainerIdentifiersForOwnerIdentifier(
        owner, groupContainerClass);
}

CodeResult<QRNClientConnection::GroupContainers>
QRNClientConnection::groupContainersForOwnerIdentifier(const std::string& owner,
                                                       QRNUserIdentityPtr userIdentity,
                                                       std::uint64_t groupContainerClass) {
    return QRNOperationGuard::run([&]() -> CodeResult<GroupContainers> {
        const bool own = !owner.empty() && owner == clientBundleIdentifier();
        if (!own && !allowOtherIdLookup() && !unrestricted() &&
            !isEntitledForLookupWithClass(groupContainerClass, owner) &&
            !QRNWhitelist::sharedWhitelist().isLookupWhitelistedFromCodeSignIdentifier(
                clientBundleIdentifier(), groupContainerClass, owner)) {
            QRN_ERROR(kQRNErrorNotEntitled,
                      "{} not entitled to retrieve group container class {} with identifier {}",
                      clientBundleIdentifier(), static_cast<std::int64_t>(groupContainerClass),
                      owner);
            return QRN_CODE(kQRNErrorNotEntitled);
        }
        // The owner's groups are the client's to reach for this request.
        setAllowGroupIdLookup(true);
        // The lookups below take no lock of their own: without this one, two
        // requests reaching the same new group would each create it.
        QRNGlobalIdentifierLock globalLock(QRNGlobalIdentifierLock::Mode::Write);
        auto groups =
            groupContainerIdentifiersForOwnerIdentifier(owner, groupContainerClass, false);
        if (!groups) {
            return QRN_CODE(groups.error());
        }
        GroupContainers containers;
        for (const std::string& group : *groups) {
            auto identity = QRNContainerIdentity::containerIdentityWithUserIdentity(
                userIdentity, group, groupContainerClass);
            auto found = identity ? createOrLookupContainerWithContainerIdentity(*identity, true,
                                                                                 false, false)
                                  : CodeResult<QRNMetadataPtr>(QRN_CODE(identity.error()));
            if (!found) {
                // One group that cannot be made must not hide the others.
                QRN_LOG_ERROR(LogCategory::Vell,
                              "Failed to create or lookup group container: {} : {}", group,
                              found.error());
                continue;
            }
            containers.emplace(group, *found);
        }
        return containers;
    });
}

} // namespace quarn
