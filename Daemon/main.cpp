// quarnd: start-up in the order that keeps clients out until the boot work
// is done — initialisation is queued on the listener queue before the
// listener opens, so every connection waits behind it.

#include "Daemon/QRNDaemon.h"
#include "Daemon/QRNDaemonOptions.h"
#include "Daemon/platform/LinuxPlatform.h"
#include "Daemon/platform/Paths.h"
#include "Daemon/service/QRNVellService.h"
#include "Daemon/support/Log.h"
#include "Daemon/support/QRNDaemonContext.h"

#include <cstdio>
#include <cstdlib>
#include <memory>

int main(int argc, char** argv) {
    using namespace quarn;
    const QRNDaemonOptions::Parsed parsed = QRNDaemonOptions::parse(argc, argv);
    if (parsed.exitStatus) {
        std::fputs(parsed.output.c_str(), *parsed.exitStatus == 0 ? stdout : stderr);
        return *parsed.exitStatus;
    }
    const QRNDaemonOptions& options = parsed.options;
    // Before any thread exists, so that every thread inherits the mask.
    QRNDaemon::prepareSignals();
    Log::setLevel(options.logLevel);
    if (options.foreground) {
        Log::addStderr();
    }
    // Error descriptions keep paths as they are: nothing here localises them.

    auto context = std::make_shared<QRNDaemonContext>(options.root);
    installLinuxPlatform(*context);
    QRNDaemonContext::setCurrent(context);

    QRNDaemon daemon(context);
    daemon.submitInitialization();
    QRNVellService service(daemon.listenerQueue(), options.workerThreads);
    service.start(context->instance<Paths>());

    const int status = daemon.runMainLoop([&service] { service.stopAccepting(); });
    Log::sink()->flush();
    // Work that outlived the drain bound must not hold the exit up: leave
    // without running destructors that would wait for it.
    std::_Exit(status);
}
