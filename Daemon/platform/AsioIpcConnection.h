#pragma once
// A client connection of the request service on asio. Everything it does
// runs on its strand: reading frames, decoding them, calling the event
// handler synchronously (so the next frame is read only after the handler
// returned), writing replies and ending. Calls from other threads post to
// the strand.
//
// Pending asynchronous operations hold the connection alive.

#include "Daemon/platform/IpcConnection.h"
#include "Daemon/platform/IpcServiceCore.h"

#include <asio/local/stream_protocol.hpp>
#include <asio/strand.hpp>

#include <cstdint>
#include <deque>
#include <mutex>
#include <span>
#include <string>
#include <vector>

namespace quarn {

class AsioIpcConnection final : public IpcConnection,
                                public std::enable_shared_from_this<AsioIpcConnection> {
public:
    using Strand = asio::strand<asio::io_context::executor_type>;
    using Socket = asio::basic_stream_socket<asio::local::stream_protocol, Strand>;
    struct Limits {
        std::size_t maxFrameBytes = 0;
        std::size_t maxNesting = 0;
    };

    AsioIpcConnection(std::shared_ptr<IpcServiceCore> core, Socket socket, IpcPeer peer,
                      Limits limits);
    ~AsioIpcConnection() override;

    const IpcPeer& peer() const override { return peer_; }
    void setEventHandler(EventHandler handler) override;
    void resume() override;
    void sendReply(const Value& reply) override;
    void cancel() override;

    // Ends the connection on behalf of the listener's stop, which calls it
    // after refusing other work and before joining the pool.
    void shutDown();

private:
    void onResume();
    void readMore();
    void onRead(const asio::error_code& error, std::size_t bytes);
    void deliverBufferedFrames();
    bool deliverFrame(std::span<const std::uint8_t> body, bool expectsReply);
    void prepareBufferFor(std::size_t frameBytes);
    void refuse(const std::string& why);
    void queueReply(const Value& reply);
    void queueFrame(std::vector<std::uint8_t> frame);
    void writeNext();
    void onWritten(const asio::error_code& error);
    void end();
    void deliverInvalidated();

    // Declared first so that it outlives the socket and strand it runs.
    std::shared_ptr<IpcServiceCore> core_;
    Socket socket_;
    const Strand strand_; // the socket's, kept apart for calls from other threads
    const IpcPeer peer_;
    const Limits limits_;

    std::mutex pendingHandlerMutex_; // guards pendingHandler_
    EventHandler pendingHandler_;    // set by setEventHandler, taken by resume

    // The rest is touched on the strand only.
    EventHandler handler_;
    bool resumed_ = false;
    bool ended_ = false;
    bool invalidated_ = false;
    bool reading_ = false;
    bool writing_ = false;
    std::vector<std::uint8_t> readBuffer_; // [readStart_, readEnd_) is unread input
    std::size_t readStart_ = 0;
    std::size_t readEnd_ = 0;
    std::deque<std::vector<std::uint8_t>> writeQueue_;
    std::size_t queuedBytes_ = 0;
    std::vector<std::uint8_t> spareWriteBuffer_;
};

} // namespace quarn
