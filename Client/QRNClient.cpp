#include "Client/QRNClient.h"

#include "Daemon/platform/CborCodec.h"
#include "Daemon/platform/IpcFrame.h"
#include "Daemon/platform/Paths.h"

#include <cerrno>
#include <cstring>
#include <sys/socket.h>
#include <sys/time.h>
#include <sys/un.h>

namespace quarn {

namespace {

// Most replies are small: one read usually brings the header and the body.
constexpr std::size_t kFirstReadBytes = 16 * 1024;

Status setTimeouts(int fd, std::chrono::milliseconds timeout) {
    if (timeout.count() <= 0) {
        return {};
    }
    timeval tv{};
    tv.tv_sec = static_cast<time_t>(timeout.count() / 1000);
    tv.tv_usec = static_cast<suseconds_t>((timeout.count() % 1000) * 1000);
    for (int option : {SO_RCVTIMEO, SO_SNDTIMEO}) {
        if (setsockopt(fd, SOL_SOCKET, option, &tv, sizeof tv) != 0) {
            return QRN_UNEXPECTED(
                QRN_POSIX_ERROR(errno, "cannot set the socket timeout: {}", std::strerror(errno)));
        }
    }
    return {};
}

// A connect interrupted by a signal goes on in the kernel; asking again
// tells how it ended.
int connectRetrying(int fd, const sockaddr_un& address) {
    for (;;) {
        if (::connect(fd, reinterpret_cast<const sockaddr*>(&address), sizeof address) == 0) {
            return 0;
        }
        if (errno == EISCONN) {
            return 0;
        }
        if (errno != EINTR && errno != EALREADY) {
            return errno;
        }
    }
}

} // namespace

std::filesystem::path QRNClient::socketPathForRoot(const std::filesystem::path& rootPrefix) {
    return Paths(rootPrefix).runDirectory() / kSocketName;
}

Result<QRNClient> QRNClient::connect(const std::filesystem::path& socketPath, Options options) {
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    const std::string& text = socketPath.native();
    if (text.empty() || text.size() >= sizeof address.sun_path) {
        return QRN_UNEXPECTED(QRN_POSIX_ERROR(
            ENAMETOOLONG, "cannot connect to {}: the path is empty or too long for a socket",
            text));
    }
    std::memcpy(address.sun_path, text.data(), text.size());
    auto fd = std::make_unique<Descriptor>(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
    if (!fd->valid()) {
        return QRN_UNEXPECTED(QRN_POSIX_ERROR(errno, "socket: {}", std::strerror(errno)));
    }
    // Before connect: a full backlog makes connect wait up to the send timeout.
    if (auto status = setTimeouts(fd->get(), options.timeout); !status) {
        return QRN_UNEXPECTED(status.error());
    }
    if (int err = connectRetrying(fd->get(), address); err != 0) {
        return QRN_UNEXPECTED(
            QRN_POSIX_ERROR(err, "cannot connect to {}: {}", text, std::strerror(err)));
    }
    return greeted(QRNClient(std::move(fd), options));
}

Result<QRNClient> QRNClient::adopt(int socketFd, Options options) {
    auto fd = std::make_unique<Descriptor>(socketFd);
    if (auto status = setTimeouts(socketFd, options.timeout); !status) {
        return QRN_UNEXPECTED(status.error());
    }
    return greeted(QRNClient(std::move(fd), options));
}

// The daemon speaks first; a request sent before its greeting would close
// the connection.
Result<QRNClient> QRNClient::greeted(QRNClient client) {
    auto greeting = client.readFrame(false);
    if (!greeting) {
        return QRN_UNEXPECTED(
            QRN_POSIX_ERROR(greeting.error().code == ECONNRESET ? ECONNRESET : EPROTO,
                            "quarnd did not greet the connection: {}", greeting.error().message));
    }
    if (!IpcFrame::isGreeting(*greeting)) {
        return QRN_UNEXPECTED(QRN_POSIX_ERROR(EPROTO, "quarnd greeted with {}, not protocol {}",
                                              greeting->description(), IpcFrame::kProtocolVersion));
    }
    return client;
}

Result<Value> QRNClient::send(const Value& request) {
    if (!fd_) {
        return QRN_UNEXPECTED(QRN_POSIX_ERROR(ENOTCONN, "the connection to quarnd is closed"));
    }
    auto frame = IpcFrame::encodeMessage(request, true);
    if (frame.size() - IpcFrame::kHeaderSize > options_.maxMessageBytes) {
        // Nothing was sent: the connection stays usable.
        return QRN_UNEXPECTED(
            QRN_POSIX_ERROR(EMSGSIZE, "request of {} bytes is over the limit of {} bytes",
                            frame.size() - IpcFrame::kHeaderSize, options_.maxMessageBytes));
    }
    if (auto status = writeAll(frame); !status) {
        close();
        return QRN_UNEXPECTED(status.error());
    }
    auto reply = readFrame(true);
    if (!reply) {
        close();
    }
    return reply;
}

Status QRNClient::writeAll(std::span<const std::uint8_t> bytes) {
    while (!bytes.empty()) {
        ssize_t n = ::send(fd_->get(), bytes.data(), bytes.size(), MSG_NOSIGNAL);
        if (n < 0 && errno == EINTR) {
            continue;
        }
        if (n < 0) {
            int err = errno == EAGAIN || errno == EWOULDBLOCK ? ETIMEDOUT : errno;
            if (err == EPIPE) {
                err = ECONNRESET;
            }
            return QRN_UNEXPECTED(
                QRN_POSIX_ERROR(err, "cannot send the request: {}", std::strerror(err)));
        }
        bytes = bytes.subspan(static_cast<std::size_t>(n));
    }
    return {};
}

Result<std::size_t> QRNClient::readSome(std::span<std::uint8_t> into) {
    for (;;) {
        ssize_t n = ::recv(fd_->get(), into.data(), into.size(), 0);
        if (n >= 0) {
            return static_cast<std::size_t>(n);
        }
        if (errno == EINTR) {
            continue;
        }
        int err = errno == EAGAIN || errno == EWOULDBLOCK ? ETIMEDOUT : errno;
        return QRN_UNEXPECTED(
            QRN_POSIX_ERROR(err, "cannot read the reply: {}", std::strerror(err)));
    }
}

Result<std::size_t> QRNClient::readAtLeast(std::vector<std::uint8_t>& buffer, std::size_t have,
                                           std::size_t want) {
    while (have < want) {
        auto n = readSome(std::span(buffer).subspan(have));
        if (!n) {
            return QRN_UNEXPECTED(n.error());
        }
        if (*n == 0) {
            if (have == 0) {
                return QRN_UNEXPECTED(
                    QRN_POSIX_ERROR(ECONNRESET, "quarnd closed the connection without a reply"));
            }
            return QRN_UNEXPECTED(QRN_POSIX_ERROR(
                ECONNRESET, "reply truncated: the connection closed after {} of {} bytes", have,
                want));
        }
        have += *n;
    }
    return have;
}

Result<Value> QRNClient::readFrame(bool isReply) {
    const char* what = isReply ? "reply" : "greeting";
    std::vector<std::uint8_t> buffer(kFirstReadBytes);
    auto first = readSome(buffer);
    if (!first) {
        return QRN_UNEXPECTED(first.error());
    }
    auto have = readAtLeast(buffer, *first, IpcFrame::kHeaderSize);
    if (!have) {
        return QRN_UNEXPECTED(have.error());
    }
    auto header = IpcFrame::decodeHeader(std::span(buffer).first<IpcFrame::kHeaderSize>());
    if (!header || header->expectsReply) {
        return QRN_UNEXPECTED(QRN_POSIX_ERROR(EPROTO, "{} frame with flag bits set", what));
    }
    if (header->length > options_.maxMessageBytes) {
        return QRN_UNEXPECTED(QRN_POSIX_ERROR(EMSGSIZE,
                                              "{} of {} bytes is over the limit of {} bytes", what,
                                              header->length, options_.maxMessageBytes));
    }
    const std::size_t total = IpcFrame::kHeaderSize + header->length;
    if (*have > total) {
        return QRN_UNEXPECTED(
            QRN_POSIX_ERROR(EPROTO, "{} unexpected bytes after the {}", *have - total, what));
    }
    buffer.resize(total);
    if (auto full = readAtLeast(buffer, *have, total); !full) {
        return QRN_UNEXPECTED(full.error());
    }
    auto body = std::span<const std::uint8_t>(buffer).subspan(IpcFrame::kHeaderSize);
    auto reply = CborCodec::decode(body, {options_.maxMessageBytes, options_.maxNesting});
    if (!reply) {
        return QRN_UNEXPECTED(
            QRN_POSIX_ERROR(EBADMSG, "{} does not decode: {}", what, reply.error().message));
    }
    if (!reply->isDictionary()) {
        return QRN_UNEXPECTED(
            QRN_POSIX_ERROR(EBADMSG, "{} is a {}, not a dictionary", what, reply->kindName()));
    }
    return reply;
}

} // namespace quarn
