#include "Daemon/model/QRNMetadata.h"

#include "Daemon/fs/QRNFileManager.h"
#include "Daemon/model/QRNGlobalConfiguration.h"
#include "Daemon/support/PropertyList.h"

namespace quarn {

QRNMetadata::QRNMetadata(QRNConcreteContainerIdentityPtr containerIdentity, Value info,
                         std::string url, std::optional<std::string> userManagedAssetsDirName)
    : containerIdentity_(std::move(containerIdentity)), info_(std::move(info)),
      url_(std::move(url)), userManagedAssetsDirName_(std::move(userManagedAssetsDirName)) {}

Value QRNMetadata::dictionary() const {
    Value dict = Value::dictionary();
    if (!info_.isNone()) {
        dict.set(std::string(kInfoKey), info_);
    }
    dict.set(std::string(kContentClassKey), containerClass());
    dict.set(std::string(kUserIdentityKey), userIdentity()->plist());
    dict.set(std::string(kIdentifierKey), identifier());
    dict.set(std::string(kUUIDKey), uuid().string());
    dict.set(std::string(kVersionKey), kVersion);
    if (userManagedAssetsDirName_) {
        dict.set(std::string(kUserManagedAssetsDirNameKey), *userManagedAssetsDirName_);
    }
    return dict;
}

Status QRNMetadata::writeMetadataToFileURL(const std::filesystem::path& url) const {
    const Value dict = dictionary();
    // Written next to the container's staging area so the final move stays
    // on one file system and replaces the old file in one step.
    auto staging = QRNGlobalConfiguration::sharedInstance().stagingDirectoryURLForUserIdentity(
        userIdentity(), containerClass());
    const auto temporary = staging.value_or(url.parent_path()) /
                           fmt::format("temp_metadata-{}.plist", uuid().string());
    // Already written under a temporary name and moved: only the protection
    // option is wanted.
    if (auto written = QRN_writeToURL(dict, temporary, WriteOptions{.lowestProtection = true});
        !written) {
        const Error& e = written.error();
        return QRN_UNEXPECTED(
            QRN_ERROR_UNDERLYING(e, kQRNErrorWriteStateFileFailed,
                                 "Failed to write metadata dictionary to URL {} : {}:{}",
                                 temporary.string(), e.domainName(), e.code));
    }
    auto& fileManager = QRNFileManager::defaultManager();
    if (auto moved = fileManager.moveItemAtURL(temporary, url); !moved) {
        auto error = QRN_ERROR_UNDERLYING(moved.error(), kQRNErrorWriteStateFileFailed,
                                          "Failed to move metadata from staging: {} to final: {}",
                                          temporary.string(), url.string());
        (void)fileManager.removeItemAtURL(temporary);
        return QRN_UNEXPECTED(std::move(error));
    }
    QRN_LOG_DEBUG(LogCategory::Metadata, "[{}] Writing metadata to [{}]: {} => {}", __func__,
                  url.string(), description(), dict.description());
    return {};
}

std::string QRNMetadata::description() const {
    return fmt::format("<QRNMetadata: {}; userIdentity = {}, uuid = {}, containerClass = {}, "
                       "identifier = {}, info = {}, url = {}, userManagedAssetsDirName = {}>",
                       fmt::ptr(this), userIdentity()->description(), uuid().string(),
                       containerClass(), identifier(),
                       info_.isNone() ? std::string("(null)") : info_.description(), url_,
                       userManagedAssetsDirName_.value_or("(null)"));
}

} // namespace quarn
