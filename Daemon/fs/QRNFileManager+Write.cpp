// A new file written whole into an open directory.

#include "Daemon/fs/QRNFileManager.h"

#include <cerrno>
#include <charconv>
#include <cstring>
#include <fcntl.h>

namespace quarn {

namespace {

SysStatus writeAll(Env& env, int fd, std::span<const std::uint8_t> bytes) {
    while (!bytes.empty()) {
        auto written = env.write(fd, bytes.data(), bytes.size());
        if (!written) {
            return SysError(written.error());
        }
        if (*written == 0) {
            return SysError(EIO);
        }
        bytes = bytes.subspan(*written);
    }
    return {};
}

SysStatus setClass(Env& env, int fd, const char* attribute, int protectionClass) {
    char text[16];
    const auto converted = std::to_chars(text, text + sizeof text, protectionClass);
    return env.fsetxattr(fd, attribute, text, static_cast<std::size_t>(converted.ptr - text), 0);
}

} // namespace

Status QRNFileManager::createFileInDirectory(const EnvFd& directory,
                                             const std::filesystem::path& directoryURL,
                                             const std::string& name,
                                             std::span<const std::uint8_t> bytes,
                                             int protectionClass) {
    if (name.empty() || name == "." || name == ".." || name.find('/') != std::string::npos ||
        protectionClass < kProtectionClassUnchanged) {
        return QRN_UNEXPECTED(QRN_POSIX_ERROR(EINVAL, "Cannot create a file named {} in {}", name,
                                              directoryURL.string()));
    }
    auto opened =
        env_->openat(directory.get(), name.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW, 0644);
    if (!opened) {
        return QRN_UNEXPECTED(QRN_POSIX_ERROR(opened.error(), "Failed to create {}: {}",
                                              (directoryURL / name).string(),
                                              std::strerror(opened.error())));
    }
    EnvFd file(*env_, *opened);
    SysStatus done = writeAll(*env_, file.get(), bytes);
    if (done && protectionClass != kProtectionClassUnchanged) {
        done = setClass(*env_, file.get(), protectionAttribute_, protectionClass);
    }
    if (done) {
        done = file.close();
    }
    if (!done) {
        // Only a complete file may stay under its name.
        file.reset();
        (void)env_->unlinkat(directory.get(), name.c_str(), 0);
        return QRN_UNEXPECTED(QRN_POSIX_ERROR(done.error(), "Failed to write {}: {}",
                                              (directoryURL / name).string(),
                                              std::strerror(done.error())));
    }
    return {};
}

} // namespace quarn
