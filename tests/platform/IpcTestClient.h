#pragma once
// A blocking client of the request service for tests: writes raw bytes or
// framed messages and reads framed replies. Reads give up after a guard
// time so that a broken service fails a test instead of hanging it.

#include "Daemon/platform/CborCodec.h"
#include "Daemon/platform/IpcFrame.h"

#include <gtest/gtest.h>

#include <cstring>
#include <filesystem>
#include <linux/sockios.h>
#include <optional>
#include <sys/ioctl.h>
#include <sys/socket.h>
#include <sys/time.h>
#include <sys/un.h>
#include <unistd.h>
#include <vector>

namespace quarn::test {

class IpcTestClient {
public:
    explicit IpcTestClient(const std::filesystem::path& path)
        : fd_(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0)) {
        sockaddr_un address{};
        address.sun_family = AF_UNIX;
        std::strncpy(address.sun_path, path.c_str(), sizeof address.sun_path - 1);
        if (::connect(fd_, reinterpret_cast<const sockaddr*>(&address), sizeof address) != 0) {
            ADD_FAILURE() << "connect " << path << ": " << std::strerror(errno);
        }
        const timeval guard{20, 0};
        ::setsockopt(fd_, SOL_SOCKET, SO_RCVTIMEO, &guard, sizeof guard);
    }
    ~IpcTestClient() { ::close(fd_); }

    void write(const std::vector<std::uint8_t>& bytes) {
        std::size_t done = 0;
        while (done < bytes.size()) {
            const ssize_t n = ::send(fd_, bytes.data() + done, bytes.size() - done, MSG_NOSIGNAL);
            if (n <= 0) {
                ADD_FAILURE() << "send: " << std::strerror(errno);
                return;
            }
            done += static_cast<std::size_t>(n);
        }
    }
    void send(const Value& message, bool expectsReply = true) {
        write(IpcFrame::encodeMessage(message, expectsReply));
    }

    // The next reply, or none when the connection ended (or the guard ran out).
    std::optional<Value> receive() {
        std::array<std::uint8_t, IpcFrame::kHeaderSize> header;
        if (!readExactly(header.data(), header.size())) {
            return std::nullopt;
        }
        const auto decoded = IpcFrame::decodeHeader(header);
        EXPECT_TRUE(decoded && !decoded->expectsReply);
        std::vector<std::uint8_t> body(decoded ? decoded->length : 0);
        if (!decoded || !readExactly(body.data(), body.size())) {
            return std::nullopt;
        }
        auto value = CborCodec::decode(body);
        EXPECT_TRUE(value);
        return value ? std::optional<Value>(*value) : std::nullopt;
    }

    // True when the service closed the connection (end of file, not the guard).
    bool closedByService() {
        std::uint8_t byte;
        return ::recv(fd_, &byte, 1, 0) == 0;
    }

    // Bytes written that the service has not read yet.
    int unreadByService() const {
        int queued = -1;
        ::ioctl(fd_, SIOCOUTQ, &queued);
        return queued;
    }

private:
    bool readExactly(std::uint8_t* out, std::size_t size) {
        std::size_t done = 0;
        while (done < size) {
            const ssize_t n = ::recv(fd_, out + done, size - done, 0);
            if (n <= 0) {
                return false;
            }
            done += static_cast<std::size_t>(n);
        }
        return true;
    }

    int fd_;
};

} // namespace quarn::test
