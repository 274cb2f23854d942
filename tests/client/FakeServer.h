#pragma once
// A stand-in for quarnd in client tests: listens at a socket of its own,
// greets each client, records each request frame with its reply flag and writes back whatever
// bytes the test wants (a good reply frame or a broken one), one connection
// after the other.

#include "common/shared/FrameSocket.h"

#include <mutex>
#include <thread>
#include <unistd.h>

#include <sys/socket.h>

namespace quarn::test {

class FakeServer {
public:
    struct Response {
        std::vector<std::uint8_t> bytes;
        bool closeAfter = false;
    };
    static Response reply(const Value& v) { return {FrameSocket::frame(v, 0)}; }

    explicit FakeServer(std::function<Response(const Value&)> respond)
        : respond_(std::move(respond)) {}
    ~FakeServer() {
        ::shutdown(listener_, SHUT_RDWR);
        thread_.join();
        ::close(listener_);
        std::filesystem::remove(path);
    }

    std::vector<std::pair<Value, bool>> requests() const {
        std::lock_guard lock(mutex_);
        return requests_;
    }

    const std::filesystem::path path = std::filesystem::temp_directory_path() /
                                       ("quarn-fake-" + std::to_string(::getpid()) + "-" +
                                        std::to_string(reinterpret_cast<std::uintptr_t>(this)));

private:
    std::function<Response(const Value&)> respond_;
    mutable std::mutex mutex_; // guards requests_, written by the server thread
    std::vector<std::pair<Value, bool>> requests_;
    int listener_ = FrameSocket::listenAt(path, 8);
    std::thread thread_{[this] {
        FrameSocket::acceptEach(listener_, [this](int fd) {
            std::vector<std::uint8_t> body;
            const bool greeted = FrameSocket::writeGreeting(fd);
            while (auto frame = greeted ? FrameSocket::readFrame(fd, body) : std::nullopt) {
                const Value request = frame->message ? *frame->message : Value();
                {
                    std::lock_guard lock(mutex_);
                    requests_.emplace_back(request, frame->header.expectsReply);
                }
                const Response response = respond_(request);
                if (!FrameSocket::writeAll(fd, response.bytes) || response.closeAfter) {
                    break;
                }
            }
            ::close(fd);
        });
    }};
};

} // namespace quarn::test
