#include "Daemon/fs/QRNFileManager.h"

#include "Daemon/fs/Env.h"
#include "Daemon/fs/LinuxEnv.h"
#include "Daemon/platform/Paths.h"
#include "Daemon/support/ProtectionClassAttribute.h"
#include "Daemon/support/QRNDaemonContext.h"

#include <cerrno>
#include <cstring>
#include <fcntl.h>

namespace quarn {

static std::shared_ptr<Env> envOfContext(QRNDaemonContext& context) {
    if (context.has<Env>()) {
        return context.sharedInstance<Env>();
    }
    return std::make_shared<LinuxEnv>();
}

QRNFileManager::QRNFileManager(QRNDaemonContext& context)
    : QRNFileManager(context, envOfContext(context)) {}

QRNFileManager::QRNFileManager(QRNDaemonContext& context, std::shared_ptr<Env> env)
    : context_(&context), env_(std::move(env)),
      protectionAttribute_(ProtectionClassAttribute::attributeName()) {}

QRNFileManager& QRNFileManager::defaultManager() {
    return QRNDaemonContext::current().instance<QRNFileManager>();
}

const PathResolver& QRNFileManager::resolver() const {
    std::call_once(resolverOnce_, [this] {
        resolver_ = std::make_unique<PathResolver>(*env_, context_->instance<Paths>().rootPrefix());
    });
    return *resolver_;
}

Result<EnvFd> QRNFileManager::openDirectoryAtURL(const std::filesystem::path& url) {
    auto opened = resolver().open(url, O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_NONBLOCK);
    if (!opened) {
        const int err = opened.error();
        if (err != ENOENT) {
            QRN_LOG_ERROR(LogCategory::Fs, "open of directory {} failed: {}", url.string(),
                          std::strerror(err));
        }
        return QRN_UNEXPECTED(QRN_POSIX_ERROR(err, "open of directory {} failed: {}", url.string(),
                                              std::strerror(err)));
    }
    return std::move(*opened);
}

bool QRNFileManager::itemExistsInDirectory(const EnvFd& dir, const std::string& relative) {
    auto opened =
        env_->openat2(dir.get(), relative.c_str(), O_PATH | O_NOFOLLOW, 0, PathResolver::kBeneath);
    if (!opened) {
        return false;
    }
    EnvFd found(*env_, *opened);
    return true;
}

bool QRNFileManager::itemExistsAtURL(const std::filesystem::path& url) {
    return env_->fstatat(AT_FDCWD, url.c_str(), AT_SYMLINK_NOFOLLOW).has_value();
}

bool QRNFileManager::itemDoesNotExistAtURL(const std::filesystem::path& url) {
    return !itemExistsAtURL(url);
}

} // namespace quarn
