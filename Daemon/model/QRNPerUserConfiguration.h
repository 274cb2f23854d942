#pragma once
// The directories of one user identity: its containers, staging and
// transient directories below "<home>/Containers", its library and the
// backup locations of system containers. Computed once and kept; the ones
// the daemon writes to are created on first use, owned by the user.

#include "Daemon/model/QRNLazyDirectory.h"
#include "Daemon/model/QRNUserIdentity.h"

#include <cstdint>
#include <filesystem>
#include <optional>

namespace quarn {

class QRNFileManager;

class QRNPerUserConfiguration {
public:
    QRNPerUserConfiguration(QRNFileManager& fileManager, QRNUserIdentityPtr userIdentity);
    QRNPerUserConfiguration(const QRNPerUserConfiguration&) = delete;
    QRNPerUserConfiguration& operator=(const QRNPerUserConfiguration&) = delete;

    const QRNUserIdentityPtr& userIdentity() const { return userIdentity_; }
    const std::filesystem::path& userHomeDirectory() const { return home_; }

    const std::filesystem::path& libraryDirectory();
    const std::filesystem::path& userBaseDirectory();
    const std::filesystem::path& transientDirectory();
    const std::filesystem::path& stagingDirectory();
    // Not created.
    const std::filesystem::path& oldLoggingPath();
    const std::filesystem::path& systemContainerBackupBaseDirectory();
    const std::filesystem::path& systemContainerBackupDirectory();
    const std::filesystem::path& systemGroupContainerBackupDirectory();

    // Per-user classes only; the directory is created. Nothing (and a log
    // line) for any other class.
    std::optional<std::filesystem::path> containerDirectoryURLForContentClass(std::uint64_t cls,
                                                                              bool transient);

private:
    const std::filesystem::path& directory(QRNLazyDirectory& lazy, std::string_view what,
                                           const std::filesystem::path& parent,
                                           std::string_view relative);

    QRNFileManager& fileManager_;
    const QRNUserIdentityPtr userIdentity_;
    const std::filesystem::path home_;
    QRNLazyDirectory library_, userBase_, transient_, staging_, oldLogging_, backupBase_, backup_,
        groupBackup_;
};

} // namespace quarn
