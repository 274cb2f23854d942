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

#include <malloc.h>
#include <sys/resource.h>

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <memory>

namespace {

// Every request may hold descriptors for its walks and the connections
// their own; the common default soft limit (1024) is soon reached. The soft
// limit goes up to the hard one (a kernel's own bound when that is
// unlimited).
void raiseDescriptorLimit() {
    using namespace quarn;
    constexpr rlim_t kUnlimitedCap = rlim_t{1} << 20;
    struct rlimit limit {};
    if (::getrlimit(RLIMIT_NOFILE, &limit) != 0) {
        QRN_LOG_ERROR(LogCategory::Unspecified, "Could not read the descriptor limit: {}",
                      std::strerror(errno));
        return;
    }
    const rlim_t wanted = limit.rlim_max == RLIM_INFINITY ? kUnlimitedCap : limit.rlim_max;
    if (wanted > limit.rlim_cur) {
        const rlim_t before = limit.rlim_cur;
        limit.rlim_cur = wanted;
        if (::setrlimit(RLIMIT_NOFILE, &limit) != 0) {
            QRN_LOG_ERROR(LogCategory::Unspecified,
                          "Could not raise the descriptor limit from {} to {}: {}", before, wanted,
                          std::strerror(errno));
            return;
        }
    }
    QRN_LOG_NOTICE(LogCategory::Unspecified, "Descriptor limit: {}{}", limit.rlim_cur,
                   limit.rlim_cur < 65536 ? " (the hard limit allows no more than this)" : "");
}

// A client may send large frames whose decoding takes many small blocks
// at once. With its default adaptive thresholds the allocator then keeps
// tens of megabytes for good after they are freed (a freed large block
// raises its trim threshold up to 32 MiB); fixed ones hand memory back to
// the system as soon as it is free.
void boundRetainedHeap() {
    constexpr int kMmapThreshold = 128 * 1024;
    constexpr int kTrimThreshold = 256 * 1024;
    if (::mallopt(M_MMAP_THRESHOLD, kMmapThreshold) != 1 ||
        ::mallopt(M_TRIM_THRESHOLD, kTrimThreshold) != 1) {
        QRN_LOG_ERROR(quarn::LogCategory::Unspecified, "Could not set the heap's trim thresholds");
    }
}

} // namespace

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
    raiseDescriptorLimit();
    boundRetainedHeap();
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
