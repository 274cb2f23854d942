#include "EchoServer.h"

#include "Fail.h"

#include "Daemon/platform/IpcFrame.h"
#include "common/shared/FrameSocket.h"

#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <thread>
#include <vector>

namespace quarn::loadbench {

using test::FrameSocket;

EchoServer::EchoServer(std::filesystem::path socket, Value reply)
    : socket_(std::move(socket)), reply_(std::move(reply)) {}

void EchoServer::run() {
    const int listener = FrameSocket::listenAt(socket_, 128);
    if (listener < 0) {
        fail("echo server cannot listen on {}: {}", socket_.string(), std::strerror(errno));
    }
    FrameSocket::acceptEach(listener,
                            [this](int fd) { std::thread([this, fd] { serve(fd); }).detach(); });
    fail("echo server accept: {}", std::strerror(errno));
}

void EchoServer::serve(int fd) const {
    std::vector<std::uint8_t> body;
    const bool greeted = FrameSocket::writeGreeting(fd);
    while (auto frame = greeted ? FrameSocket::readFrame(fd, body) : std::nullopt) {
        if (!frame->message || !frame->message->isDictionary()) {
            break;
        }
        if (frame->header.expectsReply &&
            !FrameSocket::writeAll(fd, IpcFrame::encodeMessage(reply_, false))) {
            break;
        }
    }
    ::close(fd);
}

} // namespace quarn::loadbench
