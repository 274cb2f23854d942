#include "FrameClient.h"

#include "Fail.h"

#include "Daemon/platform/CborCodec.h"
#include "Daemon/platform/IpcFrame.h"

#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <cstring>

namespace quarn::loadbench {

namespace {

constexpr std::size_t kMaxReplyBytes = 1024 * 1024;

int connectTo(const std::filesystem::path& socket) {
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    if (socket.native().size() >= sizeof(address.sun_path)) {
        fail("socket path too long: {}", socket.string());
    }
    std::strcpy(address.sun_path, socket.c_str());
    int fd = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    if (fd < 0) {
        fail("socket: {}", std::strerror(errno));
    }
    if (::connect(fd, reinterpret_cast<const sockaddr*>(&address), sizeof(address)) != 0) {
        ::close(fd);
        return -1;
    }
    return fd;
}

} // namespace

FrameClient::FrameClient(const std::filesystem::path& socket) : fd_(connectTo(socket)) {
    if (fd_ < 0) {
        fail("cannot connect to {}: {}", socket.string(), std::strerror(errno));
    }
}

FrameClient::~FrameClient() {
    ::close(fd_);
}

bool FrameClient::canConnect(const std::filesystem::path& socket) {
    int fd = connectTo(socket);
    if (fd < 0) {
        return false;
    }
    ::close(fd);
    return true;
}

void FrameClient::readExactly(std::uint8_t* into, std::size_t size) {
    while (size > 0) {
        ssize_t n = ::read(fd_, into, size);
        if (n < 0 && errno == EINTR) {
            continue;
        }
        if (n <= 0) {
            fail("reading a reply: {}", n == 0 ? "connection closed" : std::strerror(errno));
        }
        into += n;
        size -= static_cast<std::size_t>(n);
    }
}

Value FrameClient::roundTrip(const Value& request) {
    const auto frame = IpcFrame::encodeMessage(request, true);
    std::size_t sent = 0;
    while (sent < frame.size()) {
        ssize_t n = ::send(fd_, frame.data() + sent, frame.size() - sent, MSG_NOSIGNAL);
        if (n < 0 && errno == EINTR) {
            continue;
        }
        if (n < 0) {
            fail("sending a request: {}", std::strerror(errno));
        }
        sent += static_cast<std::size_t>(n);
    }
    std::array<std::uint8_t, IpcFrame::kHeaderSize> header{};
    readExactly(header.data(), header.size());
    auto decoded = IpcFrame::decodeHeader(header);
    if (!decoded || decoded->length > kMaxReplyBytes) {
        fail("bad reply frame header");
    }
    body_.resize(decoded->length);
    readExactly(body_.data(), body_.size());
    auto reply = CborCodec::decode(body_);
    if (!reply) {
        fail("reply does not decode: {}", reply.error().message);
    }
    return std::move(*reply);
}

std::uint64_t FrameClient::replyError(const Value& reply) {
    const Value* error = reply.get("ReplyError");
    return error ? error->asUInt64().value_or(0) : 0;
}

} // namespace quarn::loadbench
