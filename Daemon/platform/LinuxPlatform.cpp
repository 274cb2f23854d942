#include "Daemon/platform/LinuxPlatform.h"

#include "Daemon/platform/Paths.h"
#include "Daemon/support/QRNDaemonContext.h"

#include <memory>

namespace quarn {

void installLinuxPlatform(QRNDaemonContext& context) {
    context.install(std::make_shared<Paths>(context.rootPrefix()));
}

} // namespace quarn
