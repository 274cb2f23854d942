#include "RawConnection.h"

#include "Daemon/platform/CborCodec.h"
#include "Daemon/platform/IpcFrame.h"
#include "DaemonHarness.h"

#include <poll.h>
#include <sys/socket.h>
#include <sys/un.h>

#include <cerrno>
#include <cstring>
#include <stdexcept>
#include <system_error>

namespace quarn::test {

namespace {

bool readable(int fd) {
    pollfd entry{fd, POLLIN, 0};
    const auto limit = std::chrono::milliseconds(DaemonHarness::kWaitLimit);
    int ready;
    do {
        ready = ::poll(&entry, 1, static_cast<int>(limit.count()));
    } while (ready < 0 && errno == EINTR);
    return ready > 0;
}

} // namespace

RawConnection::RawConnection(const std::filesystem::path& socketPath)
    : fd_(std::make_unique<Descriptor>(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0))) {
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    std::strncpy(address.sun_path, socketPath.c_str(), sizeof address.sun_path - 1);
    if (!fd_->valid() ||
        ::connect(fd_->get(), reinterpret_cast<const sockaddr*>(&address), sizeof address) != 0) {
        throw std::system_error(errno, std::generic_category(), "connect " + socketPath.string());
    }
}

bool RawConnection::write(std::span<const std::uint8_t> bytes) {
    while (!bytes.empty()) {
        const ssize_t n = ::send(fd_->get(), bytes.data(), bytes.size(), MSG_NOSIGNAL);
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

void RawConnection::shutdownWrite() {
    ::shutdown(fd_->get(), SHUT_WR);
}

bool RawConnection::readExactly(std::span<std::uint8_t> into) {
    while (!into.empty()) {
        if (!readable(fd_->get())) {
            return false;
        }
        const ssize_t n = ::recv(fd_->get(), into.data(), into.size(), 0);
        if (n < 0 && errno == EINTR) {
            continue;
        }
        if (n <= 0) {
            return false;
        }
        into = into.subspan(static_cast<std::size_t>(n));
    }
    return true;
}

std::optional<Value> RawConnection::readReply() {
    std::array<std::uint8_t, IpcFrame::kHeaderSize> headerBytes{};
    if (!fd_ || !readExactly(headerBytes)) {
        return std::nullopt;
    }
    const auto header = IpcFrame::decodeHeader(headerBytes);
    if (!header || header->length > CborCodec::Limits{}.maxBytes) {
        return std::nullopt;
    }
    std::vector<std::uint8_t> body(header->length);
    if (!readExactly(body)) {
        return std::nullopt;
    }
    auto decoded = CborCodec::decode(body);
    return decoded ? std::optional<Value>(std::move(*decoded)) : std::nullopt;
}

bool RawConnection::waitForClose() {
    if (!fd_ || !readable(fd_->get())) {
        return false;
    }
    std::uint8_t byte = 0;
    const ssize_t n = ::recv(fd_->get(), &byte, 1, 0);
    return n == 0 || (n < 0 && errno == ECONNRESET);
}

std::vector<std::uint8_t> RawConnection::rawFrame(std::span<const std::uint8_t> body,
                                                  std::uint8_t flags) {
    const auto header = IpcFrame::encodeHeader(static_cast<std::uint32_t>(body.size()), false);
    std::vector<std::uint8_t> bytes(header.begin(), header.end());
    bytes[IpcFrame::kHeaderSize - 1] = flags;
    bytes.insert(bytes.end(), body.begin(), body.end());
    return bytes;
}

std::vector<std::uint8_t> RawConnection::frame(const Value& message, std::uint8_t flags) {
    return rawFrame(CborCodec::encode(message), flags);
}

} // namespace quarn::test
