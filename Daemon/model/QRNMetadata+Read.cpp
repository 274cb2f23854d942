// Reading and validating a container's metadata file. Nothing is repaired
// here: an invalid file gives a code and the caller decides what to do.

#include "Daemon/model/QRNContainerClass.h"
#include "Daemon/model/QRNGlobalConfiguration.h"
#include "Daemon/model/QRNMetadata.h"
#include "Daemon/model/QRNUserIdentitySharedCache.h"
#include "Daemon/support/PropertyList.h"

namespace quarn {

namespace {

std::string describe(const Value* v) {
    return v ? v->description() : "(null)";
}

// The fields read so far; each step fills some or answers a failure code.
struct MetadataReader {
    MetadataReader(const std::filesystem::path& u, const QRNUserIdentityPtr& e, Value d)
        : url(u), expected(e), dict(std::move(d)) {}

    const std::filesystem::path& url;
    const QRNUserIdentityPtr& expected;
    Value dict;
    std::string identifier;
    UUID uuid;
    std::uint64_t containerClass = 0;
    QRNUserIdentityPtr userIdentity;

    std::uint64_t readIdentifierUUIDAndClass();
    std::uint64_t checkLegacyOwner();
    std::uint64_t readUserIdentity();
    std::uint64_t checkOptionalEntries();
    std::uint64_t checkClassPath();
};

std::uint64_t MetadataReader::readIdentifierUUIDAndClass() {
    const Value* id = dict.get(QRNMetadata::kIdentifierKey);
    if (!id || !id->isString()) {
        QRN_LOG_ERROR(LogCategory::Metadata, "Invalid metadata Identifier: {} at {}", describe(id),
                      url.string());
        return kQRNErrorInvalidMetadata;
    }
    identifier = *id->asString();
    const Value* uuidValue = dict.get(QRNMetadata::kUUIDKey);
    if (!uuidValue || !uuidValue->isString()) {
        QRN_LOG_ERROR(LogCategory::Metadata, "Invalid metadata UUID String: {} at {}",
                      describe(uuidValue), url.string());
        return kQRNErrorInvalidMetadata;
    }
    auto parsed = UUID::parse(*uuidValue->asString());
    if (!parsed) {
        QRN_LOG_ERROR(LogCategory::Metadata, "Invalid metadata UUID: {} at {}",
                      *uuidValue->asString(), url.string());
        return kQRNErrorInvalidMetadata;
    }
    uuid = *parsed;
    const Value* cls = dict.get(QRNMetadata::kContentClassKey);
    if (!cls || !cls->isNumber()) {
        QRN_LOG_ERROR(LogCategory::Metadata, "Invalid metadata Class: {} at {}", describe(cls),
                      url.string());
        return kQRNErrorInvalidMetadata;
    }
    auto number = cls->asUInt64();
    if (!number || !QRNContainerClass::isValid(*number)) {
        QRN_LOG_ERROR(LogCategory::Metadata, "Invalid metadata Content Class: {} at {}",
                      cls->description(), url.string());
        return kQRNErrorInvalidMetadata;
    }
    containerClass = *number;
    return kQRNErrorNone;
}

// Files from before user identities record only the owner uid. They were all
// written for the device's one user, which is what the default identity
// stands for, and that user's uid may have been renumbered since: so the
// check runs only when another identity is expected, where a mismatch means
// the file is not that user's.
std::uint64_t MetadataReader::checkLegacyOwner() {
    const Value* owner = dict.get(QRNMetadata::kLegacyPersonaKey);
    if (!owner || expected->isEqual(*QRNUserIdentitySharedCache::defaultUserIdentity())) {
        return kQRNErrorNone;
    }
    const std::uint32_t expectedUID = expected->posixUIDForContainerClass(containerClass);
    auto uid = owner->asUInt64();
    if (!uid || *uid != expectedUID) {
        QRN_LOG_ERROR(LogCategory::Metadata, "Incorrect UserId: {}, expecting: {} for {} at {}",
                      owner->description(), expectedUID, identifier, url.string());
        return kQRNErrorInvalidMetadata;
    }
    return kQRNErrorNone;
}

std::uint64_t MetadataReader::readUserIdentity() {
    const Value* stored = dict.get(QRNMetadata::kUserIdentityKey);
    if (!stored) {
        userIdentity = expected;
        return kQRNErrorNone;
    }
    if (!stored->isDictionary()) {
        QRN_LOG_ERROR(LogCategory::Metadata, "Invalid metadata User Identity: {} for {} at {}: {}",
                      stored->description(), identifier, url.string(), kQRNErrorInvalidMetadata);
        return kQRNErrorInvalidMetadata;
    }
    auto made =
        QRNUserIdentity::userIdentityWithPlist(*stored, QRNUserIdentitySharedCache::sharedCache());
    if (!made || !*made) {
        QRN_LOG_ERROR(LogCategory::Metadata, "Could not create user identity from {}: {}",
                      stored->description(), made ? std::uint64_t{kQRNErrorNone} : made.error());
        return kQRNErrorInvalidMetadata;
    }
    if (!(*made)->isEqual(*expected)) {
        QRN_LOG_ERROR(LogCategory::Metadata,
                      "Incorrect User Identity: {}, expecting: {} for {} at {}: {}",
                      (*made)->shortDescription(), expected->shortDescription(), identifier,
                      url.string(), kQRNErrorInvalidMetadata);
        return kQRNErrorInvalidMetadata;
    }
    userIdentity = *made;
    return kQRNErrorNone;
}

std::uint64_t MetadataReader::checkOptionalEntries() {
    const Value* info = dict.get(QRNMetadata::kInfoKey);
    if (info && !info->isDictionary()) {
        QRN_LOG_ERROR(LogCategory::Metadata, "Invalid metadata Info: {} at {}", info->description(),
                      url.string());
        return kQRNErrorInvalidMetadata;
    }
    const Value* dirName = dict.get(QRNMetadata::kUserManagedAssetsDirNameKey);
    if (dirName && !dirName->isString()) {
        QRN_LOG_ERROR(LogCategory::Metadata,
                      "Invalid metadata User Managed Dir Name String: {} at {}",
                      dirName->description(), url.string());
        return kQRNErrorInvalidMetadata;
    }
    return kQRNErrorNone;
}

// The class directory the layout gives, without creating anything.
std::filesystem::path layoutClassDirectory(const QRNUserIdentityPtr& user, std::uint64_t cls,
                                           bool transient) {
    auto& config = QRNGlobalConfiguration::sharedInstance();
    if (QRNContainerClass::isGlobal(cls)) {
        return config.globalContainerBaseURLWithContentClass(cls, transient)->lexically_normal();
    }
    auto perUser = config.getPerUserConfigurationForUserIdentity(user);
    const auto& base = transient ? perUser->transientDirectory() : perUser->userBaseDirectory();
    return (base / QRNContainerClass::relativeDirectory(cls)).lexically_normal();
}

// A record says nothing of transience, so a container may sit in either of
// the class's two directories.
std::uint64_t MetadataReader::checkClassPath() {
    // metadata file -> container directory -> class directory
    const auto onDisk = url.parent_path().parent_path().lexically_normal();
    const auto permanent = layoutClassDirectory(userIdentity, containerClass, false);
    if (onDisk == permanent || onDisk == layoutClassDirectory(userIdentity, containerClass, true)) {
        return kQRNErrorNone;
    }
    QRN_LOG_ERROR(LogCategory::Metadata, "Invalid metadata-URLs should match: {} : {}",
                  onDisk.string(), permanent.string());
    return kQRNErrorInvalidMetadata;
}

} // namespace

CodeResult<QRNMetadataPtr> QRNMetadata::readAndValidateMetadataAtFileUrl(
    const std::filesystem::path& url, const QRNUserIdentityPtr& userIdentity, bool checkClassPath) {
    if (!userIdentity) {
        QRN_LOG_ERROR(LogCategory::Metadata, "Can't act on an invalid object: identity: (null)");
        return QRN_CODE(kQRNErrorInvalidArgument);
    }
    auto read = QRN_dictionaryWithContentsOfURL(url);
    if (!read) {
        QRN_LOG_ERROR(LogCategory::Metadata, "Failed to read metadata at URL {}", url.string());
        return QRN_CODE(kQRNErrorReadPlistFailed);
    }
    MetadataReader reader(url, userIdentity, std::move(*read));
    for (auto step :
         {&MetadataReader::readIdentifierUUIDAndClass, &MetadataReader::checkLegacyOwner,
          &MetadataReader::readUserIdentity, &MetadataReader::checkOptionalEntries}) {
        if (std::uint64_t code = (reader.*step)(); code != kQRNErrorNone) {
            return QRN_CODE(code);
        }
    }
    if (checkClassPath) {
        if (std::uint64_t code = reader.checkClassPath(); code != kQRNErrorNone) {
            return QRN_CODE(code);
        }
    }
    auto identity = QRNConcreteContainerIdentity::containerIdentityWithUUID(
        reader.uuid, reader.userIdentity, reader.identifier, reader.containerClass);
    if (!identity) {
        return QRN_CODE(identity.error());
    }
    const Value* info = reader.dict.get(kInfoKey);
    const Value* dirName = reader.dict.get(kUserManagedAssetsDirNameKey);
    auto metadata = std::make_shared<const QRNMetadata>(
        *identity, info ? *info : Value(), url.parent_path(),
        dirName ? std::optional<std::string>(*dirName->asString()) : std::nullopt);
    QRN_LOG_DEBUG(LogCategory::Metadata, "[{}] Read metadata from [{}]: {} <= {}", __func__,
                  url.string(), metadata->description(), reader.dict.description());
    return QRNMetadataPtr(metadata);
}

} // namespace quarn
