#pragma once
// A stand-in for quarnd in client tests: reads request frames, records them,
// and writes back whatever bytes the test wants (a good reply frame, or a
// broken one). Serves a socketpair, or a listening socket at a path.

#include "Daemon/support/Value.h"

#include <cstdint>
#include <filesystem>
#include <functional>
#include <mutex>
#include <thread>
#include <vector>

namespace quarn::test {

class FakeServer {
public:
    struct Response {
        std::vector<std::uint8_t> bytes;
        bool closeAfter = false;
    };
    using Respond = std::function<Response(const Value& request)>;

    // A reply frame holding `reply`.
    static std::vector<std::uint8_t> frame(const Value& reply);
    // {"ReplyError": 1} merged with `keys`.
    static Response reply(Value keys = Value::dictionary());

    // On a socketpair; clientEnd() hands out the other end.
    explicit FakeServer(Respond respond);
    // Listening at `socketPath`, one connection after the other.
    FakeServer(const std::filesystem::path& socketPath, Respond respond);
    ~FakeServer();
    FakeServer(const FakeServer&) = delete;
    FakeServer& operator=(const FakeServer&) = delete;

    int takeClientEnd();
    std::vector<Value> requests() const;
    // The reply flag of every request frame read.
    std::vector<bool> replyFlags() const;

private:
    void serve(int fd);

    Respond respond_;
    int clientEnd_ = -1;
    int serverEnd_ = -1;
    int listenFd_ = -1;
    // Guards requests_ and replyFlags_, written by the server thread.
    mutable std::mutex mutex_;
    std::vector<Value> requests_;
    std::vector<bool> replyFlags_;
    std::thread thread_;
};

} // namespace quarn::test
