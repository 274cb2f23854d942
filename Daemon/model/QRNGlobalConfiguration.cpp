#include "Daemon/model/QRNGlobalConfiguration.h"

#include "Daemon/fs/QRNFileManager.h"
#include "Daemon/model/QRNContainerClass.h"
#include "Daemon/model/QRNPlatformConstants.h"
#include "Daemon/platform/Accounts.h"
#include "Daemon/platform/OsVariant.h"
#include "Daemon/platform/Paths.h"
#include "Daemon/support/QRNDaemonContext.h"

namespace quarn {

namespace {

// Private directories others only traverse (containers below them are
// theirs), and those nobody else may enter at all.
constexpr mode_t kSharedPrivateMode = 0755;
constexpr mode_t kRootOnlyMode = 0700;

} // namespace

QRNGlobalConfiguration::QRNGlobalConfiguration(QRNDaemonContext& context)
    : context_(context), fileManager_(context.instance<QRNFileManager>()),
      home_(context.instance<Paths>().resolve("/private/var/root/")) {
    if (auto mobile = context.instance<Accounts>().userByName("mobile")) {
        mobileUID_ = mobile->uid;
        mobileGID_ = mobile->gid;
        QRN_LOG_INFO(LogCategory::Unspecified, "Current mobile user ID is {}, group ID is {}",
                     mobileUID_, mobileGID_);
    } else {
        QRN_LOG_ERROR(LogCategory::Unspecified, "Failed to get mobile uid. This is bad");
    }
}

QRNGlobalConfiguration& QRNGlobalConfiguration::sharedInstance() {
    return QRNDaemonContext::current().instance<QRNGlobalConfiguration>();
}

bool QRNGlobalConfiguration::isInternalImage() {
    std::lock_guard guard(internalMutex_);
    if (!internalImage_) {
        internalImage_ = context_.instance<OsVariant>().hasInternalContent("com.orvex.quarnd");
    }
    return *internalImage_;
}

void QRNGlobalConfiguration::setIsInternalImage(bool isInternalImage) {
    std::lock_guard guard(internalMutex_);
    internalImage_ = isInternalImage;
}

const std::filesystem::path& QRNGlobalConfiguration::directory(QRNLazyDirectory& lazy,
                                                               std::string_view what,
                                                               const std::filesystem::path& parent,
                                                               std::string_view relative,
                                                               uid_t owner, int protectionClass) {
    QRNLazyDirectory::Creation creation{what, owner, protectionClass};
    return lazy.url([&] { return parent / relative; }, fileManager_, &creation);
}

const std::filesystem::path& QRNGlobalConfiguration::privateDirectory(
    QRNLazyDirectory& lazy, std::string_view what, const std::filesystem::path& parent,
    std::string_view relative, mode_t mode, int protectionClass) {
    return lazy.url(
        [&] {
            auto url = parent / relative;
            if (protectionClass >= 0) {
                QRNLazyDirectory::create(fileManager_, url, {what, 0, protectionClass});
            }
            if (auto checked = fileManager_.openRootOnlyDirectoryAtURL(url, mode); !checked) {
                QRN_LOG_ERROR(LogCategory::Unspecified, "Failed to create {} at \"{}\": {}", what,
                              url.string(), checked.error().description());
            }
            return url;
        },
        fileManager_, nullptr);
}

const std::filesystem::path& QRNGlobalConfiguration::sharedContainersDirectory() {
    QRNLazyDirectory::Creation creation{"shared container dir"};
    return sharedContainers_.url(
        [this] { return context_.instance<Paths>().resolve("/private/var/containers"); },
        fileManager_, &creation);
}

const std::filesystem::path& QRNGlobalConfiguration::logDirectory() {
    return privateDirectory(log_, "log directory", home_, "Library/Logs/Quarn", kSharedPrivateMode,
                            kDaemonDirectoryProtectionClass);
}

const std::filesystem::path& QRNGlobalConfiguration::cachesDirectory() {
    return privateDirectory(caches_, "cache dir", home_, "Library/Caches/com.orvex.quarnd",
                            kSharedPrivateMode, kDaemonDirectoryProtectionClass);
}

const std::filesystem::path& QRNGlobalConfiguration::libraryDirectory() {
    return privateDirectory(library_, "library dir", home_, "Library/Quarn", kSharedPrivateMode,
                            kDaemonDirectoryProtectionClass);
}

const std::filesystem::path& QRNGlobalConfiguration::transientDirectory() {
    return privateDirectory(transient_, "transient dir", cachesDirectory(), "Temp",
                            kSharedPrivateMode);
}

const std::filesystem::path& QRNGlobalConfiguration::transientBundleDirectory() {
    return directory(transientBundle_, "transient bundle dir", sharedContainersDirectory(), "Temp",
                     QRNPlatformConstants::kInstallationUID);
}

const std::filesystem::path& QRNGlobalConfiguration::legacyTransientBundleDirectory() {
    return legacyTransientBundle_.url(
        [this] {
            return context_.instance<Paths>().resolve(
                       QRNPlatformConstants::kInstallerHomeDirectory) /
                   "Library/Caches/com.orvex.quarnd";
        },
        fileManager_, nullptr);
}

const std::filesystem::path& QRNGlobalConfiguration::stagingDirectory() {
    return privateDirectory(staging_, "staging dir", cachesDirectory(), "Staging",
                            kSharedPrivateMode);
}

const std::filesystem::path& QRNGlobalConfiguration::deathrowDirectory() {
    return privateDirectory(deathrow_, "deathrow dir", cachesDirectory(), "Dead", kRootOnlyMode);
}

const std::filesystem::path& QRNGlobalConfiguration::scratchDirectory() {
    return privateDirectory(scratch_, "scratch dir", cachesDirectory(), "Scratch", kRootOnlyMode);
}

const std::filesystem::path& QRNGlobalConfiguration::replaceDirectory() {
    return privateDirectory(replace_, "replace dir", libraryDirectory(), "Replace",
                            kSharedPrivateMode);
}

const std::filesystem::path& QRNGlobalConfiguration::pendingUpdatesDirectory() {
    return privateDirectory(pendingUpdates_, "updates dir", libraryDirectory(), "PendingUpdates",
                            kSharedPrivateMode);
}

const std::filesystem::path& QRNGlobalConfiguration::bundleDirectory() {
    return directory(bundle_, "bundle dir", sharedContainersDirectory(), "Bundle");
}

const std::vector<std::string>& QRNGlobalConfiguration::appUserDataItemNames() {
    static const std::vector<std::string> names = {"Documents", "Library", "tmp", "Tillbox"};
    return names;
}

const std::vector<std::string>& QRNGlobalConfiguration::excludedFromAppUserData() {
    static const std::vector<std::string> names = {"SystemData"};
    return names;
}

} // namespace quarn
