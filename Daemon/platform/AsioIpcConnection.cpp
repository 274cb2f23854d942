#include "Daemon/platform/AsioIpcConnection.h"

#include "Daemon/platform/CborCodec.h"
#include "Daemon/platform/IpcFrame.h"
#include "Daemon/support/Log.h"

#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <exception>

namespace quarn {

namespace {

constexpr std::size_t kInitialReadBuffer = 16 * 1024;
// A buffer grown for a large frame is given back once it is drained, and
// the heap trimmed after a message this large was freed.
constexpr std::size_t kKeptReadBuffer = 64 * 1024;
constexpr std::size_t kKeptWriteBuffer = 64 * 1024;
// A client that leaves this much of its replies unread is not read from
// until it catches up.
constexpr std::size_t kMaxQueuedReplyBytes = 4 * 1024 * 1024;

// Room for the credentials only: descriptors a client sends along do not
// fit, so the kernel drops them instead of installing them here.
constexpr std::size_t kControlBytes = CMSG_SPACE(sizeof(ucred));

// The writer of the bytes one recvmsg returned. With SO_PASSCRED every
// read carries one, and the kernel never returns the bytes of two writers
// in one read.
IpcConnection::Sender senderOf(msghdr& message) {
    IpcConnection::Sender sender{0, static_cast<uid_t>(-1), static_cast<gid_t>(-1)};
    for (cmsghdr* c = CMSG_FIRSTHDR(&message); c; c = CMSG_NXTHDR(&message, c)) {
        if (c->cmsg_level != SOL_SOCKET) {
            continue;
        }
        if (c->cmsg_type == SCM_CREDENTIALS && c->cmsg_len >= CMSG_LEN(sizeof(ucred))) {
            ucred credentials;
            std::memcpy(&credentials, CMSG_DATA(c), sizeof credentials);
            sender = {credentials.pid, credentials.uid, credentials.gid};
        } else if (c->cmsg_type == SCM_RIGHTS) {
            // Should one fit after all, it is not kept.
            const std::size_t count = (c->cmsg_len - CMSG_LEN(0)) / sizeof(int);
            for (std::size_t i = 0; i < count; ++i) {
                int fd;
                std::memcpy(&fd, CMSG_DATA(c) + i * sizeof(int), sizeof fd);
                ::close(fd);
            }
        }
    }
    return sender;
}

// The process as SCM_CREDENTIALS names it: pid, real uid, real gid.
IpcConnection::Sender pinnedSender(const IpcPeer& peer) {
    const auto fields = IpcPeer::fieldsOfAuditToken(peer.auditToken());
    return {peer.pid(), fields.ruid, fields.rgid};
}

std::chrono::steady_clock::rep steadyNow() {
    return std::chrono::steady_clock::now().time_since_epoch().count();
}

} // namespace

AsioIpcConnection::AsioIpcConnection(std::shared_ptr<IpcServiceCore> core, Socket socket,
                                     IpcPeer peer, IpcExecFingerprint program, Limits limits)
    : core_(std::move(core)), socket_(std::move(socket)), executor_(socket_.get_executor()),
      fd_(socket_.native_handle()), peer_(std::move(peer)), program_(std::move(program)),
      pinned_(pinnedSender(peer_)), limits_(limits), partialTimer_(executor_),
      lastActivity_(steadyNow()) {}

AsioIpcConnection::~AsioIpcConnection() {
    core_->remove(this);
}

void AsioIpcConnection::setEventHandler(EventHandler handler) {
    std::lock_guard lock(pendingHandlerMutex_);
    pendingHandler_ = std::move(handler);
}

void AsioIpcConnection::resume() {
    if (!core_->post(executor_, [self = shared_from_this()] { self->onResume(); })) {
        // The service has stopped: drop what the handler holds.
        std::lock_guard lock(pendingHandlerMutex_);
        pendingHandler_ = nullptr;
    }
}

void AsioIpcConnection::cancel() {
    // Posted even from the context, so that a handler cancelling its own
    // connection hears Invalidated only after it has returned.
    endFromAnyThread();
}

void AsioIpcConnection::shutDown() {
    asio::post(executor_, [self = shared_from_this()] { self->end(); });
}

void AsioIpcConnection::endFromAnyThread() {
    core_->post(executor_, [self = shared_from_this()] { self->end(); });
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
    if (!greet()) {
        return;
    }
    readBuffer_.resize(kInitialReadBuffer);
    readMore();
}

// Bytes already waiting were written before the client could know who the
// daemon took it for: by the program it ran before an execve, perhaps.
bool AsioIpcConnection::greet() {
    std::uint8_t byte;
    ssize_t n;
    do {
        n = ::recv(fd_, &byte, 1, MSG_PEEK | MSG_DONTWAIT);
    } while (n < 0 && errno == EINTR);
    if (n > 0) {
        refuse("it wrote before the greeting");
        return false;
    }
    if (n == 0 || (errno != EAGAIN && errno != EWOULDBLOCK)) {
        end();
        return false;
    }
    sendFrame(IpcFrame::greeting());
    return !ended_;
}

bool AsioIpcConnection::readingPaused() {
    std::lock_guard lock(writeMutex_);
    return queuedBytes_ > kMaxQueuedReplyBytes;
}

// Waits for readiness and reads with recvmsg then, since asio's reads drop
// the credentials that come with the bytes.
void AsioIpcConnection::readMore() {
    if (!resumed_ || reading_ || ended_ || readingPaused()) {
        return;
    }
    reading_ = true;
    socket_.async_wait(
        Socket::wait_read,
        [self = shared_from_this()](const asio::error_code& error) { self->onReadable(error); });
}

void AsioIpcConnection::onReadable(const asio::error_code& error) {
    reading_ = false;
    if (ended_) {
        return;
    }
    if (error) {
        QRN_LOG_ERROR(LogCategory::Vell, "Reading from pid {} failed: {}", peer_.pid(),
                      error.message());
        return end();
    }
    switch (receive()) {
    case Received::Bytes:
        return deliverBufferedFrames();
    case Received::Again:
        return readMore();
    case Received::Ended:
        return;
    }
}

AsioIpcConnection::Received AsioIpcConnection::receive() {
    iovec space{readBuffer_.data() + readEnd_, readBuffer_.size() - readEnd_};
    alignas(cmsghdr) unsigned char control[kControlBytes];
    msghdr message{};
    message.msg_iov = &space;
    message.msg_iovlen = 1;
    message.msg_control = control;
    message.msg_controllen = sizeof control;
    ssize_t n;
    do {
        n = ::recvmsg(fd_, &message, MSG_DONTWAIT | MSG_CMSG_CLOEXEC);
    } while (n < 0 && errno == EINTR);
    if (n < 0 && (errno == EAGAIN || errno == EWOULDBLOCK)) {
        return Received::Again;
    }
    if (n < 0 && errno != ECONNRESET) {
        QRN_LOG_ERROR(LogCategory::Vell, "Reading from pid {} failed: {}", peer_.pid(),
                      std::strerror(errno));
    }
    if (n <= 0) {
        end();
        return Received::Ended;
    }
    // Another process (a child sharing the socket), or the same one with
    // other real ids, would be taken for the one identified at accept.
    if (const Sender sender = senderOf(message); sender != pinned_) {
        refuse(fmt::format("bytes written by pid {} (uid {}, gid {}), not by the process that "
                           "connected",
                           sender.pid, sender.uid, sender.gid));
        return Received::Ended;
    }
    readEnd_ += static_cast<std::size_t>(n);
    noteActivity();
    return Received::Bytes;
}

void AsioIpcConnection::noteActivity() {
    lastActivity_.store(steadyNow(), std::memory_order_relaxed);
}

// Hands every complete frame in the buffer to the handler, one after the
// other, then reads on.
void AsioIpcConnection::deliverBufferedFrames() {
    constexpr std::size_t kHeader = IpcFrame::kHeaderSize;
    bool consumed = false;
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
        consumed = true;
        unreadBytes_.store(readEnd_ - readStart_, std::memory_order_relaxed);
        if (!deliverFrame(body, header->expectsReply)) {
            return;
        }
    }
    if (ended_) {
        return;
    }
    unreadBytes_.store(readEnd_ - readStart_, std::memory_order_relaxed);
    notePartialFrame(consumed);
    readMore();
}

// Starts the clock of a frame begun, or stops it when none is.
void AsioIpcConnection::notePartialFrame(bool frameConsumed) {
    if (readEnd_ == readStart_) {
        frameBegan_.reset();
        return;
    }
    if (!frameBegan_ || frameConsumed) {
        frameBegan_ = std::chrono::steady_clock::now();
    }
    armPartialTimer();
}

void AsioIpcConnection::armPartialTimer() {
    if (partialTimerArmed_ || !frameBegan_) {
        return;
    }
    partialTimerArmed_ = true;
    partialTimer_.expires_at(*frameBegan_ + limits_.partialFrameTimeout);
    partialTimer_.async_wait([self = shared_from_this()](const asio::error_code& error) {
        self->onPartialTimer(error);
    });
}

void AsioIpcConnection::onPartialTimer(const asio::error_code& error) {
    partialTimerArmed_ = false;
    if (error || ended_ || !frameBegan_) {
        return;
    }
    if (std::chrono::steady_clock::now() - *frameBegan_ >= limits_.partialFrameTimeout) {
        return refuse(fmt::format("a frame begun was not finished within {} ms",
                                  limits_.partialFrameTimeout.count()));
    }
    armPartialTimer(); // another frame began since
}

// Makes room for more of a frame of `frameBytes` starting at the unread
// input. The buffer grows with the bytes that arrive, doubling, never to
// the announced length at once: announcing costs a client nothing.
void AsioIpcConnection::prepareBufferFor(std::size_t frameBytes) {
    const std::size_t unread = readEnd_ - readStart_;
    if (unread == 0) {
        readStart_ = readEnd_ = 0;
        if (readBuffer_.size() > kKeptReadBuffer) {
            readBuffer_.resize(kInitialReadBuffer);
            readBuffer_.shrink_to_fit();
            core_->trimMemory();
        }
    } else if (readStart_ > 0 && readStart_ + frameBytes > readBuffer_.size()) {
        std::memmove(readBuffer_.data(), readBuffer_.data() + readStart_, unread);
        readStart_ = 0;
        readEnd_ = unread;
    }
    if (readEnd_ == readBuffer_.size() && readBuffer_.size() < frameBytes) {
        readBuffer_.resize(
            std::min(frameBytes, std::max(readBuffer_.size() * 2, kInitialReadBuffer)));
    }
}

bool AsioIpcConnection::deliverFrame(std::span<const std::uint8_t> body, bool expectsReply) {
    auto decoded =
        CborCodec::decode(body, CborCodec::Limits{limits_.maxFrameBytes, limits_.maxNesting,
                                                  limits_.maxDecodedItems});
    if (!decoded) {
        refuse(fmt::format("the message does not decode: {}", decoded.error().message));
        return false;
    }
    if (!decoded->isDictionary()) {
        refuse(fmt::format("the message is a {}, not a dictionary", decoded->kindName()));
        return false;
    }
    // Checked last before the handler: an identity settled for one program
    // must not answer for another the process has exec'd since.
    if (!program_.matches()) {
        refuse("its process has exited or runs another program than when it connected");
        return false;
    }
    if (expectsReply) {
        awaitingReplies_.fetch_add(1, std::memory_order_relaxed);
    }
    {
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
    }
    if (body.size() > kKeptReadBuffer) {
        core_->trimMemory();
    }
    return !ended_;
}

void AsioIpcConnection::refuse(const std::string& why) {
    QRN_LOG_ERROR(LogCategory::Vell, "Closing the connection of pid {}: {}", peer_.pid(), why);
    end();
}

// Sends from the calling thread: the reply of a request goes out on the
// thread that ran it, without a hand-over to the connection's context.
void AsioIpcConnection::sendReply(const Value& reply) {
    int awaiting = awaitingReplies_.load(std::memory_order_relaxed);
    while (awaiting > 0 && !awaitingReplies_.compare_exchange_weak(awaiting, awaiting - 1,
                                                                   std::memory_order_relaxed)) {
    }
    sendFrame(reply);
}

void AsioIpcConnection::sendFrame(const Value& message) {
    std::lock_guard lock(writeMutex_);
    if (writeClosed_ || writeFailed_) {
        return;
    }
    noteActivity();
    encodeBuffer_.clear();
    const bool encoded = IpcFrame::appendMessage(message, false, encodeBuffer_);
    if (!encoded || encodeBuffer_.size() - IpcFrame::kHeaderSize > limits_.maxFrameBytes) {
        // The client could not read it: it learns why instead of waiting.
        QRN_LOG_ERROR(LogCategory::Vell,
                      "A reply to pid {} of {} bytes is over the limit of {}; an error goes "
                      "instead",
                      peer_.pid(), encodeBuffer_.size(), limits_.maxFrameBytes);
        encodeBuffer_.clear();
        IpcFrame::appendMessage(IpcFrame::oversizedReply(), false, encodeBuffer_);
    }
    if (!writeQueue_.empty() || awaitingWrite_) {
        // Behind earlier replies, which the context is writing.
        queuedBytes_ += encodeBuffer_.size();
        writeQueue_.push_back(std::move(encodeBuffer_));
        encodeBuffer_ = {};
        return;
    }
    if (!startWrite(encodeBuffer_)) {
        awaitingWrite_ = true;
        core_->post(executor_, [self = shared_from_this()] { self->awaitWritable(); });
    }
    if (encodeBuffer_.capacity() > kKeptWriteBuffer) {
        encodeBuffer_ = {};
    }
}

// Writes what the socket takes of `frame` now; the rest, if any, is queued
// and false answered (also after a failure, which ends the connection).
bool AsioIpcConnection::startWrite(std::vector<std::uint8_t>& frame) {
    std::size_t sent = 0;
    while (sent < frame.size()) {
        const ssize_t n =
            ::send(fd_, frame.data() + sent, frame.size() - sent, MSG_DONTWAIT | MSG_NOSIGNAL);
        if (n < 0 && errno == EINTR) {
            continue;
        }
        if (n < 0 && errno != EAGAIN && errno != EWOULDBLOCK) {
            QRN_LOG_DEBUG(LogCategory::Vell, "Writing to pid {} failed: {}", peer_.pid(),
                          std::strerror(errno));
            writeFailed_ = true;
            endFromAnyThread();
            return true;
        }
        if (n < 0) {
            break;
        }
        sent += static_cast<std::size_t>(n);
    }
    if (sent == frame.size()) {
        return true;
    }
    queuedBytes_ += frame.size();
    frontWritten_ = sent;
    writeQueue_.push_back(std::move(frame));
    frame = {};
    return false;
}

// Writes queued frames until the socket is full; true once the queue is
// empty (or the connection failed).
bool AsioIpcConnection::flushLocked() {
    while (!writeQueue_.empty() && !writeFailed_) {
        std::vector<std::uint8_t>& front = writeQueue_.front();
        const ssize_t n = ::send(fd_, front.data() + frontWritten_, front.size() - frontWritten_,
                                 MSG_DONTWAIT | MSG_NOSIGNAL);
        if (n < 0 && errno == EINTR) {
            continue;
        }
        if (n < 0 && (errno == EAGAIN || errno == EWOULDBLOCK)) {
            return false;
        }
        if (n < 0) {
            QRN_LOG_DEBUG(LogCategory::Vell, "Writing to pid {} failed: {}", peer_.pid(),
                          std::strerror(errno));
            writeFailed_ = true;
            break;
        }
        frontWritten_ += static_cast<std::size_t>(n);
        if (frontWritten_ < front.size()) {
            continue;
        }
        queuedBytes_ -= front.size();
        frontWritten_ = 0;
        writeQueue_.pop_front();
    }
    return true;
}

void AsioIpcConnection::awaitWritable() {
    if (ended_) {
        return;
    }
    socket_.async_wait(
        Socket::wait_write,
        [self = shared_from_this()](const asio::error_code& error) { self->onWritable(error); });
}

void AsioIpcConnection::onWritable(const asio::error_code& error) {
    if (ended_) {
        return;
    }
    bool failed = static_cast<bool>(error);
    bool more = false;
    {
        std::lock_guard lock(writeMutex_);
        if (!failed) {
            more = !flushLocked();
            failed = writeFailed_;
        }
        awaitingWrite_ = more && !failed;
    }
    if (failed) {
        return end();
    }
    if (more) {
        return awaitWritable();
    }
    readMore(); // in case a backlog of replies had stopped reading
}

bool AsioIpcConnection::idleSince(std::chrono::steady_clock::time_point cutoff) {
    if (awaitingReplies_.load(std::memory_order_relaxed) > 0 ||
        unreadBytes_.load(std::memory_order_relaxed) > 0 ||
        lastActivity_.load(std::memory_order_relaxed) >= cutoff.time_since_epoch().count()) {
        return false;
    }
    std::lock_guard lock(writeMutex_);
    return writeQueue_.empty() && !awaitingWrite_;
}

void AsioIpcConnection::end() {
    if (ended_) {
        return;
    }
    ended_ = true;
    partialTimer_.cancel();
    {
        std::lock_guard lock(writeMutex_);
        writeClosed_ = true;
        writeQueue_.clear();
        queuedBytes_ = 0;
    }
    asio::error_code ignored;
    socket_.close(ignored);
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
