// Uniquely named temporary directories, the daemon's root-only directories
// and the temporary files written in them.

#include "Daemon/fs/Env.h"
#include "Daemon/fs/QRNFileManager.h"

#include <cerrno>
#include <charconv>
#include <cstring>
#include <fcntl.h>
#include <random>

namespace quarn {

namespace {

constexpr mode_t kGroupOtherWrite = S_IWGRP | S_IWOTH;
constexpr int kRootOnlyDirectoryFlags = O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_NONBLOCK;
constexpr int kUniqueDirectoryAttempts = 100;

Unexpected<Error> posixError(int err, const std::string& what, const std::filesystem::path& url) {
    return QRN_UNEXPECTED(
        QRN_POSIX_ERROR(err, "{} {} failed: {}", what, url.string(), std::strerror(err)));
}

// Root owns it and nobody else may write (or, for a mode without any access
// for them, do anything) there.
bool isRootOnly(const struct stat& st, mode_t mode) {
    const mode_t forbidden = (mode & 077) == 0 ? mode_t(077) : kGroupOtherWrite;
    return st.st_uid == 0 && st.st_gid == 0 && (st.st_mode & forbidden) == 0;
}

std::string uniqueName(std::string_view prefix) {
    thread_local std::mt19937_64 random{std::random_device{}()};
    return fmt::format("{}{:012x}", prefix, random() & 0xffffffffffffULL);
}

// Writes every byte; answers 0 or an errno.
int writeAll(Env& env, int fd, std::span<const std::uint8_t> bytes) {
    while (!bytes.empty()) {
        auto written = env.write(fd, bytes.data(), bytes.size());
        if (!written) {
            return written.error();
        }
        bytes = bytes.subspan(*written);
    }
    return 0;
}

int setProtectionClass(Env& env, int fd, const char* attribute, int protectionClass) {
    char text[16];
    const auto converted = std::to_chars(text, text + sizeof text, protectionClass);
    auto set =
        env.fsetxattr(fd, attribute, text, static_cast<std::size_t>(converted.ptr - text), 0);
    return set ? 0 : set.error();
}

} // namespace

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

Result<EnvFd> QRNFileManager::openRootOnlyDirectoryAtURL(const std::filesystem::path& url,
                                                         mode_t mode) {
    // Usually there already: made only when missing.
    auto opened = resolver().open(url, kRootOnlyDirectoryFlags);
    Result<EnvFd> made =
        opened ? Result<EnvFd>(std::move(*opened))
        : opened.error() == ENOENT
            ? createAndOpenDirectoryAtURL(url, true, mode, 0, kProtectionClassUnchanged)
            : posixError(opened.error(), "open of", url);
    if (!made) {
        return made;
    }
    auto st = env_->fstat(made->get());
    if (!st) {
        return posixError(st.error(), "stat of", url);
    }
    if (isRootOnly(*st, mode)) {
        return made;
    }
    QRN_LOG_ERROR(LogCategory::Fs, "Repairing {}: owner {}:{} mode {:o}, expected root and {:o}",
                  url.string(), st->st_uid, st->st_gid, st->st_mode & 07777, mode);
    if (auto chowned = env_->fchown(made->get(), 0, 0); !chowned) {
        return posixError(chowned.error(), "chown of", url);
    }
    if (auto chmodded = env_->fchmod(made->get(), mode); !chmodded) {
        return posixError(chmodded.error(), "chmod of", url);
    }
    return made;
}

Result<EnvFd> QRNFileManager::createTemporaryFileInDirectory(const EnvFd& dir,
                                                             const std::filesystem::path& dirURL,
                                                             const std::string& name) {
    auto st = env_->fstat(dir.get());
    if (!st) {
        return posixError(st.error(), "stat of", dirURL);
    }
    if (st->st_uid != 0 || (st->st_mode & kGroupOtherWrite) != 0) {
        QRN_LOG_ERROR(LogCategory::Fs, "Refusing a temporary file in {}: others may write there",
                      dirURL.string());
        return posixError(EPERM, "temporary file in", dirURL);
    }
    auto opened =
        env_->openat(dir.get(), name.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW, 0644);
    if (!opened) {
        QRN_LOG_ERROR(LogCategory::Fs, "Failed to create temporary file {}: {}",
                      (dirURL / name).string(), std::strerror(opened.error()));
        return posixError(opened.error(), "create of", dirURL / name);
    }
    return EnvFd(*env_, *opened);
}

Status QRNFileManager::replaceFileInDirectory(const EnvFd& directory,
                                              const std::filesystem::path& directoryURL,
                                              const std::string& name,
                                              std::span<const std::uint8_t> bytes,
                                              const FileReplacement& replacement) {
    auto scratch = openRootOnlyDirectoryAtURL(replacement.scratchDirectory, 0700);
    if (!scratch) {
        return QRN_UNEXPECTED(scratch.error());
    }
    const char* temporary = replacement.temporaryName.c_str();
    // Only a crash leaves one behind, and nobody else can write here.
    (void)env_->unlinkat(scratch->get(), temporary, 0);
    auto file = createTemporaryFileInDirectory(*scratch, replacement.scratchDirectory, temporary);
    if (!file) {
        return QRN_UNEXPECTED(file.error());
    }
    int err = writeAll(*env_, file->get(), bytes);
    if (err == 0 && replacement.protectionClass >= 0) {
        err = setProtectionClass(*env_, file->get(), protectionAttribute_,
                                 replacement.protectionClass);
    }
    if (auto closed = file->close(); err == 0 && !closed) {
        err = closed.error();
    }
    if (err == 0) {
        auto renamed = env_->renameat(scratch->get(), temporary, directory.get(), name.c_str());
        err = renamed ? 0 : renamed.error();
    }
    if (err != 0) {
        (void)env_->unlinkat(scratch->get(), temporary, 0);
        QRN_LOG_ERROR(LogCategory::Fs, "Failed to replace {}: {}", (directoryURL / name).string(),
                      std::strerror(err));
        return posixError(err, "replacing", directoryURL / name);
    }
    return {};
}

Result<std::filesystem::path> QRNFileManager::moveItemInDirectoryToNewUniqueDirectory(
    const EnvFd& srcDir, const std::filesystem::path& srcDirURL, const std::string& name,
    const std::filesystem::path& directory) {
    auto parent = openRootOnlyDirectoryAtURL(directory, 0700);
    if (!parent) {
        return QRN_UNEXPECTED(parent.error());
    }
    std::string unique;
    SysStatus made = SysError(EEXIST);
    for (int attempt = 0; attempt < kUniqueDirectoryAttempts && !made && made.error() == EEXIST;
         ++attempt) {
        unique = uniqueName(kDefaultTemporaryPrefix);
        made = env_->mkdirat(parent->get(), unique.c_str(), 0700);
    }
    if (!made) {
        return QRN_UNEXPECTED(QRN_POSIX_ERROR(made.error(),
                                              "Failed to create temp dir at path {} : {}",
                                              directory.string(), std::strerror(made.error())));
    }
    auto opened = env_->openat(parent->get(), unique.c_str(), O_PATH | O_DIRECTORY | O_NOFOLLOW);
    Status moved = opened ? Status() : posixError(opened.error(), "open of", directory / unique);
    if (opened) {
        const EnvFd target(*env_, *opened);
        moved = moveItemInDirectory(srcDir, srcDirURL, name, target, directory / unique, name);
    }
    if (!moved) {
        // Nothing was parked in it.
        (void)env_->unlinkat(parent->get(), unique.c_str(), AT_REMOVEDIR);
        return QRN_UNEXPECTED(moved.error());
    }
    return directory / unique / name;
}

} // namespace quarn
