// Building a new container in its staging directory: the top-level
// directory, the metadata file, the system ACL and the class's
// subdirectories with their owners, modes and protection classes.

#include "Daemon/operations/QRNClientConnection.h"

#include "Daemon/fs/QRNFileManager.h"
#include "Daemon/model/QRNConcreteContainerIdentity.h"
#include "Daemon/model/QRNContainerClass.h"
#include "Daemon/model/QRNGlobalConfiguration.h"
#include "Daemon/model/QRNMetadata.h"
#include "Daemon/model/QRNPlatformConstants.h"
#include "Daemon/model/QRNWhitelist.h"
#include "Daemon/platform/ContainerLibrary.h"
#include "Daemon/protection/QRNDataProtectionManager.h"
#include "Daemon/support/Log.h"
#include "Daemon/support/QRNDaemonContext.h"
#include "Daemon/support/UUID.h"

#include <algorithm>
#include <utility>
#include <vector>

namespace quarn {

namespace {

constexpr mode_t kContainerDirectoryMode = 0755;
// System containers' subdirectories start closed; their ACL opens them.
constexpr mode_t kSystemSubdirectoryMode = 0;
// Owner of system containers' subdirectories: the "nobody" of 32-bit ids.
constexpr uid_t kSystemSubdirectoryOwner = 4294967294u;
constexpr std::string_view kContentProtectionClassKey = "com.orvex.Brevon.ContentProtectionClass";

bool isExcludedFromAppUserData(const std::string& name) {
    const auto& excluded = QRNGlobalConfiguration::excludedFromAppUserData();
    return std::find(excluded.begin(), excluded.end(), name) != excluded.end();
}

mode_t subdirectoryModeForClass(std::uint64_t cls) {
    return QRNContainerClass::isSystem(cls) ? kSystemSubdirectoryMode : kContainerDirectoryMode;
}

uid_t subdirectoryOwnerForClass(std::uint64_t cls, const QRNMetadata& metadata) {
    if (QRNContainerClass::isBundle(cls)) {
        return QRNPlatformConstants::kInstallationUID;
    }
    if (QRNContainerClass::isSystem(cls)) {
        return kSystemSubdirectoryOwner;
    }
    return metadata.userIdentity()->posixUIDForContainerClass(cls);
}

// An open directory and its path relative to the container.
struct MadeParent {
    const EnvFd& dir;
    std::string name;
};

// The deepest directory already made (and held open) that contains `name`,
// and the rest of `name` below it; the container itself when there is none.
std::pair<MadeParent, std::string>
nearestMadeParent(const std::vector<std::pair<std::string, EnvFd>>& made, const EnvFd& container,
                  const std::string& name) {
    const std::pair<std::string, EnvFd>* nearest = nullptr;
    for (const auto& entry : made) {
        const std::string& candidate = entry.first;
        if (name.size() > candidate.size() && name.compare(0, candidate.size(), candidate) == 0 &&
            name[candidate.size()] == '/' &&
            (!nearest || candidate.size() > nearest->first.size())) {
            nearest = &entry;
        }
    }
    if (!nearest) {
        return {MadeParent{container, std::string()}, name};
    }
    return {MadeParent{nearest->second, nearest->first}, name.substr(nearest->first.size() + 1)};
}

} // namespace

CodeResult<QRNMetadataPtr>
QRNClientConnection::_buildInStaging(const QRNContainerIdentity& identity, const UUID& uuid,
                                     std::optional<std::filesystem::path>& stagingURL) {
    const std::uint64_t cls = identity.containerClass();
    const QRNUserIdentityPtr& userIdentity = identity.userIdentity();
    std::optional<std::filesystem::path> staging =
        QRNGlobalConfiguration::sharedInstance().stagingDirectoryURLForUserIdentity(userIdentity,
                                                                                    cls);
    if (staging) {
        *staging /= uuid.string();
    }
    Result<EnvFd> made =
        staging ? _createTopLevelContainerDirectory(*staging, cls,
                                                    userIdentity->posixUIDForContainerClass(cls))
                : QRN_UNEXPECTED(
                      QRN_ERROR(kQRNErrorInvalidPath, "No staging directory for class {}", cls));
    if (!made) {
        QRN_ERROR(kQRNErrorCreateStagingFailed, "Failed to create staging dir at {} : {}",
                  staging ? staging->string() : "(null)", made.error().description());
        return QRN_CODE(kQRNErrorCreateStagingFailed);
    }
    stagingURL = *staging;

    auto concrete = QRNConcreteContainerIdentity::containerIdentityWithUUID(
        uuid, userIdentity, identity.identifier(), cls);
    if (!concrete) {
        return QRN_CODE(concrete.error());
    }
    auto metadata = std::make_shared<const QRNMetadata>(*concrete, Value(), *staging, std::nullopt);
    // Into the directory just made, by its descriptor: its path lies in a
    // directory the user may own.
    if (auto written = metadata->writeMetadataInDirectory(*made, *staging); !written) {
        return QRN_CODE(written.error().qrnCode(kQRNErrorWriteStateFileFailed));
    }
    if (QRNContainerClass::isSystem(cls)) {
        // A failed ACL leaves the container usable by root alone; the
        // standardising passes repair it, so creation goes on.
        if (auto acl =
                QRNFileManager::defaultManager().setTopLevelSystemContainerACLAtURL(*staging);
            !acl) {
            QRN_LOG_ERROR(LogCategory::Lifecycle, "Failed to set system container ACL at {} : {}",
                          staging->string(), acl.error().description());
        }
    }
    if (auto subdirectories = _createSubDirectories(*made, *staging, *metadata); !subdirectories) {
        return QRN_CODE(subdirectories.error());
    }
    return QRNMetadataPtr(metadata);
}

Result<EnvFd>
QRNClientConnection::_createTopLevelContainerDirectory(const std::filesystem::path& url,
                                                       std::uint64_t containerClass, uid_t owner) {
    if (QRNContainerClass::isBundle(containerClass)) {
        owner = QRNPlatformConstants::kInstallationUID;
    } else if (QRNContainerClass::isSystem(containerClass)) {
        owner = QRNPlatformConstants::kSystemContainerUID;
    }
    return QRNFileManager::defaultManager().createAndOpenDirectoryAtURL(
        url, true, kContainerDirectoryMode, owner, 0);
}

CodeResult<void>
QRNClientConnection::_createSubDirectories(const std::filesystem::path& containerURL,
                                           const QRNMetadata& metadata) {
    // Recreating the structure of a container whose directory went missing
    // makes the directory again too, as making each path would.
    auto container = QRNFileManager::defaultManager().createAndOpenDirectoryAtURL(
        containerURL, true, subdirectoryModeForClass(metadata.containerClass()), 0,
        QRNFileManager::kProtectionClassUnchanged);
    if (!container) {
        QRN_ERROR(kQRNErrorCreateDirFailed, "Failed to create sub-dir for {} at {} (protClass: {})",
                  metadata.identifier(), containerURL.string(),
                  _dataProtectionClassForContainerMetadata(metadata));
        return QRN_CODE(kQRNErrorCreateDirFailed);
    }
    return _createSubDirectories(*container, containerURL, metadata);
}

CodeResult<void>
QRNClientConnection::_createSubDirectories(const EnvFd& container,
                                           const std::filesystem::path& containerURL,
                                           const QRNMetadata& metadata) {
    const std::uint64_t cls = metadata.containerClass();
    const mode_t mode = subdirectoryModeForClass(cls);
    const uid_t owner = subdirectoryOwnerForClass(cls, metadata);
    auto names =
        QRNDaemonContext::current().instance<ContainerLibrary>().subdirectoryNamesForClass(cls);
    if (!names) {
        QRN_ERROR(names.error(), "Failed to get subdirectory names for {} : {}", cls,
                  names.error());
        return QRN_CODE(names.error());
    }
    const std::int32_t containerProtectionClass =
        _dataProtectionClassForContainerMetadata(metadata);
    QRN_LOG_DEBUG(LogCategory::Lifecycle, "Creating subdirectories for [{}:{}] at [{}]", cls,
                  metadata.identifier(), containerURL.string());
    // Data containers keep the daemon's own items readable whatever the lock state.
    const bool isDataClass = QRNContainerClass::isPerUser(cls);
    // Made so far, open: "Library/Caches" is made in "Library" without
    // walking to it again.
    std::vector<std::pair<std::string, EnvFd>> made;
    QRNFileManager& fileManager = QRNFileManager::defaultManager();
    for (const std::string& name : *names) {
        const std::int32_t protectionClass =
            isDataClass && isExcludedFromAppUserData(name) ? 0 : containerProtectionClass;
        const auto [parent, relative] = nearestMadeParent(made, container, name);
        std::optional<std::filesystem::path> nestedURL;
        const std::filesystem::path& parentURL =
            parent.name.empty() ? containerURL : nestedURL.emplace(containerURL / parent.name);
        auto directory = fileManager.createAndOpenDirectoryInDirectory(
            parent.dir, parentURL, relative, mode, owner, protectionClass);
        if (!directory) {
            QRN_ERROR(kQRNErrorCreateDirFailed,
                      "Failed to create sub-dir for {} at {} (protClass: {})",
                      metadata.identifier(), (containerURL / name).string(), protectionClass);
            return QRN_CODE(kQRNErrorCreateDirFailed);
        }
        made.emplace_back(name, std::move(*directory));
    }
    return {};
}

std::int32_t
QRNClientConnection::_dataProtectionClassForContainerMetadata(const QRNMetadata& metadata) {
    if (!QRNContainerClass::isPerUser(metadata.containerClass())) {
        return 0;
    }
    if (const Value* recorded = metadata.info().get(kContentProtectionClassKey)) {
        if (std::optional<std::int64_t> value = recorded->asInt64()) {
            return static_cast<std::int32_t>(*value);
        }
    }
    return QRNDataProtectionManager::defaultManager()
        .intendedDataProtectionClassBasedOnEntitlementsForIdentifier(metadata.identifier());
}

} // namespace quarn
