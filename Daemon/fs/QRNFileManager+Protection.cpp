// Reading and setting an item's data protection class.

#include "Daemon/fs/EnvFd.h"
#include "Daemon/fs/PathResolver.h"
#include "Daemon/fs/QRNFileManager.h"
#include "Daemon/platform/LockState.h"
#include "Daemon/support/ProtectionClassAttribute.h"
#include "Daemon/support/QRNDaemonContext.h"

#include <fmt/format.h>

#include <cerrno>
#include <cstring>
#include <fcntl.h>

namespace quarn {

namespace {

namespace fs = std::filesystem;

// The class whose keys are gone while the device is locked.
constexpr int kClassUnavailableWhileLocked = 1;

// Opens the item without following a link. Only files and directories can
// hold a class: those are reopened for reading through the descriptor's
// /proc entry (the same inode, never a link); anything else keeps its O_PATH
// descriptor, on which the attribute calls answer EBADF.
SysResult<EnvFd> openItem(Env& env, const PathResolver& resolver, const fs::path& url) {
    auto opened = resolver.open(url, O_PATH | O_NOFOLLOW);
    if (!opened) {
        return SysError(opened.error());
    }
    EnvFd item = std::move(*opened);
    auto st = env.fstat(item.get());
    if (!st) {
        return SysError(st.error());
    }
    if (!S_ISREG(st->st_mode) && !S_ISDIR(st->st_mode)) {
        return item;
    }
    const std::string proc = fmt::format("/proc/self/fd/{}", item.get());
    auto reopened = env.openat(AT_FDCWD, proc.c_str(), O_RDONLY | O_NONBLOCK | O_NOCTTY);
    if (!reopened) {
        return SysError(reopened.error());
    }
    return EnvFd(env, *reopened);
}

Error openError(const fs::path& url, int err) {
    return QRN_POSIX_ERROR(err, "Failed to open {} : {}", url.string(), std::strerror(err));
}

Error getClassError(const fs::path& url, int err) {
    return QRN_POSIX_ERROR(err, "Failed to getclass of file {}: {}", url.string(),
                           std::strerror(err));
}

Error setClassError(const fs::path& url, int protectionClass, int err) {
    return QRN_POSIX_ERROR(err, "Failed to setclass({}) on file {}: {}", protectionClass,
                           url.string(), std::strerror(err));
}

} // namespace

Result<int> QRNFileManager::dataProtectionClassOfItemAtURL(const fs::path& url) {
    auto item = openItem(*env_, resolver(), url);
    if (!item) {
        return QRN_UNEXPECTED(openError(url, item.error()));
    }
    auto current = ProtectionClassAttribute::getProtectionClass(item->get());
    if (!current) {
        return QRN_UNEXPECTED(getClassError(url, current.error()));
    }
    return *current;
}

Status QRNFileManager::setDataProtectionClassOfItemAtURL(const fs::path& url, int protectionClass,
                                                         std::function<bool(int)> predicate) {
    auto item = openItem(*env_, resolver(), url);
    if (!item) {
        return QRN_UNEXPECTED(openError(url, item.error()));
    }
    const bool locked = context_->instance<LockState>().isLocked();
    if (predicate || locked) {
        auto current = ProtectionClassAttribute::getProtectionClass(item->get());
        if (!current) {
            return QRN_UNEXPECTED(getClassError(url, current.error()));
        }
        if (predicate && !predicate(*current)) {
            return {};
        }
        // As on a device whose keys are gone: class 1 items stay as they are.
        if (locked && *current == kClassUnavailableWhileLocked && protectionClass != *current) {
            return QRN_UNEXPECTED(setClassError(url, protectionClass, EPERM));
        }
    }
    auto set = ProtectionClassAttribute::setProtectionClass(item->get(), protectionClass);
    if (!set) {
        return QRN_UNEXPECTED(setClassError(url, protectionClass, set.error()));
    }
    return {};
}

} // namespace quarn
