#include "FrameClient.h"

#include "Fail.h"

#include "Daemon/platform/IpcFrame.h"
#include "common/shared/FrameSocket.h"

#include <unistd.h>

#include <cerrno>
#include <cstring>

namespace quarn::loadbench {

using test::FrameSocket;

FrameClient::FrameClient(const std::filesystem::path& socket)
    : fd_(FrameSocket::connectGreeted(socket)) {
    if (fd_ < 0) {
        fail("cannot connect to {}: {}", socket.string(), std::strerror(errno));
    }
}

FrameClient::~FrameClient() {
    ::close(fd_);
}

bool FrameClient::canConnect(const std::filesystem::path& socket) {
    return FrameSocket::accepts(socket);
}

Value FrameClient::roundTrip(const Value& request) {
    if (!FrameSocket::writeAll(fd_, IpcFrame::encodeMessage(request, true))) {
        fail("sending a request: {}", std::strerror(errno));
    }
    errno = 0;
    auto frame = FrameSocket::readFrame(fd_, body_);
    if (!frame) {
        fail("reading a reply: {}", errno ? std::strerror(errno) : "connection closed");
    }
    if (!frame->message) {
        fail("reply does not decode: {}", frame->message.error().message);
    }
    return std::move(*frame->message);
}

} // namespace quarn::loadbench
