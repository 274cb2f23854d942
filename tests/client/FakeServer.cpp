#include "FakeServer.h"

#include "Daemon/platform/IpcFrame.h"
#include "common/shared/FrameSocket.h"

#include <stdexcept>
#include <sys/socket.h>
#include <unistd.h>

namespace quarn::test {

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
    : respond_(std::move(respond)), listenFd_(FrameSocket::listenAt(socketPath, 8)) {
    if (listenFd_ < 0) {
        throw std::runtime_error("cannot listen at " + socketPath.string());
    }
    thread_ =
        std::thread([this] { FrameSocket::acceptEach(listenFd_, [this](int fd) { serve(fd); }); });
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
    std::vector<std::uint8_t> body;
    while (auto frame = FrameSocket::readFrame(fd, body)) {
        const Value request = frame->message ? *frame->message : Value();
        {
            std::lock_guard lock(mutex_);
            requests_.push_back(request);
            replyFlags_.push_back(frame->header.expectsReply);
        }
        const Response response = respond_(request);
        if (!FrameSocket::writeAll(fd, response.bytes) || response.closeAfter) {
            break;
        }
    }
    ::close(fd);
}

} // namespace quarn::test
