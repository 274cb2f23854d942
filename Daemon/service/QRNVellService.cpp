#include "Daemon/service/QRNVellService.h"

#include "Daemon/platform/IpcListener.h"
#include "Daemon/platform/Paths.h"
#include "Daemon/service/QRNClientIdentityCache.h"
#include "Daemon/service/QRNVellEvent.h"
#include "Daemon/support/Log.h"
#include "Daemon/support/Queue.h"

#include <string>
#include <utility>

namespace quarn {

QRNVellService::QRNVellService(std::shared_ptr<Queue> listenerQueue, std::size_t workerThreads)
    : listenerQueue_(std::move(listenerQueue)), workerThreads_(workerThreads) {}

QRNVellService::~QRNVellService() = default;

bool QRNVellService::start(const Paths& paths) {
    IpcListener::Options options;
    options.socketPath = paths.runDirectory() / (std::string(kServiceName) + ".sock");
    options.inheritedFd = IpcListener::socketFromSystemd(kServiceName);
    options.workerThreads = workerThreads_;
    listener_ = std::make_unique<IpcListener>(std::move(options));
    Status started =
        listener_->start([queue = listenerQueue_](std::shared_ptr<IpcConnection> connection) {
            // Behind initialisation on the listener queue.
            queue->async([connection = std::move(connection)] {
                // Who the client is is settled now, before the greeting lets
                // it write. The connection's events come one at a time, so
                // its identity needs no lock.
                auto identity = std::make_shared<QRNClientIdentityCache>(*connection);
                connection->setEventHandler([identity](const std::shared_ptr<IpcConnection>& c,
                                                       const IpcConnection::Event& e) {
                    QRNProcessVellEvent(c, e, *identity);
                });
                // Quality-of-service classes have no meaning here.
                connection->resume();
            });
        });
    if (!started) {
        QRN_LOG_ERROR(LogCategory::Vell, "unable to start vell service!");
        listener_.reset();
        return false;
    }
    return true;
}

void QRNVellService::stopAccepting() {
    if (listener_) {
        listener_->stopAccepting();
    }
}

} // namespace quarn
