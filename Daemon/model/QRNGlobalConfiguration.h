#pragma once
// Every directory the daemon uses, below the root prefix: where global
// (bundle and system) containers live, the daemon's own working directories,
// and, through one QRNPerUserConfiguration per user identity, each user's.
// Directories are computed once, created on first use, and kept.
// The current daemon context owns the one instance.

#include "Daemon/model/QRNLazyDirectory.h"
#include "Daemon/model/QRNPerUserConfiguration.h"
#include "Daemon/model/QRNUserIdentity.h"

#include <cstdint>
#include <filesystem>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <unordered_map>
#include <vector>

namespace quarn {

class QRNDaemonContext;
class QRNFileManager;

class QRNGlobalConfiguration {
public:
    // Protection class of the daemon's log, caches and library directories.
    static constexpr int kDaemonDirectoryProtectionClass = 4;

    explicit QRNGlobalConfiguration(QRNDaemonContext& context);
    QRNGlobalConfiguration(const QRNGlobalConfiguration&) = delete;
    QRNGlobalConfiguration& operator=(const QRNGlobalConfiguration&) = delete;

    static QRNGlobalConfiguration& sharedInstance();

    // The "mobile" account's ids, read once; 0 when there is no such account.
    std::uint32_t currentMobileUserId() const { return mobileUID_; }
    std::uint32_t currentMobileGroupId() const { return mobileGID_; }

    bool isInternalImage();
    void setIsInternalImage(bool isInternalImage);

    const std::filesystem::path& daemonHomeDirectory() const { return home_; }
    const std::filesystem::path& sharedContainersDirectory();
    const std::filesystem::path& logDirectory();
    const std::filesystem::path& cachesDirectory();
    const std::filesystem::path& libraryDirectory();
    const std::filesystem::path& transientDirectory();
    const std::filesystem::path& transientBundleDirectory();
    const std::filesystem::path& legacyTransientBundleDirectory(); // never created
    const std::filesystem::path& stagingDirectory();
    // Root-only (0700), checked whenever an item is moved there.
    const std::filesystem::path& deathrowDirectory();
    // Root-only (0700): temporary files are written here and renamed into
    // place, out of reach of any user.
    const std::filesystem::path& scratchDirectory();
    const std::filesystem::path& replaceDirectory();
    const std::filesystem::path& pendingUpdatesDirectory();
    const std::filesystem::path& bundleDirectory();

    // Global classes only (not created here); nothing for any other class.
    std::optional<std::filesystem::path> globalContainerBaseURLWithContentClass(std::uint64_t cls,
                                                                                bool transient);
    // The directory holding the containers of the class, created.
    std::optional<std::filesystem::path>
    containerDirectoryURLForUserIdentity(const QRNUserIdentityPtr& userIdentity,
                                         std::uint64_t contentClass, bool transient);
    // Per-user staging for the per-user classes, else the global one.
    std::optional<std::filesystem::path>
    stagingDirectoryURLForUserIdentity(const QRNUserIdentityPtr& userIdentity,
                                       std::uint64_t contentClass);
    // Whether an item of that name lies directly in the library directory.
    bool migrationFileExistsWithName(std::string_view name);

    std::shared_ptr<QRNPerUserConfiguration>
    getPerUserConfigurationForUserIdentity(const QRNUserIdentityPtr& userIdentity);

    // The items of an app data container that belong to the user.
    static const std::vector<std::string>& appUserDataItemNames();
    static const std::vector<std::string>& excludedFromAppUserData();

private:
    const std::filesystem::path& directory(QRNLazyDirectory& lazy, std::string_view what,
                                           const std::filesystem::path& parent,
                                           std::string_view relative, uid_t owner = 0,
                                           int protectionClass = -1);
    // A directory of the daemon's own: owned by root, writable by nobody
    // else (with `mode`), repaired when found otherwise.
    const std::filesystem::path& privateDirectory(QRNLazyDirectory& lazy, std::string_view what,
                                                  const std::filesystem::path& parent,
                                                  std::string_view relative, mode_t mode,
                                                  int protectionClass = -1);

    QRNDaemonContext& context_;
    QRNFileManager& fileManager_;
    const std::filesystem::path home_;
    std::uint32_t mobileUID_ = 0;
    std::uint32_t mobileGID_ = 0;

    // Guards internalImage_.
    std::mutex internalMutex_;
    std::optional<bool> internalImage_;

    QRNLazyDirectory sharedContainers_, log_, caches_, library_, transient_, transientBundle_,
        legacyTransientBundle_, staging_, deathrow_, scratch_, replace_, pendingUpdates_, bundle_;

    // Serialises containerDirectoryURLForUserIdentity.
    std::mutex containerDirectoryMutex_;
    // Guards perUser_.
    std::mutex perUserMutex_;
    std::unordered_map<QRNUserIdentityPtr, std::shared_ptr<QRNPerUserConfiguration>,
                       QRNUserIdentity::Hash, QRNUserIdentity::Equal>
        perUser_;
};

} // namespace quarn
