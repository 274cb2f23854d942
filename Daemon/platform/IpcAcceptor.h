#pragma once
// The listening side of the request service: accepts one connection at a
// time on the first context, gives it a slot of its uid's share, identifies
// and pins its peer (pidfd and program), pins it to a context of the pool
// and hands it, not yet resumed, to the listener's connection handler.
// Once slots run short, idle connections are closed to make room.

#include "Daemon/platform/AsioIpcConnection.h"
#include "Daemon/platform/IpcListener.h"

#include <asio/steady_timer.hpp>

#include <mutex>

namespace quarn {

class IpcAcceptor : public std::enable_shared_from_this<IpcAcceptor> {
public:
    // Connections that get no slot are closed as accepted.
    IpcAcceptor(std::shared_ptr<IpcServiceCore> core, const IpcListener::Options& options,
                IpcListener::ConnectionHandler handler);

    // Takes ownership of `listeningFd`, closing it on failure.
    Status adopt(int listeningFd);
    void start();
    // Stops accepting; idempotent.
    void close();

private:
    void acceptNext();
    void onAccepted(const asio::error_code& error, AsioIpcConnection::Socket socket);
    void handOver(AsioIpcConnection::Socket socket);
    std::shared_ptr<AsioIpcConnection> connectionFor(AsioIpcConnection::Socket socket);
    void closeIdleConnections();
    void backOff();

    // Declared first so that it outlives the acceptor and timer it runs.
    std::shared_ptr<IpcServiceCore> core_;
    const AsioIpcConnection::Limits limits_;
    const std::size_t reapIdleAbove_;
    const std::chrono::milliseconds idleTimeout_;
    const IpcListener::ConnectionHandler handler_;
    // Guards acceptor_, backOffTimer_ and closed_: asio objects are not safe
    // to use from two threads at once, and close() comes from any thread.
    std::mutex mutex_;
    asio::local::stream_protocol::acceptor acceptor_;
    asio::steady_timer backOffTimer_;
    bool closed_ = false;
};

} // namespace quarn
