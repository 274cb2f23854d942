#pragma once
// The named listener "com.orvex.quarnd": its socket (or the one systemd
// hands over) and the hand-over of each new connection to the listener
// queue, where the request protocol takes it. Since initialisation was
// queued there first, no connection is served before it has finished.

#include <cstddef>
#include <memory>
#include <string_view>

namespace quarn {

class IpcListener;
class Paths;
class Queue;

class QRNVellService {
public:
    static constexpr std::string_view kServiceName = "com.orvex.quarnd";

    QRNVellService(std::shared_ptr<Queue> listenerQueue, std::size_t workerThreads);
    ~QRNVellService();
    QRNVellService(const QRNVellService&) = delete;
    QRNVellService& operator=(const QRNVellService&) = delete;

    // Opens "<run>/com.orvex.quarnd.sock", or adopts systemd's socket of
    // that name. Logs "unable to start vell service!" and answers false on
    // failure.
    bool start(const Paths& paths);
    void stopAccepting();

private:
    const std::shared_ptr<Queue> listenerQueue_;
    const std::size_t workerThreads_;
    std::unique_ptr<IpcListener> listener_;
};

} // namespace quarn
