#include "Daemon/model/QRNMetadata.h"

#include "Daemon/fs/QRNFileManager.h"
#include "Daemon/model/QRNGlobalConfiguration.h"
#include "Daemon/support/PropertyList.h"
#include "Daemon/support/ProtectionClassAttribute.h"

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

namespace {

Status writeFailure(const Error& cause, const std::filesystem::path& url) {
    return QRN_UNEXPECTED(QRN_ERROR_UNDERLYING(cause, kQRNErrorWriteStateFileFailed,
                                               "Failed to write metadata dictionary to URL {} : "
                                               "{}:{}",
                                               url.string(), cause.domainName(), cause.code));
}

} // namespace

Status QRNMetadata::writeMetadataToFileURL(const std::filesystem::path& url) const {
    const std::filesystem::path container = url.parent_path();
    auto directory = QRNFileManager::defaultManager().openDirectoryAtURL(container);
    if (!directory) {
        return writeFailure(directory.error(), url);
    }
    return writeMetadataInDirectory(*directory, container);
}

Status QRNMetadata::writeMetadataInDirectory(const EnvFd& container,
                                             const std::filesystem::path& containerURL) const {
    const Value dict = dictionary();
    const auto url = containerURL / kFileName;
    auto bytes = binaryPropertyList(dict);
    if (!bytes) {
        return writeFailure(bytes.error(), url);
    }
    const std::string temporary = fmt::format("temp_metadata-{}.plist", uuid().string());
    const QRNFileManager::FileReplacement replacement{
        QRNGlobalConfiguration::sharedInstance().scratchDirectory(), temporary,
        ProtectionClassAttribute::kLowestClass};
    if (auto replaced = QRNFileManager::defaultManager().replaceFileInDirectory(
            container, containerURL, std::string(kFileName), *bytes, replacement);
        !replaced) {
        return writeFailure(replaced.error(), url);
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
