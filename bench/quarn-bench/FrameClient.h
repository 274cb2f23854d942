#pragma once
// A blocking client of the request service: one connection, one request at
// a time, framed and encoded exactly as the daemon expects. The same client
// talks to the daemon and to the echo floor, so its own cost is the same on
// both sides of a ratio.

#include "Daemon/support/Value.h"

#include <cstdint>
#include <filesystem>
#include <vector>

namespace quarn::loadbench {

class FrameClient {
public:
    // Stops the tool when the socket does not accept.
    explicit FrameClient(const std::filesystem::path& socket);
    ~FrameClient();
    FrameClient(const FrameClient&) = delete;
    FrameClient& operator=(const FrameClient&) = delete;

    // Whether something accepts on `socket` now.
    static bool canConnect(const std::filesystem::path& socket);

    // Sends the request with the reply flag and decodes the reply; stops
    // the tool when the connection fails or the reply does not decode.
    Value roundTrip(const Value& request);

private:
    int fd_ = -1;
    std::vector<std::uint8_t> body_; // reused for every reply
};

} // namespace quarn::loadbench
