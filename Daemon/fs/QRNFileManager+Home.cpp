// The home directory of a uid, from the account database.

#include "Daemon/fs/Env.h"
#include "Daemon/fs/QRNFileManager.h"
#include "Daemon/platform/Accounts.h"
#include "Daemon/platform/Paths.h"
#include "Daemon/support/QRNDaemonContext.h"

namespace quarn {

std::filesystem::path QRNFileManager::homeDirectoryURLForPOSIXUID(uid_t uid) {
    auto& context = QRNDaemonContext::current();
    auto& manager = context.instance<QRNFileManager>();
    auto user = context.instance<Accounts>().userByUID(uid);
    if (!user) {
        QRN_LOG_ERROR(LogCategory::Fs, "Failed to getpwuid for uid: {}", uid);
    } else if (!user->homeDirectory.empty()) {
        auto real = manager.env().realpath(user->homeDirectory.c_str());
        if (real) {
            return *real;
        }
    }
    QRN_LOG_ERROR(LogCategory::Fs, "Failed to get home dir using getpwuid for uid: {}", uid);
    return context.instance<Paths>().resolve("/private/var/mobile");
}

} // namespace quarn
