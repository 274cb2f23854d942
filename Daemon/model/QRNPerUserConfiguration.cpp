#include "Daemon/model/QRNPerUserConfiguration.h"

#include "Daemon/model/QRNContainerClass.h"
#include "Daemon/support/Log.h"

namespace quarn {

QRNPerUserConfiguration::QRNPerUserConfiguration(QRNFileManager& fileManager,
                                                 QRNUserIdentityPtr userIdentity)
    : fileManager_(fileManager), userIdentity_(std::move(userIdentity)),
      home_(userIdentity_->homeDirectoryURL()) {
    if (home_.empty()) {
        QRN_LOG_FAULT(LogCategory::Unspecified, "Home directory cannot be nil: {}",
                      userIdentity_->description());
    }
}

const std::filesystem::path& QRNPerUserConfiguration::directory(QRNLazyDirectory& lazy,
                                                                std::string_view what,
                                                                const std::filesystem::path& parent,
                                                                std::string_view relative) {
    auto compute = [&] { return parent / relative; };
    if (what.empty()) {
        return lazy.url(compute, fileManager_, nullptr);
    }
    QRNLazyDirectory::Creation creation{what, userIdentity_->posixUID(), -1};
    return lazy.url(compute, fileManager_, &creation);
}

const std::filesystem::path& QRNPerUserConfiguration::libraryDirectory() {
    return directory(library_, "user library dir", home_, "Library/Quarn");
}

const std::filesystem::path& QRNPerUserConfiguration::userBaseDirectory() {
    return directory(userBase_, "user base dir", home_, "Containers");
}

const std::filesystem::path& QRNPerUserConfiguration::transientDirectory() {
    return directory(transient_, "transient dir", userBaseDirectory(), "Temp");
}

const std::filesystem::path& QRNPerUserConfiguration::stagingDirectory() {
    return directory(staging_, "staging dir", userBaseDirectory(), "Staging");
}

const std::filesystem::path& QRNPerUserConfiguration::oldLoggingPath() {
    return directory(oldLogging_, {}, home_, "Library/Logs/Quarn");
}

const std::filesystem::path& QRNPerUserConfiguration::systemContainerBackupBaseDirectory() {
    return directory(backupBase_, {}, home_, "Library/Backup/SystemContainers");
}

const std::filesystem::path& QRNPerUserConfiguration::systemContainerBackupDirectory() {
    return directory(backup_, {}, systemContainerBackupBaseDirectory(), "Data");
}

const std::filesystem::path& QRNPerUserConfiguration::systemGroupContainerBackupDirectory() {
    return directory(groupBackup_, {}, systemContainerBackupBaseDirectory(), "Shared");
}

std::optional<std::filesystem::path>
QRNPerUserConfiguration::containerDirectoryURLForContentClass(std::uint64_t cls, bool transient) {
    if (!QRNContainerClass::isPerUser(cls)) {
        QRN_LOG_ERROR(LogCategory::Unspecified,
                      "Invalid class for a per user container directory: {}", cls);
        return std::nullopt;
    }
    auto url = (transient ? transientDirectory() : userBaseDirectory()) /
               QRNContainerClass::relativeDirectory(cls);
    QRNLazyDirectory::create(fileManager_, url, {"container dir", userIdentity_->posixUID(), -1});
    return url;
}

} // namespace quarn
