#include "FakeServer.h"

#include "Daemon/platform/CborCodec.h"
#include "Daemon/platform/IpcFrame.h"

#include <cstring>
#include <stdexcept>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

namespace quarn::test {

namespace {

bool readFully(int fd, std::uint8_t* into, std::size_t size) {
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

} // namespace

std::vector<std::uint8_t> FakeServer::frame(const Value& reply) {
    return IpcFrame::encodeMessage(reply, false);
}

FakeServer::Response FakeServer::reply(Value keys) {
    keys.set("ReplyError", std::uint64_t{1});
    return {frame(keys), false};
}

FakeServer::FakeServer(Respond respond) : respond_(std::move(respond)) {
    int fds[2];
    if (socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, fds) != 0) {
        throw std::runtime_error("socketpair failed");
    }
    clientEnd_ = fds[0];
    serverEnd_ = fds[1];
    thread_ = std::thread([this] { serve(serverEnd_); });
}

FakeServer::FakeServer(const std::filesystem::path& socketPath, Respond respond)
    : respond_(std::move(respond)) {
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    std::strncpy(address.sun_path, socketPath.c_str(), sizeof address.sun_path - 1);
    listenFd_ = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    if (listenFd_ < 0 ||
        bind(listenFd_, reinterpret_cast<const sockaddr*>(&address), sizeof address) != 0 ||
        listen(listenFd_, 8) != 0) {
        throw std::runtime_error("cannot listen at " + socketPath.string());
    }
    thread_ = std::thread([this] {
        for (;;) {
            int fd = accept4(listenFd_, nullptr, nullptr, SOCK_CLOEXEC);
            if (fd < 0 && errno == EINTR) {
                continue;
            }
            if (fd < 0) {
                return; // shut down
            }
            serve(fd);
        }
    });
}

FakeServer::~FakeServer() {
    if (listenFd_ >= 0) {
        shutdown(listenFd_, SHUT_RDWR);
    }
    if (clientEnd_ >= 0) {
        ::close(clientEnd_);
    }
    thread_.join();
    if (listenFd_ >= 0) {
        ::close(listenFd_);
    }
}

int FakeServer::takeClientEnd() {
    return std::exchange(clientEnd_, -1);
}

std::vector<Value> FakeServer::requests() const {
    std::lock_guard lock(mutex_);
    return requests_;
}

std::vector<bool> FakeServer::replyFlags() const {
    std::lock_guard lock(mutex_);
    return replyFlags_;
}

void FakeServer::serve(int fd) {
    for (;;) {
        std::uint8_t header[IpcFrame::kHeaderSize];
        if (!readFully(fd, header, sizeof header)) {
            break;
        }
        auto decoded = IpcFrame::decodeHeader(std::span<const std::uint8_t, 5>(header));
        std::vector<std::uint8_t> body(decoded ? decoded->length : 0);
        if (!decoded || !readFully(fd, body.data(), body.size())) {
            break;
        }
        auto request = CborCodec::decode(body);
        {
            std::lock_guard lock(mutex_);
            requests_.push_back(request ? *request : Value());
            replyFlags_.push_back(decoded->expectsReply);
        }
        auto response = respond_(request ? *request : Value());
        if (!response.bytes.empty() &&
            ::send(fd, response.bytes.data(), response.bytes.size(), MSG_NOSIGNAL) < 0) {
            break;
        }
        if (response.closeAfter) {
            break;
        }
    }
    ::close(fd);
}

} // namespace quarn::test
