#include "Daemon/fs/QRNFileManager.h"

#include "Daemon/fs/Env.h"
#include "Daemon/fs/LinuxEnv.h"
#include "Daemon/support/ProtectionClassAttribute.h"
#include "Daemon/support/QRNDaemonContext.h"

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

bool QRNFileManager::itemExistsAtURL(const std::filesystem::path& url) {
    return env_->fstatat(AT_FDCWD, url.c_str(), AT_SYMLINK_NOFOLLOW).has_value();
}

bool QRNFileManager::itemDoesNotExistAtURL(const std::filesystem::path& url) {
    return !itemExistsAtURL(url);
}

} // namespace quarn
