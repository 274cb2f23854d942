#include "Daemon/QRNDaemon.h"

#include "Daemon/QRNLockStateFollower.h"
#include "Daemon/model/QRNGlobalConfiguration.h"
#include "Daemon/operations/QRNClientConnection.h"
#include "Daemon/platform/FirstBootMarker.h"
#include "Daemon/platform/LockState.h"
#include "Daemon/platform/Notifications.h"
#include "Daemon/support/LockStateQueue.h"
#include "Daemon/support/Log.h"
#include "Daemon/support/QRNDaemonContext.h"
#include "Daemon/support/Queue.h"
#include "Daemon/support/Signpost.h"

#include <syslog.h>
#include <systemd/sd-daemon.h>

#include <algorithm>
#include <cstdlib>
#include <cstring>
#include <exception>
#include <utility>

namespace quarn {

namespace {

// Rotated files kept, and the size at which the log rotates; internal
// builds keep more for diagnosis.
constexpr std::size_t kRotationCount = 1;
constexpr std::size_t kInternalRotationCount = 4;
constexpr std::size_t kMaxLogBytes = 102400;
constexpr std::size_t kInternalMaxLogBytes = 262144;

std::string systemErrorText(const Error& error) {
    return error.domain == Error::Domain::POSIX ? std::strerror(static_cast<int>(error.code))
                                                : error.description();
}

void firstBootCleanupDidComplete(const FirstBootMarker& marker, Notifications& notifications) {
    QRN_LOG_NOTICE(LogCategory::Startup, "quarnd first boot cleanup complete");
    // Made only now, so that a daemon stopped half way repeats the whole
    // first-boot work at its next start.
    if (auto created = marker.create(); !created) {
        QRN_LOG_ERROR(LogCategory::Startup, "Failed to create semaphore {}: {}", marker.name(),
                      systemErrorText(created.error()));
    }
    if (auto posted = notifications.post(Notifications::kRebootCleanupComplete); !posted) {
        QRN_LOG_ERROR(LogCategory::Startup, "Failed to post reboot-cleanup-complete: {}",
                      posted.error().code);
    }
}

} // namespace

QRNDaemon::QRNDaemon(std::shared_ptr<QRNDaemonContext> context)
    : context_(std::move(context)),
      listenerQueue_(std::make_shared<Queue>(Queue::ownerLabel("listener"))),
      mainQueue_(std::make_shared<Queue>(Queue::ownerLabel("main"), Queue::Kind::Manual)) {}

QRNDaemon::~QRNDaemon() {
    // Initialisation may still be queued; it uses this object.
    listenerQueue_->sync([] {});
    if (watchedLockState_) {
        watchedLockState_->stopWatching();
    }
    for (const spdlog::sink_ptr& sink : logSinks_) {
        Log::sink()->remove_sink(sink);
    }
}

void QRNDaemon::submitInitialization() {
    listenerQueue_->async([this, transaction = ProcessTransaction("quarnd_init")]() mutable {
        quarnd_init(std::move(transaction));
    });
}

void QRNDaemon::quarnd_init(ProcessTransaction transaction) {
    Signpost startingUp(LogCategory::Vell, "StartingUp");
    openRotatingLog();
    QRN_LOG_DEBUG(LogCategory::Startup, "quarnd built at {} {} started", __DATE__, __TIME__);
    std::shared_ptr<Queue> lockStateQueue;
    try {
        lockStateQueue = context_->instance<LockStateQueue>().queue();
    } catch (const std::exception&) {
        QRN_LOG_FAULT(LogCategory::Startup, "Can't create dispatch queue.");
        std::abort();
    }
    follower_ = std::make_shared<QRNLockStateFollower>(context_->sharedInstance<LockState>(),
                                                       std::move(lockStateQueue));
    QRNClientConnection& connection = context_->instance<QRNClientConnection>();
    const bool firstBoot = !context_->instance<FirstBootMarker>().exists();
    if (firstBoot) {
        QRN_LOG_NOTICE(LogCategory::Startup, "quarnd performing first boot initialization");
        Signpost firstBootSetup(LogCategory::Startup, "FirstBootSetup");
        connection.rebootQuarnManagerSetup();
    }
    {
        Signpost bootSetup(LogCategory::Startup, "BootSetup");
        connection.quarnManagerSetup();
    }
    // The kernel upcall server starts here once it exists.
    followLockState();
    // So that the lock-state queue starts in the right state.
    follower_->lockstated_notification_callback();
    startCleanups(connection, firstBoot);
    startingUp.end();
    transaction.end();
    sd_notify(0, "READY=1");
}

void QRNDaemon::openRotatingLog() {
    QRNGlobalConfiguration& configuration = context_->instance<QRNGlobalConfiguration>();
    const bool internal = configuration.isInternalImage();
    const std::filesystem::path& directory = configuration.logDirectory();
    const std::vector<spdlog::sink_ptr> before = Log::sink()->sinks();
    if (!Log::addRotatingFile(directory.string(), internal ? kInternalMaxLogBytes : kMaxLogBytes,
                              internal ? kInternalRotationCount : kRotationCount)) {
        const std::string message = fmt::format("Failed to set up rotating logs at path {}",
                                                (directory / "quarnd.log").string());
        // The daemon goes on without its own log; the system log hears why.
        syslog(LOG_ERR, "%s", message.c_str());
        QRN_LOG_ERROR(LogCategory::Startup, "{}", message);
        return;
    }
    for (const spdlog::sink_ptr& sink : Log::sink()->sinks()) {
        if (std::find(before.begin(), before.end(), sink) == before.end()) {
            logSinks_.push_back(sink);
        }
    }
}

void QRNDaemon::followLockState() {
    std::shared_ptr<LockState> lockState = context_->sharedInstance<LockState>();
    // The state is followed on the main queue, whatever thread reports it.
    Status watching =
        lockState->startWatching([follower = follower_, mainQueue = mainQueue_](std::int32_t) {
            mainQueue->async([follower] { follower->lockstated_notification_callback(); });
        });
    if (!watching) {
        QRN_LOG_ERROR(LogCategory::Startup,
                      "notification registration for \"{}\" failed; returned {}\n",
                      kLockStatusNotification, watching.error().code);
        return;
    }
    watchedLockState_ = std::move(lockState);
}

void QRNDaemon::startCleanups(QRNClientConnection& connection, bool firstBoot) {
    std::shared_ptr<Notifications> notifications = context_->sharedInstance<Notifications>();
    if (firstBoot) {
        auto signpost = std::make_shared<Signpost>(LogCategory::Startup, "FirstBootCleanup");
        connection.rebootQuarnManagerCleanupWithCompletion(
            [signpost, notifications, marker = context_->sharedInstance<FirstBootMarker>()] {
                firstBootCleanupDidComplete(*marker, *notifications);
                signpost->end();
            });
    }
    auto signpost = std::make_shared<Signpost>(LogCategory::Startup, "BootCleanup");
    connection.quarnManagerCleanupWithCompletion([signpost, notifications] {
        if (auto posted = notifications->post(Notifications::kCleanupComplete); !posted) {
            QRN_LOG_ERROR(LogCategory::Startup, "Failed to post cleanup-complete: {}",
                          posted.error().code);
        }
        signpost->end();
    });
}

} // namespace quarn
