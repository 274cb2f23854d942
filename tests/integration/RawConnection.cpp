#include "RawConnection.h"

#include "DaemonHarness.h"
#include "common/shared/FrameSocket.h"

#include <sys/socket.h>

#include <cerrno>
#include <system_error>

namespace quarn::test {

RawConnection::RawConnection(const std::filesystem::path& socketPath)
    : fd_(std::make_unique<Descriptor>(FrameSocket::connectTo(socketPath))) {
    // Every read ends by the limit, so a daemon that stays silent fails
    // the test instead of hanging it.
    const timeval limit{.tv_sec = DaemonHarness::kWaitLimit.count(), .tv_usec = 0};
    if (!fd_->valid() ||
        ::setsockopt(fd_->get(), SOL_SOCKET, SO_RCVTIMEO, &limit, sizeof limit) != 0) {
        throw std::system_error(errno, std::generic_category(), "connect " + socketPath.string());
    }
}

bool RawConnection::write(std::span<const std::uint8_t> bytes) {
    return FrameSocket::writeAll(fd_->get(), bytes);
}

void RawConnection::shutdownWrite() {
    ::shutdown(fd_->get(), SHUT_WR);
}

std::optional<Value> RawConnection::readReply() {
    std::vector<std::uint8_t> body;
    auto frame = fd_ ? FrameSocket::readFrame(fd_->get(), body) : std::nullopt;
    return frame && frame->message ? std::optional<Value>(std::move(*frame->message))
                                   : std::nullopt;
}

bool RawConnection::waitForClose() {
    std::uint8_t byte = 0;
    const ssize_t n = fd_ ? ::recv(fd_->get(), &byte, 1, 0) : 1;
    return n == 0 || (n < 0 && errno == ECONNRESET);
}

} // namespace quarn::test
