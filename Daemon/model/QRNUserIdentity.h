#pragma once
// On whose behalf a container exists: a POSIX user and group, the user's home
// directory and the persona the container belongs to. Immutable; shared as
// std::shared_ptr<const QRNUserIdentity>. Equality and hash use `identifier`
// only.

#include "Daemon/support/QRNError.h"
#include "Daemon/support/Value.h"

#include <cstdint>
#include <filesystem>
#include <memory>
#include <optional>
#include <string>

namespace quarn {

class QRNUserIdentity;
class QRNUserIdentityCache;
using QRNUserIdentityPtr = std::shared_ptr<const QRNUserIdentity>;

enum QRNPersonaType : std::int32_t {
    kQRNPersonaTypePersonal = 0,
    kQRNPersonaTypeEnterprise = 1,
    kQRNPersonaTypeUnspecific = 2,
};

class QRNUserIdentity {
public:
    // Uids below this belong to roles (root, daemons) and never get an identity.
    static constexpr std::uint32_t kMinimumUserUID = 501;
    // The uid, gid and kernel persona ID of the legacy "mobile" user.
    static constexpr std::uint32_t kLegacyMobileUID = 501;

    // nullptr (and a log line) for a uid below 501.
    static QRNUserIdentityPtr initWithUID(std::uint32_t uid, std::uint32_t gid,
                                          std::filesystem::path homeDirectoryURL,
                                          std::optional<std::string> personaUniqueString,
                                          std::int32_t personaType, std::uint32_t kernelPersonaID);
    // The default identity: 501/501, the home of uid 501, personal, kernel
    // persona ID 501.
    static QRNUserIdentityPtr init();

    // Reads the persisted form. A dictionary that names no readable version,
    // or a persona the cache does not know, gives nullptr without a code;
    // malformed entries give kQRNErrorInvalidUserIdentityPlist.
    static CodeResult<QRNUserIdentityPtr> userIdentityWithPlist(const Value& plist,
                                                                QRNUserIdentityCache& cache);

    // Owner of a container of the class: the installation uid for bundle
    // classes, the system-container uid for system classes (for the gid
    // too), else this identity's own uid / gid.
    std::uint32_t posixUIDForContainerClass(std::uint64_t containerClass) const;
    std::uint32_t posixGIDForContainerClass(std::uint64_t containerClass) const;
    static bool isUserIdentityRequiredForContainerClass(std::uint64_t containerClass);

    const std::filesystem::path& homeDirectoryURL() const { return homeDirectoryURL_; }
    std::uint32_t kernelPersonaID() const { return kernelPersonaID_; }
    std::uint32_t posixUID() const { return posixUID_; }
    std::uint32_t posixGID() const { return posixGID_; }
    std::int32_t personaType() const { return personaType_; }
    const std::optional<std::string>& personaUniqueString() const { return personaUniqueString_; }
    const std::string& identifier() const { return identifier_; }

    bool isEnterprise() const { return personaType_ == kQRNPersonaTypeEnterprise; }
    bool isNoSpecificPersona() const { return personaType_ == kQRNPersonaTypeUnspecific; }
    bool isHomeDirectoryInCommonSandbox() const {
        return personaType_ == kQRNPersonaTypePersonal || personaType_ == kQRNPersonaTypeUnspecific;
    }
    // "personal", "enterprise", "unspecific" or "unknown".
    static const char* personaTypeDescription(std::int32_t personaType);

    // Exactly "posixUID", "posixGID", "type" and "version" = "2". The persona
    // string is deliberately left out.
    Value plist() const;

    // A copy that, like the default identity it starts from, has kernel
    // persona ID 501 whatever this identity's was.
    QRNUserIdentityPtr copy() const;

    bool isEqual(const QRNUserIdentity& other) const { return identifier_ == other.identifier_; }
    std::size_t hash() const;

    std::string description() const;
    std::string shortDescription() const;

    // For unordered containers keyed by identities.
    struct Hash {
        std::size_t operator()(const QRNUserIdentityPtr& u) const { return u ? u->hash() : 0; }
    };
    struct Equal {
        bool operator()(const QRNUserIdentityPtr& a, const QRNUserIdentityPtr& b) const {
            return a == b || (a && b && a->isEqual(*b));
        }
    };

private:
    QRNUserIdentity(std::uint32_t uid, std::uint32_t gid, std::filesystem::path home,
                    std::optional<std::string> personaUniqueString, std::int32_t personaType,
                    std::uint32_t kernelPersonaID);

    std::filesystem::path homeDirectoryURL_;
    std::uint32_t kernelPersonaID_;
    std::uint32_t posixUID_;
    std::uint32_t posixGID_;
    std::int32_t personaType_;
    std::optional<std::string> personaUniqueString_;
    std::string identifier_;
};

} // namespace quarn
