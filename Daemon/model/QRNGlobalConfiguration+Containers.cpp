// Where containers of each class live, and the per-user configurations.

#include "Daemon/fs/QRNFileManager.h"
#include "Daemon/model/QRNContainerClass.h"
#include "Daemon/model/QRNGlobalConfiguration.h"

namespace quarn {

std::optional<std::filesystem::path>
QRNGlobalConfiguration::globalContainerBaseURLWithContentClass(std::uint64_t cls, bool transient) {
    if (!QRNContainerClass::isGlobal(cls)) {
        return std::nullopt;
    }
    std::filesystem::path base;
    if (!transient) {
        base = sharedContainersDirectory();
    } else if (QRNContainerClass::isBundle(cls)) {
        base = transientBundleDirectory();
    } else {
        base = transientDirectory();
    }
    return base / QRNContainerClass::relativeDirectory(cls);
}

std::optional<std::filesystem::path> QRNGlobalConfiguration::containerDirectoryURLForUserIdentity(
    const QRNUserIdentityPtr& userIdentity, std::uint64_t contentClass, bool transient) {
    std::lock_guard guard(containerDirectoryMutex_);
    if (!QRNContainerClass::isGlobal(contentClass)) {
        if (!userIdentity) {
            return std::nullopt;
        }
        return getPerUserConfigurationForUserIdentity(userIdentity)
            ->containerDirectoryURLForContentClass(contentClass, transient);
    }
    auto url = globalContainerBaseURLWithContentClass(contentClass, transient);
    QRNLazyDirectory::create(
        fileManager_, *url,
        {"container dir", QRNContainerClass::baseDirectoryOwner(contentClass), -1});
    return url;
}

std::optional<std::filesystem::path>
QRNGlobalConfiguration::stagingDirectoryURLForUserIdentity(const QRNUserIdentityPtr& userIdentity,
                                                           std::uint64_t contentClass) {
    if (!QRNContainerClass::usesPerUserStaging(contentClass)) {
        return stagingDirectory();
    }
    if (!userIdentity) {
        return std::nullopt;
    }
    return getPerUserConfigurationForUserIdentity(userIdentity)->stagingDirectory();
}

bool QRNGlobalConfiguration::migrationFileExistsWithName(std::string_view name) {
    // Only a plain name: nothing outside the library directory is asked about.
    if (name.empty() || name == "." || name == ".." || name.find('/') != std::string_view::npos) {
        return false;
    }
    return fileManager_.itemExistsAtURL(libraryDirectory() / name);
}

std::shared_ptr<QRNPerUserConfiguration>
QRNGlobalConfiguration::getPerUserConfigurationForUserIdentity(
    const QRNUserIdentityPtr& userIdentity) {
    if (!userIdentity) {
        return nullptr;
    }
    std::lock_guard guard(perUserMutex_);
    auto& config = perUser_[userIdentity];
    if (!config) {
        config = std::make_shared<QRNPerUserConfiguration>(fileManager_, userIdentity);
    }
    return config;
}

} // namespace quarn
