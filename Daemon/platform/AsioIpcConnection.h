#pragma once
// A client connection of the request service on asio, pinned to one context
// of the pool (one thread). Reading, decoding, calling the event handler
// (inline, so the next frame is read only after the handler returned) and
// ending run on that context; calls from other threads post to it.
//
// Replies go out from the thread that sends them: straight onto the socket
// with a non-blocking send while nothing waits in the queue, else queued
// and written by the context once the socket takes more.
//
// Resuming sends the greeting, unless the client wrote first. Every read
// must carry the credentials of the pinned process (its pid and the real
// ids it had at accept) and every message is handed over only while that
// process runs the program it ran at accept. A frame begun is finished
// within the partial-frame timeout, or the connection is closed.
//
// Pending asynchronous operations hold the connection alive.

#include "Daemon/platform/IpcConnection.h"
#include "Daemon/platform/IpcExecFingerprint.h"
#include "Daemon/platform/IpcServiceCore.h"

#include <asio/local/stream_protocol.hpp>
#include <asio/steady_timer.hpp>

#include <atomic>
#include <chrono>
#include <cstdint>
#include <deque>
#include <mutex>
#include <optional>
#include <span>
#include <string>
#include <vector>

namespace quarn {

class AsioIpcConnection final : public IpcConnection,
                                public std::enable_shared_from_this<AsioIpcConnection> {
public:
    using Executor = asio::io_context::executor_type;
    using Socket = asio::basic_stream_socket<asio::local::stream_protocol, Executor>;
    struct Limits {
        std::size_t maxFrameBytes = 0;
        std::size_t maxNesting = 0;
        std::size_t maxDecodedItems = 0;
        std::chrono::milliseconds partialFrameTimeout{0};
    };

    // `socket` asks for its writers' credentials (SO_PASSCRED); `program`
    // was taken of the peer's process at accept.
    AsioIpcConnection(std::shared_ptr<IpcServiceCore> core, Socket socket, IpcPeer peer,
                      IpcExecFingerprint program, Limits limits);
    ~AsioIpcConnection() override;

    const IpcPeer& peer() const override { return peer_; }
    // Always the pinned process: bytes of any other close the connection.
    std::optional<Sender> messageSender() const override { return pinned_; }
    bool runsSameProgram() const override { return program_.matches(); }
    void setEventHandler(EventHandler handler) override;
    void resume() override;
    void sendReply(const Value& reply) override;
    void cancel() override;

    // Ends the connection on behalf of the listener's stop, which calls it
    // after refusing other work and before joining the pool.
    void shutDown();
    // Whether nothing is in flight (no request awaiting its reply, nothing
    // buffered in either direction) and nothing happened since `cutoff`.
    bool idleSince(std::chrono::steady_clock::time_point cutoff);

private:
    enum class Received { Bytes, Again, Ended };

    void onResume();
    bool greet();
    void readMore();
    void onReadable(const asio::error_code& error);
    Received receive();
    void notePartialFrame(bool frameConsumed);
    void armPartialTimer();
    void onPartialTimer(const asio::error_code& error);
    void noteActivity();
    void deliverBufferedFrames();
    bool deliverFrame(std::span<const std::uint8_t> body, bool expectsReply);
    void prepareBufferFor(std::size_t frameBytes);
    void refuse(const std::string& why);
    bool readingPaused();
    void sendFrame(const Value& message);

    bool flushLocked();
    bool startWrite(std::vector<std::uint8_t>& frame);
    void awaitWritable();
    void onWritable(const asio::error_code& error);
    void endFromAnyThread();
    void end();
    void deliverInvalidated();

    // Declared first so that it outlives the socket and context it runs.
    std::shared_ptr<IpcServiceCore> core_;
    Socket socket_;
    const Executor executor_; // the socket's, kept apart for calls from other threads
    const int fd_;            // the socket's; written to only under writeMutex_
    const IpcPeer peer_;
    const IpcExecFingerprint program_;
    const Sender pinned_; // pid, real uid and real gid at accept
    const Limits limits_;

    std::mutex pendingHandlerMutex_; // guards pendingHandler_
    EventHandler pendingHandler_;    // set by setEventHandler, taken by resume

    // The rest up to writeMutex_ is touched on the context only.
    EventHandler handler_;
    bool resumed_ = false;
    bool ended_ = false;
    bool invalidated_ = false;
    bool reading_ = false;
    std::vector<std::uint8_t> readBuffer_; // [readStart_, readEnd_) is unread input
    std::size_t readStart_ = 0;
    std::size_t readEnd_ = 0;
    asio::steady_timer partialTimer_;
    bool partialTimerArmed_ = false;
    // When the unread frame began, while one has.
    std::optional<std::chrono::steady_clock::time_point> frameBegan_;

    // Read by the listener from any thread for idle connections.
    std::atomic<std::size_t> unreadBytes_{0};
    std::atomic<int> awaitingReplies_{0};
    std::atomic<std::chrono::steady_clock::rep> lastActivity_{0};

    // Guards the fields below and every write to the socket: replies come
    // from any thread, and the bytes of two frames must not interleave.
    std::mutex writeMutex_;
    bool writeClosed_ = false;   // set by end(); later replies are dropped
    bool awaitingWrite_ = false; // the context waits for room and drains the queue
    bool writeFailed_ = false;   // an end is on its way
    std::deque<std::vector<std::uint8_t>> writeQueue_;
    std::size_t frontWritten_ = 0; // bytes of the front frame already sent
    std::size_t queuedBytes_ = 0;
    std::vector<std::uint8_t> encodeBuffer_;
};

} // namespace quarn
