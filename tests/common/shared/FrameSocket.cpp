#include "FrameSocket.h"

#include "Daemon/platform/CborCodec.h"
#include "Daemon/support/Descriptor.h"

#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstring>

namespace quarn::test {

namespace {

// False (errno ENAMETOOLONG) for a path a socket address cannot hold.
bool addressOf(const std::filesystem::path& socketPath, sockaddr_un& address) {
    address = {};
    address.sun_family = AF_UNIX;
    if (socketPath.native().size() >= sizeof address.sun_path) {
        errno = ENAMETOOLONG;
        return false;
    }
    std::strcpy(address.sun_path, socketPath.c_str());
    return true;
}

const sockaddr* generic(const sockaddr_un& address) {
    return reinterpret_cast<const sockaddr*>(&address);
}

// Closes `fd` after a failed call and answers -1, keeping that call's errno.
int closed(int fd) {
    const int err = errno;
    ::close(fd);
    errno = err;
    return -1;
}

// Repeats `step` (one recv or send of what is left) until every byte has
// gone; false at the end of the stream or on an error.
template <class Byte, class Step> bool whole(std::span<Byte> bytes, Step step) {
    while (!bytes.empty()) {
        const ssize_t n = step(bytes);
        if (n < 0 && errno == EINTR) {
            continue;
        }
        if (n <= 0) {
            return false;
        }
        bytes = bytes.subspan(static_cast<std::size_t>(n));
    }
    return true;
}

} // namespace

int FrameSocket::connectTo(const std::filesystem::path& socketPath) {
    sockaddr_un address;
    const int fd =
        addressOf(socketPath, address) ? ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0) : -1;
    return fd >= 0 && ::connect(fd, generic(address), sizeof address) != 0 ? closed(fd) : fd;
}

int FrameSocket::connectGreeted(const std::filesystem::path& socketPath) {
    const int fd = connectTo(socketPath);
    if (fd < 0 || readGreeting(fd)) {
        return fd;
    }
    errno = EPROTO;
    return closed(fd);
}

bool FrameSocket::readGreeting(int fd) {
    std::vector<std::uint8_t> body;
    const auto greeting = readFrame(fd, body);
    return greeting && !greeting->header.expectsReply && greeting->message &&
           IpcFrame::isGreeting(*greeting->message);
}

bool FrameSocket::writeGreeting(int fd) {
    return writeAll(fd, IpcFrame::encodeMessage(IpcFrame::greeting(), false));
}

bool FrameSocket::accepts(const std::filesystem::path& socketPath) {
    return Descriptor(connectTo(socketPath)).valid();
}

int FrameSocket::listenAt(const std::filesystem::path& socketPath, int backlog) {
    sockaddr_un address;
    if (!addressOf(socketPath, address)) {
        return -1;
    }
    ::unlink(socketPath.c_str());
    const int fd = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    return fd >= 0 &&
                   (::bind(fd, generic(address), sizeof address) != 0 || ::listen(fd, backlog) != 0)
               ? closed(fd)
               : fd;
}

void FrameSocket::acceptEach(int listener, const std::function<void(int fd)>& serve) {
    for (;;) {
        const int fd = ::accept4(listener, nullptr, nullptr, SOCK_CLOEXEC);
        if (fd >= 0) {
            serve(fd);
        } else if (errno != EINTR && errno != ECONNABORTED) {
            return;
        }
    }
}

std::optional<FrameSocket::Frame> FrameSocket::readFrame(int fd, std::vector<std::uint8_t>& body) {
    std::array<std::uint8_t, IpcFrame::kHeaderSize> headerBytes{};
    if (!readExactly(fd, headerBytes)) {
        return std::nullopt;
    }
    const auto header = IpcFrame::decodeHeader(headerBytes);
    if (!header || header->length > kMaxFrameBytes) {
        return std::nullopt;
    }
    body.resize(header->length);
    if (!readExactly(fd, body)) {
        return std::nullopt;
    }
    return Frame{*header, CborCodec::decode(body)};
}

bool FrameSocket::readExactly(int fd, std::span<std::uint8_t> into) {
    return whole(into, [fd](auto left) { return ::recv(fd, left.data(), left.size(), 0); });
}

bool FrameSocket::writeAll(int fd, std::span<const std::uint8_t> bytes) {
    return whole(bytes,
                 [fd](auto left) { return ::send(fd, left.data(), left.size(), MSG_NOSIGNAL); });
}

std::vector<std::uint8_t> FrameSocket::rawFrame(std::uint32_t length, std::uint8_t flags,
                                                std::span<const std::uint8_t> body) {
    const auto header = IpcFrame::encodeHeader(length, false);
    std::vector<std::uint8_t> bytes(header.size() + body.size());
    std::copy(header.begin(), header.end(), bytes.begin());
    bytes[IpcFrame::kHeaderSize - 1] = flags;
    std::copy(body.begin(), body.end(), bytes.begin() + IpcFrame::kHeaderSize);
    return bytes;
}

std::vector<std::uint8_t> FrameSocket::frame(const Value& message, std::uint8_t flags) {
    const std::vector<std::uint8_t> body = CborCodec::encode(message);
    return rawFrame(static_cast<std::uint32_t>(body.size()), flags, body);
}

} // namespace quarn::test
