// The main run loop: the main thread serves the main queue until a
// terminating signal arrives through a signalfd, then stops accepting
// clients and gives background work a bounded time to finish.

#include "Daemon/QRNDaemon.h"

#include "Daemon/support/Log.h"
#include "Daemon/support/Queue.h"

#include <signal.h>
#include <sys/signalfd.h>
#include <systemd/sd-daemon.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <optional>
#include <thread>

namespace quarn {

namespace {

sigset_t terminationSignals() {
    sigset_t set;
    sigemptyset(&set);
    sigaddset(&set, SIGTERM);
    sigaddset(&set, SIGINT);
    return set;
}

// Waits for one terminating signal; answers its number, or nothing when
// the descriptor fails.
std::optional<int> awaitSignal(int fd) {
    signalfd_siginfo info{};
    while (true) {
        const ssize_t n = ::read(fd, &info, sizeof info);
        if (n == static_cast<ssize_t>(sizeof info)) {
            return static_cast<int>(info.ssi_signo);
        }
        if (n < 0 && errno == EINTR) {
            continue;
        }
        QRN_LOG_ERROR(LogCategory::Startup, "Reading the signal descriptor failed: {}",
                      n < 0 ? std::strerror(errno) : "short read");
        return std::nullopt;
    }
}

} // namespace

void QRNDaemon::prepareSignals() {
    const sigset_t set = terminationSignals();
    pthread_sigmask(SIG_BLOCK, &set, nullptr);
    // A client that goes away mid-reply must not end the daemon.
    signal(SIGPIPE, SIG_IGN);
}

int QRNDaemon::runMainLoop(const std::function<void()>& stopAccepting) {
    const sigset_t set = terminationSignals();
    const int fd = signalfd(-1, &set, SFD_CLOEXEC);
    if (fd < 0) {
        QRN_LOG_FAULT(LogCategory::Startup, "signalfd failed: {}; serving without a stop signal",
                      std::strerror(errno));
        mainQueue_->runUntil([] { return false; });
    }
    // Touched only by blocks of the main queue and by runUntil's check,
    // all on this thread.
    bool stopping = false;
    int received = 0;
    // The main queue has no descriptor to wait on, so one thread waits for
    // the signal and hands it to the main queue.
    std::thread watcher([this, fd, &stopping, &received] {
        const std::optional<int> signo = awaitSignal(fd);
        if (!signo) {
            return; // no stop signal can arrive any more: serve on
        }
        mainQueue_->async([&stopping, &received, signo = *signo] {
            received = signo;
            stopping = true;
        });
    });
    mainQueue_->runUntil([&stopping] { return stopping; });
    watcher.join();
    ::close(fd);

    QRN_LOG_NOTICE(LogCategory::Startup, "Stopping on signal {}", received);
    sd_notify(0, "STOPPING=1");
    if (stopAccepting) {
        stopAccepting();
    }
    if (!ProcessTransaction::waitForDrain(kDrainTimeout)) {
        QRN_LOG_ERROR(LogCategory::Startup,
                      "{} transactions still open after {} s; stopping anyway",
                      ProcessTransaction::count(), kDrainTimeout.count());
    }
    return 0;
}

} // namespace quarn
