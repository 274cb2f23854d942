// Uniquely named temporary directories.

#include "Daemon/fs/Env.h"
#include "Daemon/fs/QRNFileManager.h"

#include <cerrno>
#include <cstring>

namespace quarn {

Result<std::filesystem::path>
QRNFileManager::createTemporaryDirectoryInDirectoryURL(const std::filesystem::path& directory,
                                                       std::string_view namePrefix) {
    const std::string pathTemplate = (directory / (std::string(namePrefix) + "XXXXXX")).string();
    // A prefix with a separator would make the directory somewhere else.
    auto made = namePrefix.find('/') == std::string_view::npos
                    ? env_->mkdtemp(pathTemplate)
                    : SysResult<std::string>(SysError(EINVAL));
    if (!made) {
        return QRN_UNEXPECTED(QRN_POSIX_ERROR(made.error(),
                                              "Failed to create temp dir at path {} : {}",
                                              pathTemplate, std::strerror(made.error())));
    }
    return std::filesystem::path(*made);
}

Result<std::filesystem::path>
QRNFileManager::createTemporaryDirectoryInDirectoryURL(const std::filesystem::path& directory) {
    return createTemporaryDirectoryInDirectoryURL(directory, kDefaultTemporaryPrefix);
}

} // namespace quarn
