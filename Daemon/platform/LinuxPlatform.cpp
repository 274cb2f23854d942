#include "Daemon/platform/LinuxPlatform.h"

#include "Daemon/platform/LinuxAccounts.h"
#include "Daemon/platform/LinuxHostConfig.h"
#include "Daemon/platform/LinuxLockState.h"
#include "Daemon/platform/LinuxOsVariant.h"
#include "Daemon/platform/Paths.h"
#include "Daemon/support/QRNDaemonContext.h"

#include <memory>

namespace quarn {

void installLinuxPlatform(QRNDaemonContext& context) {
    const Paths paths(context.rootPrefix());
    context.install(std::make_shared<Paths>(paths));
    context.install<Accounts>(std::make_shared<LinuxAccounts>(paths));
    context.install<OsVariant>(std::make_shared<LinuxOsVariant>(paths));
    context.install<HostConfig>(std::make_shared<LinuxHostConfig>(paths));
    context.install<LockState>(std::make_shared<LinuxLockState>(paths));
}

} // namespace quarn
