#include "Daemon/platform/IpcAcceptor.h"

#include "Daemon/support/Log.h"

#include <cerrno>
#include <chrono>
#include <cstring>
#include <exception>
#include <fcntl.h>
#include <sys/socket.h>
#include <unistd.h>

namespace quarn {

namespace {

// Out of descriptors or memory the listening socket stays readable; waiting
// a little keeps the pool from spinning on it.
constexpr std::chrono::milliseconds kBackOff{100};

// Every message then carries the credentials of the process that wrote it.
// Set on the listening socket too: an accepted socket inherits it, so no
// byte written between accept and the setsockopt below goes unstamped.
bool passCredentials(int fd) {
    const int on = 1;
    return ::setsockopt(fd, SOL_SOCKET, SO_PASSCRED, &on, sizeof on) == 0;
}

bool isResourceShortage(const asio::error_code& error) {
    if (error.category() != asio::system_category()) {
        return false;
    }
    const int err = error.value();
    return err == EMFILE || err == ENFILE || err == ENOBUFS || err == ENOMEM;
}

} // namespace

IpcAcceptor::IpcAcceptor(std::shared_ptr<IpcServiceCore> core, const IpcListener::Options& options,
                         IpcListener::ConnectionHandler handler)
    : core_(std::move(core)), limits_{options.maxFrameBytes, options.maxNesting,
                                      options.maxDecodedItems, options.partialFrameTimeout},
      reapIdleAbove_(options.reapIdleAbove), idleTimeout_(options.idleTimeout),
      handler_(std::move(handler)), acceptor_(core_->io(IpcServiceCore::kAcceptorContext)),
      backOffTimer_(core_->io(IpcServiceCore::kAcceptorContext)) {}

Status IpcAcceptor::adopt(int listeningFd) {
    std::lock_guard lock(mutex_);
    asio::error_code error;
    acceptor_.assign(asio::local::stream_protocol(), listeningFd, error);
    if (error) {
        ::close(listeningFd);
        return QRN_UNEXPECTED(QRN_POSIX_ERROR(error.value(), "Cannot listen on descriptor {}: {}",
                                              listeningFd, error.message()));
    }
    if (!passCredentials(listeningFd)) {
        const int err = errno;
        acceptor_.close(error);
        return QRN_UNEXPECTED(
            QRN_POSIX_ERROR(err, "Cannot ask for credentials on descriptor {}", listeningFd));
    }
    return {};
}

void IpcAcceptor::start() {
    acceptNext();
}

void IpcAcceptor::close() {
    std::lock_guard lock(mutex_);
    closed_ = true;
    asio::error_code ignored;
    acceptor_.close(ignored);
    backOffTimer_.cancel();
}

void IpcAcceptor::acceptNext() {
    std::lock_guard lock(mutex_);
    if (closed_) {
        return;
    }
    acceptor_.async_accept(core_->nextContext(),
                           [self = shared_from_this()](const asio::error_code& error,
                                                       AsioIpcConnection::Socket socket) {
                               self->onAccepted(error, std::move(socket));
                           });
}

void IpcAcceptor::onAccepted(const asio::error_code& error, AsioIpcConnection::Socket socket) {
    if (error == asio::error::operation_aborted || error == asio::error::bad_descriptor) {
        return; // closed
    }
    if (error) {
        QRN_LOG_ERROR(LogCategory::Vell, "Accepting a connection failed: {}", error.message());
        return isResourceShortage(error) ? backOff() : acceptNext();
    }
    handOver(std::move(socket));
    acceptNext();
}

void IpcAcceptor::handOver(AsioIpcConnection::Socket socket) {
    closeIdleConnections();
    // Checked before the peer is read from /proc: a flood of connections
    // costs the daemon an accept, a getsockopt and a close each.
    ucred credentials{};
    socklen_t length = sizeof credentials;
    if (::getsockopt(socket.native_handle(), SOL_SOCKET, SO_PEERCRED, &credentials, &length) != 0) {
        QRN_LOG_ERROR(LogCategory::Vell, "Refusing a connection: no peer credentials: {}",
                      std::strerror(errno));
        return;
    }
    if (!core_->hasSlotFor(credentials.uid)) {
        QRN_LOG_ERROR(LogCategory::Vell,
                      "Refusing a connection of pid {} (uid {}): no slot is free for it; {} open",
                      credentials.pid, credentials.uid, core_->openCount());
        return;
    }
    auto connection = connectionFor(std::move(socket));
    if (!connection) {
        return;
    }
    // The slot is taken only now; another connection may have got it since.
    const std::size_t open = core_->add(connection);
    if (open == 0) {
        QRN_LOG_ERROR(LogCategory::Vell, "Refusing a connection of pid {}: no slot is free for it",
                      connection->peer().pid());
        return;
    }
    QRN_LOG_DEBUG(LogCategory::Vell, "Accepted a connection of pid {}; {} open",
                  connection->peer().pid(), open);
    try {
        handler_(std::move(connection));
    } catch (const std::exception& e) {
        QRN_LOG_FAULT(LogCategory::Vell, "The connection handler threw: {}", e.what());
    }
}

// The connection with its peer pinned: pidfd, token and program.
std::shared_ptr<AsioIpcConnection> IpcAcceptor::connectionFor(AsioIpcConnection::Socket socket) {
    ::fcntl(socket.native_handle(), F_SETFD, FD_CLOEXEC);
    if (!passCredentials(socket.native_handle())) {
        QRN_LOG_ERROR(LogCategory::Vell, "Refusing a connection: no credentials: {}",
                      std::strerror(errno));
        return nullptr;
    }
    auto peer = IpcPeer::fromSocket(socket.native_handle());
    if (!peer) {
        QRN_LOG_ERROR(LogCategory::Vell, "Refusing a connection whose client is unknown: {}",
                      peer.error().message);
        return nullptr;
    }
    auto program = IpcExecFingerprint::of(peer->pid(), peer->pidfd());
    if (!program) {
        QRN_LOG_ERROR(LogCategory::Vell, "Refusing a connection: {}", program.error().message);
        return nullptr;
    }
    return std::make_shared<AsioIpcConnection>(core_, std::move(socket), std::move(*peer),
                                               std::move(*program), limits_);
}

// Slots running short: connections idle past the timeout make room.
void IpcAcceptor::closeIdleConnections() {
    if (core_->openCount() <= reapIdleAbove_) {
        return;
    }
    const auto cutoff = std::chrono::steady_clock::now() - idleTimeout_;
    for (const auto& idle : core_->idleConnections(cutoff, reapIdleAbove_)) {
        QRN_LOG_NOTICE(LogCategory::Vell,
                       "Closing the idle connection of pid {} (uid {}): slots run short",
                       idle->peer().pid(), idle->peer().uid());
        idle->shutDown();
    }
}

void IpcAcceptor::backOff() {
    std::lock_guard lock(mutex_);
    if (closed_) {
        return;
    }
    backOffTimer_.expires_after(kBackOff);
    backOffTimer_.async_wait([self = shared_from_this()](const asio::error_code& error) {
        if (!error) {
            self->acceptNext();
        }
    });
}

} // namespace quarn
