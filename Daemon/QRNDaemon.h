#pragma once
// The daemon process around one daemon context: the listener queue on which
// initialisation runs before any connection is served, the main queue served
// by the main thread, the initialisation itself (log, boot setup, lock-state
// following, boot cleanups) and the main run loop that ends on SIGTERM or
// SIGINT.

#include "Daemon/support/ProcessTransaction.h"

#include <spdlog/sinks/sink.h>

#include <chrono>
#include <functional>
#include <memory>
#include <vector>

namespace quarn {

class LockState;
class QRNClientConnection;
class QRNDaemonContext;
class QRNLockStateFollower;
class Queue;

class QRNDaemon {
public:
    // How long a stop waits for background work before the process ends anyway.
    static constexpr std::chrono::seconds kDrainTimeout{10};
    // The platform's name of the lock-status change notification.
    static constexpr const char* kLockStatusNotification = "com.orvex.lockstate";

    explicit QRNDaemon(std::shared_ptr<QRNDaemonContext> context);
    // Stops following the lock state and takes the rotating log away again.
    ~QRNDaemon();
    QRNDaemon(const QRNDaemon&) = delete;
    QRNDaemon& operator=(const QRNDaemon&) = delete;

    // Blocks SIGTERM and SIGINT for signalfd and ignores SIGPIPE. Call on
    // the main thread before any other thread exists, so every thread
    // inherits the mask.
    static void prepareSignals();

    QRNDaemonContext& context() const { return *context_; }
    const std::shared_ptr<Queue>& listenerQueue() const { return listenerQueue_; }
    const std::shared_ptr<Queue>& mainQueue() const { return mainQueue_; }
    // Made by initialisation; none before.
    const std::shared_ptr<QRNLockStateFollower>& lockStateFollower() const { return follower_; }

    // Begins the start-up transaction and submits `quarnd_init` to the
    // listener queue. Call before the listener opens: the listener's events
    // then queue behind initialisation.
    void submitInitialization();
    // The initialisation block; ends `transaction` when initialisation is
    // done (the boot cleanups may still run).
    void quarnd_init(ProcessTransaction transaction);

    // Serves the main queue on the calling thread until SIGTERM or SIGINT,
    // then calls `stopAccepting`, waits (bounded) for the process
    // transactions to drain, and answers the exit status.
    int runMainLoop(const std::function<void()>& stopAccepting);

private:
    void openRotatingLog();
    void followLockState();
    void startCleanups(QRNClientConnection& connection, bool firstBoot);

    const std::shared_ptr<QRNDaemonContext> context_;
    const std::shared_ptr<Queue> listenerQueue_;
    const std::shared_ptr<Queue> mainQueue_;
    // Written by initialisation on the listener queue; read after it.
    std::shared_ptr<QRNLockStateFollower> follower_;
    std::shared_ptr<LockState> watchedLockState_;
    std::vector<spdlog::sink_ptr> logSinks_;
};

} // namespace quarn
