#include "Daemon/platform/LinuxPlatform.h"

#include "Daemon/platform/ContainerLibrary.h"
#include "Daemon/platform/FirstBootMarker.h"
#include "Daemon/platform/LinuxAccounts.h"
#include "Daemon/platform/LinuxCodeSigningRegistry.h"
#include "Daemon/platform/LinuxFeatures.h"
#include "Daemon/platform/LinuxHostConfig.h"
#include "Daemon/platform/LinuxLockState.h"
#include "Daemon/platform/LinuxNotifications.h"
#include "Daemon/platform/LinuxOsVariant.h"
#include "Daemon/platform/LinuxSandboxExtensions.h"
#include "Daemon/platform/Paths.h"
#include "Daemon/platform/SandboxKernel.h"
#include "Daemon/support/QRNDaemonContext.h"

#include <memory>

namespace quarn {

void installLinuxPlatform(QRNDaemonContext& context) {
    const Paths paths(context.rootPrefix());
    context.install(std::make_shared<Paths>(paths));
    const auto accounts = std::make_shared<LinuxAccounts>(paths);
    context.install<Accounts>(accounts);
    context.install<OsVariant>(std::make_shared<LinuxOsVariant>(paths));
    context.install<Features>(std::make_shared<LinuxFeatures>(paths));
    context.install<HostConfig>(std::make_shared<LinuxHostConfig>(paths));
    context.install<LockState>(std::make_shared<LinuxLockState>(paths));
    context.install<ContainerLibrary>(std::make_shared<LinuxContainerLibrary>());
    context.install<SandboxKernel>(std::make_shared<InMemorySandboxKernel>());
    context.install<Notifications>(std::make_shared<LinuxNotifications>(paths));
    context.install<CodeSigningRegistry>(
        std::make_shared<LinuxCodeSigningRegistry>(paths, accounts));
    context.install<SandboxExtensions>(std::make_shared<LinuxSandboxExtensions>(paths));
    context.install(std::make_shared<FirstBootMarker>(paths.rootPrefix()));
}

} // namespace quarn
