// Reading and validating a container's metadata file. Nothing is repaired
// here: an invalid file gives a code and the caller decides what to do.

#include "Daemon/fs/QRNFileManager.h"
#include "Daemon/model/QRNContainerClass.h"
#include "Daemon/model/QRNGlobalConfiguration.h"
#include "Daemon/model/QRNMetadata.h"
#include "Daemon/model/QRNMetadataFile.h"
#include "Daemon/model/QRNUserIdentitySharedCache.h"
#include "Daemon/support/PropertyList.h"

#include <cstdlib>
#include <limits>

namespace quarn {

namespace {

// A member as a Value, for the rare entries kept as one and for messages.
// The whole tree has been checked, so the conversion cannot fail.
Value valueOf(plist_t node) {
    auto value = valueFromPropertyList(node);
    return value ? std::move(*value) : Value();
}

std::string describe(plist_t node) {
    return node ? valueOf(node).description() : "(null)";
}

// A string member (a key node reads as one too, as in a Value).
std::optional<std::string> stringOf(plist_t node) {
    switch (plist_get_node_type(node)) {
    case PLIST_STRING: {
        std::uint64_t length = 0;
        const char* s = plist_get_string_ptr(node, &length);
        return std::string(s ? s : "", s ? length : 0);
    }
    case PLIST_KEY:
        return *valueOf(node).asString();
    default:
        return std::nullopt;
    }
}

// Whether `node` is the dictionary `value` of strings and small integers,
// read without building a Value; anything else answers false.
bool sameFlatDictionary(plist_t node, const Value& value) {
    const Value::Dictionary* dict = value.asDictionary();
    if (!dict || plist_get_node_type(node) != PLIST_DICT ||
        plist_dict_get_size(node) != dict->size()) {
        return false; // a repeated key also makes the sizes differ
    }
    for (const auto& [key, member] : *dict) {
        plist_t item = plist_dict_get_item(node, key.c_str());
        if (!item) {
            return false;
        }
        if (const std::string* s = member.asString()) {
            std::uint64_t length = 0;
            const char* text = plist_get_string_ptr(item, &length);
            if (plist_get_node_type(item) != PLIST_STRING || !text ||
                std::string_view(text, length) != *s) {
                return false;
            }
            continue;
        }
        std::uint64_t number = 0;
        if (member.kind() != Value::Kind::UInt64 || plist_get_node_type(item) != PLIST_UINT) {
            return false;
        }
        plist_get_uint_val(item, &number);
        if (number != *member.asUInt64() ||
            number > static_cast<std::uint64_t>(std::numeric_limits<std::int64_t>::max())) {
            return false;
        }
    }
    return true;
}

// The members the reader looks at, found in one pass over the file's
// dictionary; a key given twice names its last value, as in a Value.
struct MetadataNodes {
    plist_t identifier = nullptr;
    plist_t uuid = nullptr;
    plist_t contentClass = nullptr;
    plist_t legacyOwner = nullptr;
    plist_t userIdentity = nullptr;
    plist_t info = nullptr;
    plist_t dirName = nullptr;

    explicit MetadataNodes(plist_t dict);
    plist_t* slotFor(std::string_view key);
};

MetadataNodes::MetadataNodes(plist_t dict) {
    plist_dict_iter raw = nullptr;
    plist_dict_new_iter(dict, &raw);
    std::unique_ptr<void, decltype(&std::free)> iter(raw, &std::free);
    for (;;) {
        char* rawKey = nullptr;
        plist_t item = nullptr;
        plist_dict_next_item(dict, iter.get(), &rawKey, &item);
        std::unique_ptr<char, decltype(&std::free)> key(rawKey, &std::free);
        if (!item) {
            return;
        }
        if (plist_t* slot = key ? slotFor(key.get()) : nullptr) {
            *slot = item;
        }
    }
}

plist_t* MetadataNodes::slotFor(std::string_view key) {
    if (key == QRNMetadata::kIdentifierKey) {
        return &identifier;
    }
    if (key == QRNMetadata::kUUIDKey) {
        return &uuid;
    }
    if (key == QRNMetadata::kContentClassKey) {
        return &contentClass;
    }
    if (key == QRNMetadata::kLegacyPersonaKey) {
        return &legacyOwner;
    }
    if (key == QRNMetadata::kUserIdentityKey) {
        return &userIdentity;
    }
    if (key == QRNMetadata::kInfoKey) {
        return &info;
    }
    return key == QRNMetadata::kUserManagedAssetsDirNameKey ? &dirName : nullptr;
}

// The fields read so far; each step fills some or answers a failure code.
struct MetadataReader {
    MetadataReader(const std::string& u, const QRNUserIdentityPtr& e, plist_t d,
                   QRNMetadata::ReadMemo* m)
        : url(u), expected(e), memo(m), nodes(d) {}

    const std::string& url;
    const QRNUserIdentityPtr& expected;
    QRNMetadata::ReadMemo* memo;
    MetadataNodes nodes;
    std::string identifier;
    UUID uuid;
    std::uint64_t containerClass = 0;
    QRNUserIdentityPtr userIdentity;
    Value info;
    std::optional<std::string> dirName;

    std::uint64_t readIdentifierUUIDAndClass();
    std::uint64_t checkDirectoryName();
    std::uint64_t readClass();
    std::uint64_t checkLegacyOwner();
    std::uint64_t readUserIdentity();
    std::uint64_t makeUserIdentity(QRNUserIdentityPtr& made);
    std::uint64_t readOptionalEntries();
    std::uint64_t checkClassPath();
};

std::uint64_t MetadataReader::readIdentifierUUIDAndClass() {
    auto id = nodes.identifier ? stringOf(nodes.identifier) : std::nullopt;
    if (!id) {
        QRN_LOG_ERROR(LogCategory::Metadata, "Invalid metadata Identifier: {} at {}",
                      describe(nodes.identifier), url);
        return kQRNErrorInvalidMetadata;
    }
    identifier = std::move(*id);
    auto uuidString = nodes.uuid ? stringOf(nodes.uuid) : std::nullopt;
    if (!uuidString) {
        QRN_LOG_ERROR(LogCategory::Metadata, "Invalid metadata UUID String: {} at {}",
                      describe(nodes.uuid), url);
        return kQRNErrorInvalidMetadata;
    }
    auto parsed = UUID::parse(*uuidString);
    if (!parsed) {
        QRN_LOG_ERROR(LogCategory::Metadata, "Invalid metadata UUID: {} at {}", *uuidString, url);
        return kQRNErrorInvalidMetadata;
    }
    uuid = *parsed;
    return readClass();
}

// A container directory named by a UUID holds only its own record: a file
// copied from another container does not make this one that container.
// System containers are left out: some are named by identifier, the others
// get a fresh directory UUID at every regeneration while their record keeps
// its own, and all lie in root-owned directories users cannot plant in.
std::uint64_t MetadataReader::checkDirectoryName() {
    if (containerClass == kQRNContainerClassSystemData ||
        containerClass == kQRNContainerClassSystemGroup) {
        return kQRNErrorNone;
    }
    const std::size_t slash = url.rfind('/');
    const std::size_t before = slash == std::string::npos ? 0 : url.rfind('/', slash - 1);
    if (slash == std::string::npos || slash == 0 || before == std::string::npos) {
        return kQRNErrorNone;
    }
    auto named = UUID::parse(std::string_view(url).substr(before + 1, slash - before - 1));
    if (named && *named != uuid) {
        QRN_LOG_ERROR(LogCategory::Metadata, "Metadata UUID {} does not match its directory at {}",
                      uuid.string(), url);
        return kQRNErrorInvalidMetadata;
    }
    return kQRNErrorNone;
}

// Any number is a class's type; only an integer in the classes' range is one.
std::uint64_t MetadataReader::readClass() {
    const plist_t cls = nodes.contentClass;
    const plist_type type = cls ? plist_get_node_type(cls) : PLIST_NONE;
    if (type != PLIST_UINT && type != PLIST_REAL) {
        QRN_LOG_ERROR(LogCategory::Metadata, "Invalid metadata Class: {} at {}", describe(cls),
                      url);
        return kQRNErrorInvalidMetadata;
    }
    // Integers beyond the classes' range, negative ones included, all fail
    // the range check, whichever way libplist holds them.
    std::uint64_t number = 0;
    if (type == PLIST_UINT) {
        plist_get_uint_val(cls, &number);
    }
    if (type != PLIST_UINT || !QRNContainerClass::isValid(number)) {
        QRN_LOG_ERROR(LogCategory::Metadata, "Invalid metadata Content Class: {} at {}",
                      describe(cls), url);
        return kQRNErrorInvalidMetadata;
    }
    containerClass = number;
    return kQRNErrorNone;
}

std::uint64_t MetadataReader::checkLegacyOwner() {
    if (!nodes.legacyOwner ||
        expected->isEqual(*QRNUserIdentitySharedCache::defaultUserIdentity())) {
        return kQRNErrorNone;
    }
    const Value owner = valueOf(nodes.legacyOwner);
    const std::uint32_t expectedUID = expected->posixUIDForContainerClass(containerClass);
    auto uid = owner.asUInt64();
    if (!uid || *uid != expectedUID) {
        QRN_LOG_ERROR(LogCategory::Metadata, "Incorrect UserId: {}, expecting: {} for {} at {}",
                      owner.description(), expectedUID, identifier, url);
        return kQRNErrorInvalidMetadata;
    }
    return kQRNErrorNone;
}

std::uint64_t MetadataReader::readUserIdentity() {
    if (!nodes.userIdentity) {
        userIdentity = expected;
        return kQRNErrorNone;
    }
    QRNUserIdentityPtr made;
    if (memo && memo->userIdentity && sameFlatDictionary(nodes.userIdentity, memo->stored)) {
        made = memo->userIdentity;
    } else if (std::uint64_t code = makeUserIdentity(made); code != kQRNErrorNone) {
        return code;
    }
    if (!made->isEqual(*expected)) {
        QRN_LOG_ERROR(LogCategory::Metadata,
                      "Incorrect User Identity: {}, expecting: {} for {} at {}: {}",
                      made->shortDescription(), expected->shortDescription(), identifier, url,
                      kQRNErrorInvalidMetadata);
        return kQRNErrorInvalidMetadata;
    }
    userIdentity = std::move(made);
    return kQRNErrorNone;
}

std::uint64_t MetadataReader::makeUserIdentity(QRNUserIdentityPtr& made) {
    Value stored = valueOf(nodes.userIdentity);
    if (!stored.isDictionary()) {
        QRN_LOG_ERROR(LogCategory::Metadata, "Invalid metadata User Identity: {} for {} at {}: {}",
                      stored.description(), identifier, url, kQRNErrorInvalidMetadata);
        return kQRNErrorInvalidMetadata;
    }
    auto result =
        QRNUserIdentity::userIdentityWithPlist(stored, QRNUserIdentitySharedCache::sharedCache());
    if (!result || !*result) {
        QRN_LOG_ERROR(LogCategory::Metadata, "Could not create user identity from {}: {}",
                      stored.description(), result ? std::uint64_t{kQRNErrorNone} : result.error());
        return kQRNErrorInvalidMetadata;
    }
    made = *result;
    if (memo) {
        memo->stored = std::move(stored);
        memo->userIdentity = made;
    }
    return kQRNErrorNone;
}

std::uint64_t MetadataReader::readOptionalEntries() {
    if (nodes.info) {
        info = valueOf(nodes.info);
        if (!info.isDictionary()) {
            QRN_LOG_ERROR(LogCategory::Metadata, "Invalid metadata Info: {} at {}",
                          info.description(), url);
            return kQRNErrorInvalidMetadata;
        }
    }
    if (nodes.dirName) {
        dirName = stringOf(nodes.dirName);
        if (!dirName) {
            QRN_LOG_ERROR(LogCategory::Metadata,
                          "Invalid metadata User Managed Dir Name String: {} at {}",
                          describe(nodes.dirName), url);
            return kQRNErrorInvalidMetadata;
        }
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
    const auto onDisk = std::filesystem::path(url).parent_path().parent_path().lexically_normal();
    const auto permanent = layoutClassDirectory(userIdentity, containerClass, false);
    if (onDisk == permanent || onDisk == layoutClassDirectory(userIdentity, containerClass, true)) {
        return kQRNErrorNone;
    }
    QRN_LOG_ERROR(LogCategory::Metadata, "Invalid metadata-URLs should match: {} : {}",
                  onDisk.string(), permanent.string());
    return kQRNErrorInvalidMetadata;
}

// The container directory: the file's path without its last component,
// as a string, since the record keeps one.
std::string containerDirectoryOf(const std::string& file) {
    std::size_t slash = file.rfind('/');
    if (slash == std::string::npos || slash + 1 == file.size()) {
        return std::filesystem::path(file).parent_path().native();
    }
    while (slash > 0 && file[slash - 1] == '/') {
        --slash;
    }
    return file.substr(0, slash == 0 ? 1 : slash);
}

} // namespace

CodeResult<QRNMetadataPtr> QRNMetadata::readAndValidateMetadataAtFileUrl(
    const std::filesystem::path& url, const QRNUserIdentityPtr& userIdentity, bool checkClassPath) {
    return readAndValidateMetadataAtFilePath(url.native(), userIdentity, checkClassPath, nullptr);
}

CodeResult<QRNMetadataPtr>
QRNMetadata::readAndValidateMetadataAtFilePath(const std::string& url,
                                               const QRNUserIdentityPtr& userIdentity,
                                               bool checkClassPath, ReadMemo* memo) {
    if (!userIdentity) {
        QRN_LOG_ERROR(LogCategory::Metadata, "Can't act on an invalid object: identity: (null)");
        return QRN_CODE(kQRNErrorInvalidArgument);
    }
    auto& manager = QRNFileManager::defaultManager();
    auto read = QRNMetadataFile::readTrusted(manager.env(), manager.resolver(), url);
    if (!read) {
        QRN_LOG_ERROR(LogCategory::Metadata, "Failed to read metadata at URL {}", url);
        return QRN_CODE(kQRNErrorReadPlistFailed);
    }
    MetadataReader reader(url, userIdentity, read->get(), memo);
    for (auto step : {&MetadataReader::readIdentifierUUIDAndClass,
                      &MetadataReader::checkDirectoryName, &MetadataReader::checkLegacyOwner,
                      &MetadataReader::readUserIdentity, &MetadataReader::readOptionalEntries}) {
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
        reader.uuid, reader.userIdentity, std::move(reader.identifier), reader.containerClass);
    if (!identity) {
        return QRN_CODE(identity.error());
    }
    auto metadata =
        std::make_shared<const QRNMetadata>(std::move(*identity), std::move(reader.info),
                                            containerDirectoryOf(url), std::move(reader.dirName));
    QRN_LOG_DEBUG(LogCategory::Metadata, "[{}] Read metadata from [{}]: {} <= {}", __func__, url,
                  metadata->description(), describe(read->get()));
    return QRNMetadataPtr(metadata);
}

} // namespace quarn
