#include "Daemon/platform/LinuxPlatform.h"

#include "Daemon/platform/LinuxAccounts.h"
#include "Daemon/platform/Paths.h"
#include "Daemon/support/QRNDaemonContext.h"

#include <memory>

namespace quarn {

void installLinuxPlatform(QRNDaemonContext& context) {
    const Paths paths(context.rootPrefix());
    context.install(std::make_shared<Paths>(paths));
    context.install<Accounts>(std::make_shared<LinuxAccounts>(paths));
}

} // namespace quarn
