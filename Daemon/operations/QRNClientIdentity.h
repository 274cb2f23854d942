#pragma once
// Who sent a request: the calling process's code-signing identifier, POSIX
// ids, user identity, entitlements, sandbox state and audit token. Immutable;
// shared as std::shared_ptr<const QRNClientIdentity>. The daemon's own boot
// and upcall work uses privileged identities made without a connection.

#include "Daemon/model/QRNUserIdentity.h"
#include "Daemon/platform/CodeSigningRegistry.h"
#include "Daemon/support/QRNError.h"
#include "Daemon/support/Value.h"

#include <sys/types.h>

#include <array>
#include <cstdint>
#include <memory>
#include <string>
#include <string_view>

namespace quarn {

class IpcConnection;
class QRNClientIdentity;
using QRNClientIdentityPtr = std::shared_ptr<const QRNClientIdentity>;

class QRNClientIdentity {
public:
    using AuditToken = std::array<std::uint8_t, 32>;

    // The bundle identifier of the daemon's own privileged identities.
    static constexpr std::string_view kPrivilegedBundleIdentifier = "com.orvex.quarnd.internal";

    // Logs "You cannot init this class directly." and answers nullptr.
    static QRNClientIdentityPtr init();

    // A non-dictionary `entitlements` is taken as an empty dictionary; a
    // missing user identity gives nullptr.
    static QRNClientIdentityPtr
    initWithBundleIdentifier(std::string bundleIdentifier, std::uint32_t uid, std::uint32_t gid,
                             std::int32_t pid, QRNUserIdentityPtr userIdentity, Value entitlements,
                             bool sandboxed, const AuditToken& auditToken, bool kernel);

    // uid, gid and pid 0, no entitlements, not sandboxed, zero audit token.
    static QRNClientIdentityPtr
    privilegedClientIdentityWithUserIdentity(QRNUserIdentityPtr userIdentity, bool kernel);
    // The privileged identity of the default user identity, not the kernel.
    static QRNClientIdentityPtr anonymousPrivilegedClientIdentity();

    // The identity of the process on the other end of `connection`, from its
    // credentials and its code-signing registry entry; nullptr when it has
    // no code-signing identifier or no user identity. The installer service
    // gets the same object back for as long as its audit token is the same.
    static QRNClientIdentityPtr clientIdentityWithVellConnection(const IpcConnection& connection);
    // The same for a process known by its peer description (the writer of
    // a message may be another process than the one that connected).
    static QRNClientIdentityPtr clientIdentityWithPeer(const IpcPeer& peer);
    // The code-signing identifier of the process behind `auditToken`.
    static Result<std::string> _bundleIdentifierFromAuditToken(const AuditToken& auditToken);

    const std::string& bundleIdentifier() const { return bundleIdentifier_; }
    std::uint32_t posixUID() const { return posixUID_; }
    std::uint32_t posixGID() const { return posixGID_; }
    std::int32_t posixPID() const { return posixPID_; }
    const QRNUserIdentityPtr& userIdentity() const { return userIdentity_; }
    const Value& entitlements() const { return entitlements_; }
    bool isSandboxed() const { return sandboxed_; }
    const AuditToken& auditToken() const { return auditToken_; }
    bool isKernel() const { return kernel_; }

    // The entitlement's value when it is a number, read as a boolean; false
    // when absent or of any other type.
    bool boolValueOfEntitlement(std::string_view name) const;
    std::uint32_t posixUIDForContainerClass(std::uint64_t containerClass) const;
    std::uint32_t posixGIDForContainerClass(std::uint64_t containerClass) const;

    std::string description() const;

private:
    static Result<CodeSigningInfo> _codeSigningInfoFromAuditToken(const AuditToken& auditToken);

    QRNClientIdentity(std::string bundleIdentifier, std::uint32_t uid, std::uint32_t gid,
                      std::int32_t pid, QRNUserIdentityPtr userIdentity, Value entitlements,
                      bool sandboxed, const AuditToken& auditToken, bool kernel);

    std::string bundleIdentifier_;
    std::uint32_t posixUID_;
    std::uint32_t posixGID_;
    std::int32_t posixPID_;
    QRNUserIdentityPtr userIdentity_;
    Value entitlements_;
    bool sandboxed_;
    AuditToken auditToken_;
    bool kernel_;
};

} // namespace quarn
