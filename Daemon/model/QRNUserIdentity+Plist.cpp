// Reading the persisted form of a user identity (metadata files, replace
// records). The identity itself always comes from the cache, so that a
// stored identity maps onto one the device knows.

#include "Daemon/model/QRNUserIdentity.h"
#include "Daemon/model/QRNUserIdentityCache.h"

#include <limits>
#include <utility>

namespace quarn {

namespace {

// The name of what was found under a key, for the log: "nil" when absent.
const char* kindOf(const Value* v) {
    return v ? v->kindName() : "nil";
}

// A 32-bit unsigned number under `key`, or code 75 with the message.
CodeResult<std::uint32_t> readNumber(const Value& plist, std::string_view key) {
    const Value* v = plist.get(key);
    auto number = v ? v->asUInt64() : std::nullopt;
    if (!number || *number > std::numeric_limits<std::uint32_t>::max()) {
        QRN_LOG_ERROR(LogCategory::Unspecified,
                      "Invalid user identity plist data. Expected number for {}, got {}. Data: {}",
                      key, kindOf(v), plist.description());
        return QRN_CODE(kQRNErrorInvalidUserIdentityPlist);
    }
    return static_cast<std::uint32_t>(*number);
}

const std::string* optionalString(const Value& plist, std::string_view key) {
    const Value* v = plist.get(key);
    return v ? v->asString() : nullptr;
}

// "posixUID" and "posixGID", both required.
CodeResult<std::pair<std::uint32_t, std::uint32_t>> readIds(const Value& plist) {
    auto uid = readNumber(plist, "posixUID");
    if (!uid) {
        return QRN_CODE(uid.error());
    }
    auto gid = readNumber(plist, "posixGID");
    if (!gid) {
        return QRN_CODE(gid.error());
    }
    return std::pair{*uid, *gid};
}

CodeResult<QRNUserIdentityPtr> readVersion1(const Value& plist, QRNUserIdentityCache& cache) {
    auto ids = readIds(plist);
    if (!ids) {
        return QRN_CODE(ids.error());
    }
    auto [uid, gid] = *ids;
    if (const std::string* persona = optionalString(plist, "personaIdentifier")) {
        if (auto found = cache.userIdentityForPersonaUniqueString(*persona, uid, gid)) {
            return found;
        }
    }
    return cache.userIdentityForPersonalPersonaWithUID(uid, gid);
}

CodeResult<QRNUserIdentityPtr> readVersion2(const Value& plist, QRNUserIdentityCache& cache) {
    auto ids = readIds(plist);
    if (!ids) {
        return QRN_CODE(ids.error());
    }
    auto [uid, gid] = *ids;
    auto type = readNumber(plist, "type");
    if (!type) {
        return QRN_CODE(type.error());
    }
    if (*type >= 3) {
        QRN_LOG_ERROR(
            LogCategory::Unspecified,
            "Invalid user identity plist data. Expected persona type for {}, got {}. Data: {}",
            "type", *type, plist.description());
        return QRN_CODE(kQRNErrorInvalidUserIdentityPlist);
    }
    const std::string* persona = optionalString(plist, "personaUniqueString");
    if (*type != kQRNPersonaTypeEnterprise || !persona) {
        return cache.userIdentityForPersonalPersonaWithUID(uid, gid);
    }
    QRNUserIdentityPtr found = cache.userIdentityForPersonaUniqueString(*persona, uid, gid);
    if (found && !found->isEnterprise()) {
        QRN_LOG_ERROR(LogCategory::Unspecified,
                      "Invalid user identity plist data. Expected {} to be enterprise, but it was "
                      "not. Data: {}",
                      found->shortDescription(), plist.description());
    }
    return found;
}

} // namespace

CodeResult<QRNUserIdentityPtr> QRNUserIdentity::userIdentityWithPlist(const Value& plist,
                                                                      QRNUserIdentityCache& cache) {
    if (!plist.isDictionary()) {
        return QRNUserIdentityPtr();
    }
    const std::string* version = optionalString(plist, "version");
    if (version && *version == "2") {
        return readVersion2(plist, cache);
    }
    if (version && *version == "1") {
        return readVersion1(plist, cache);
    }
    return QRNUserIdentityPtr();
}

} // namespace quarn
