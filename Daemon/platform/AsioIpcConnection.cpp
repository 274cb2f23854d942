#include "Daemon/platform/AsioIpcConnection.h"

#include "Daemon/platform/CborCodec.h"
#include "Daemon/platform/IpcFrame.h"
#include "Daemon/support/Log.h"

#include <asio/write.hpp>

#include <cstring>
#include <exception>

namespace quarn {

namespace {

constexpr std::size_t kInitialReadBuffer = 16 * 1024;
// A buffer grown for a large frame is given back once it is drained.
constexpr std::size_t kKeptReadBuffer = 64 * 1024;
constexpr std::size_t kKeptWriteBuffer = 64 * 1024;
// A client that leaves this much of its replies unread is not read from
// until it catches up.
constexpr std::size_t kMaxQueuedReplyBytes = 4 * 1024 * 1024;

} // namespace

AsioIpcConnection::AsioIpcConnection(std::shared_ptr<IpcServiceCore> core, Socket socket,
                                     IpcPeer peer, Limits limits)
    : core_(std::move(core)), socket_(std::move(socket)), strand_(socket_.get_executor()),
      peer_(std::move(peer)), limits_(limits) {}

AsioIpcConnection::~AsioIpcConnection() {
    core_->remove(this);
}

void AsioIpcConnection::setEventHandler(EventHandler handler) {
    std::lock_guard lock(pendingHandlerMutex_);
    pendingHandler_ = std::move(handler);
}

void AsioIpcConnection::resume() {
    if (!core_->post(strand_, [self = shared_from_this()] { self->onResume(); })) {
        // The service has stopped: drop what the handler holds.
        std::lock_guard lock(pendingHandlerMutex_);
        pendingHandler_ = nullptr;
    }
}

void AsioIpcConnection::cancel() {
    // Posted even from the strand, so that a handler cancelling its own
    // connection hears Invalidated only after it has returned.
    core_->post(strand_, [self = shared_from_this()] { self->end(); });
}

void AsioIpcConnection::shutDown() {
    asio::post(strand_, [self = shared_from_this()] { self->end(); });
}

void AsioIpcConnection::sendReply(const Value& reply) {
    if (strand_.running_in_this_thread()) {
        queueReply(reply);
        return;
    }
    std::vector<std::uint8_t> frame;
    if (!IpcFrame::appendMessage(reply, false, frame)) {
        return;
    }
    core_->post(strand_, [self = shared_from_this(), frame = std::move(frame)]() mutable {
        self->queueFrame(std::move(frame));
    });
}

void AsioIpcConnection::onResume() {
    if (resumed_) {
        return;
    }
    resumed_ = true;
    {
        std::lock_guard lock(pendingHandlerMutex_);
        handler_ = std::move(pendingHandler_);
        pendingHandler_ = nullptr;
    }
    if (ended_) {
        return deliverInvalidated();
    }
    if (!handler_) {
        QRN_LOG_FAULT(LogCategory::Vell, "The connection of pid {} was resumed without a handler",
                      peer_.pid());
        return end();
    }
    readBuffer_.resize(kInitialReadBuffer);
    readMore();
}

void AsioIpcConnection::readMore() {
    if (!resumed_ || reading_ || ended_ || queuedBytes_ > kMaxQueuedReplyBytes) {
        return;
    }
    reading_ = true;
    socket_.async_read_some(
        asio::buffer(readBuffer_.data() + readEnd_, readBuffer_.size() - readEnd_),
        [self = shared_from_this()](const asio::error_code& error, std::size_t bytes) {
            self->onRead(error, bytes);
        });
}

void AsioIpcConnection::onRead(const asio::error_code& error, std::size_t bytes) {
    reading_ = false;
    if (ended_) {
        return;
    }
    if (error) {
        if (error != asio::error::eof && error != asio::error::connection_reset) {
            QRN_LOG_ERROR(LogCategory::Vell, "Reading from pid {} failed: {}", peer_.pid(),
                          error.message());
        }
        return end();
    }
    readEnd_ += bytes;
    deliverBufferedFrames();
}

// Hands every complete frame in the buffer to the handler, one after the
// other, then reads on.
void AsioIpcConnection::deliverBufferedFrames() {
    constexpr std::size_t kHeader = IpcFrame::kHeaderSize;
    while (!ended_) {
        const std::size_t unread = readEnd_ - readStart_;
        if (unread < kHeader) {
            prepareBufferFor(kHeader);
            break;
        }
        const std::span<const std::uint8_t, kHeader> headerBytes(readBuffer_.data() + readStart_,
                                                                 kHeader);
        const auto header = IpcFrame::decodeHeader(headerBytes);
        if (!header) {
            return refuse(fmt::format("the flag byte {:#04x} has reserved bits set",
                                      headerBytes[kHeader - 1]));
        }
        if (header->length > limits_.maxFrameBytes) {
            return refuse(fmt::format("a frame of {} bytes is over the limit of {}", header->length,
                                      limits_.maxFrameBytes));
        }
        const std::size_t frameBytes = kHeader + header->length;
        if (unread < frameBytes) {
            prepareBufferFor(frameBytes);
            break;
        }
        const std::span<const std::uint8_t> body(readBuffer_.data() + readStart_ + kHeader,
                                                 header->length);
        readStart_ += frameBytes;
        if (!deliverFrame(body, header->expectsReply)) {
            return;
        }
    }
    readMore();
}

// Makes room for a frame of `frameBytes` starting at the unread input.
void AsioIpcConnection::prepareBufferFor(std::size_t frameBytes) {
    const std::size_t unread = readEnd_ - readStart_;
    if (unread == 0) {
        readStart_ = readEnd_ = 0;
        if (readBuffer_.size() > kKeptReadBuffer) {
            readBuffer_.resize(kInitialReadBuffer);
            readBuffer_.shrink_to_fit();
        }
    } else if (readStart_ + frameBytes > readBuffer_.size()) {
        std::memmove(readBuffer_.data(), readBuffer_.data() + readStart_, unread);
        readStart_ = 0;
        readEnd_ = unread;
    }
    if (readBuffer_.size() < frameBytes) {
        readBuffer_.resize(frameBytes);
    }
}

bool AsioIpcConnection::deliverFrame(std::span<const std::uint8_t> body, bool expectsReply) {
    auto decoded =
        CborCodec::decode(body, CborCodec::Limits{limits_.maxFrameBytes, limits_.maxNesting});
    if (!decoded) {
        refuse(fmt::format("the message does not decode: {}", decoded.error().message));
        return false;
    }
    if (!decoded->isDictionary()) {
        refuse(fmt::format("the message is a {}, not a dictionary", decoded->kindName()));
        return false;
    }
    Event event;
    event.kind = Event::Kind::Message;
    event.body = std::move(*decoded);
    event.expectsReply = expectsReply;
    try {
        handler_(shared_from_this(), event);
    } catch (const std::exception& e) {
        QRN_LOG_FAULT(LogCategory::Vell, "The handler of a message of pid {} threw: {}",
                      peer_.pid(), e.what());
        end();
    }
    return !ended_;
}

void AsioIpcConnection::refuse(const std::string& why) {
    QRN_LOG_ERROR(LogCategory::Vell, "Closing the connection of pid {}: {}", peer_.pid(), why);
    end();
}

void AsioIpcConnection::queueReply(const Value& reply) {
    if (ended_) {
        return;
    }
    std::vector<std::uint8_t> frame = std::move(spareWriteBuffer_);
    frame.clear();
    if (IpcFrame::appendMessage(reply, false, frame)) {
        queueFrame(std::move(frame));
    }
}

void AsioIpcConnection::queueFrame(std::vector<std::uint8_t> frame) {
    if (ended_) {
        return;
    }
    queuedBytes_ += frame.size();
    writeQueue_.push_back(std::move(frame));
    if (!writing_) {
        writeNext();
    }
}

// One write at a time: frames of two writes could interleave otherwise.
void AsioIpcConnection::writeNext() {
    writing_ = true;
    asio::async_write(socket_, asio::buffer(writeQueue_.front()),
                      [self = shared_from_this()](const asio::error_code& error, std::size_t) {
                          self->onWritten(error);
                      });
}

void AsioIpcConnection::onWritten(const asio::error_code& error) {
    writing_ = false;
    if (ended_) {
        writeQueue_.clear();
        return;
    }
    if (error) {
        QRN_LOG_DEBUG(LogCategory::Vell, "Writing to pid {} failed: {}", peer_.pid(),
                      error.message());
        return end();
    }
    queuedBytes_ -= writeQueue_.front().size();
    if (writeQueue_.front().capacity() <= kKeptWriteBuffer) {
        spareWriteBuffer_ = std::move(writeQueue_.front());
    }
    writeQueue_.pop_front();
    if (!writeQueue_.empty()) {
        writeNext();
    }
    readMore(); // in case a backlog of replies had stopped reading
}

void AsioIpcConnection::end() {
    if (ended_) {
        return;
    }
    ended_ = true;
    asio::error_code ignored;
    socket_.close(ignored);
    // A write in flight still points into the front buffer.
    while (writeQueue_.size() > (writing_ ? 1 : 0)) {
        writeQueue_.pop_back();
    }
    queuedBytes_ = 0;
    const std::size_t open = core_->remove(this);
    QRN_LOG_DEBUG(LogCategory::Vell, "Connection of pid {} ended; {} open", peer_.pid(), open);
    deliverInvalidated();
}

void AsioIpcConnection::deliverInvalidated() {
    if (!resumed_ || invalidated_) {
        return;
    }
    invalidated_ = true;
    // Released after the call: a handler that holds its connection would
    // otherwise keep both alive.
    EventHandler handler = std::move(handler_);
    handler_ = nullptr;
    if (!handler) {
        return;
    }
    Event event;
    event.kind = Event::Kind::Invalidated;
    try {
        handler(shared_from_this(), event);
    } catch (const std::exception& e) {
        QRN_LOG_FAULT(LogCategory::Vell, "The handler of pid {} threw at the end: {}", peer_.pid(),
                      e.what());
    }
}

} // namespace quarn
