#include "EchoServer.h"

#include "Fail.h"

#include "Daemon/platform/CborCodec.h"
#include "Daemon/platform/IpcFrame.h"

#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <cstring>
#include <thread>
#include <vector>

namespace quarn::loadbench {

namespace {

constexpr std::size_t kMaxFrameBytes = 1024 * 1024;

bool readExactly(int fd, std::uint8_t* into, std::size_t size) {
    while (size > 0) {
        ssize_t n = ::read(fd, into, size);
        if (n < 0 && errno == EINTR) {
            continue;
        }
        if (n <= 0) {
            return false;
        }
        into += n;
        size -= static_cast<std::size_t>(n);
    }
    return true;
}

bool writeAll(int fd, const std::vector<std::uint8_t>& bytes) {
    std::size_t sent = 0;
    while (sent < bytes.size()) {
        ssize_t n = ::send(fd, bytes.data() + sent, bytes.size() - sent, MSG_NOSIGNAL);
        if (n < 0 && errno == EINTR) {
            continue;
        }
        if (n < 0) {
            return false;
        }
        sent += static_cast<std::size_t>(n);
    }
    return true;
}

int listenOn(const std::filesystem::path& socket) {
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    if (socket.native().size() >= sizeof(address.sun_path)) {
        fail("socket path too long: {}", socket.string());
    }
    std::strcpy(address.sun_path, socket.c_str());
    ::unlink(socket.c_str());
    int fd = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    if (fd < 0 || ::bind(fd, reinterpret_cast<const sockaddr*>(&address), sizeof(address)) != 0 ||
        ::listen(fd, 128) != 0) {
        fail("echo server cannot listen on {}: {}", socket.string(), std::strerror(errno));
    }
    return fd;
}

} // namespace

EchoServer::EchoServer(std::filesystem::path socket, Value reply)
    : socket_(std::move(socket)), reply_(std::move(reply)) {}

void EchoServer::run() {
    int listener = listenOn(socket_);
    for (;;) {
        int fd = ::accept4(listener, nullptr, nullptr, SOCK_CLOEXEC);
        if (fd < 0) {
            if (errno == EINTR || errno == ECONNABORTED) {
                continue;
            }
            fail("echo server accept: {}", std::strerror(errno));
        }
        std::thread([this, fd] { serve(fd); }).detach();
    }
}

void EchoServer::serve(int fd) const {
    std::array<std::uint8_t, IpcFrame::kHeaderSize> header{};
    std::vector<std::uint8_t> body;
    while (readExactly(fd, header.data(), header.size())) {
        auto decoded = IpcFrame::decodeHeader(header);
        if (!decoded || decoded->length > kMaxFrameBytes) {
            break;
        }
        body.resize(decoded->length);
        if (!readExactly(fd, body.data(), body.size())) {
            break;
        }
        auto request = CborCodec::decode(body);
        if (!request || !request->isDictionary()) {
            break;
        }
        if (decoded->expectsReply && !writeAll(fd, IpcFrame::encodeMessage(reply_, false))) {
            break;
        }
    }
    ::close(fd);
}

} // namespace quarn::loadbench
