#pragma once
// The frame around every message of the request service: a 4-byte
// little-endian length N, one flag byte (bit 0: the sender expects a reply;
// the other bits must be clear), then N bytes. Shared by the daemon, the
// client library and the tools.

#include "Daemon/support/Value.h"

#include <array>
#include <cstddef>
#include <cstdint>
#include <optional>
#include <span>
#include <vector>

namespace quarn {

class IpcFrame {
public:
    static constexpr std::size_t kHeaderSize = 5;
    static constexpr std::uint8_t kExpectsReply = 0x01;
    static constexpr std::uint64_t kProtocolVersion = 1;

    struct Header {
        std::uint32_t length = 0;
        bool expectsReply = false;
    };

    static std::array<std::uint8_t, kHeaderSize> encodeHeader(std::uint32_t length,
                                                              bool expectsReply);
    // None when a reserved flag bit is set.
    static std::optional<Header> decodeHeader(std::span<const std::uint8_t, kHeaderSize> bytes);
    // Header and CBOR body of `message` in one buffer.
    static std::vector<std::uint8_t> encodeMessage(const Value& message, bool expectsReply);
    // The same appended to `out`, so that a sender can reuse its buffer.
    // False (and `out` unchanged) for a message too long for a frame.
    static bool appendMessage(const Value& message, bool expectsReply,
                              std::vector<std::uint8_t>& out);

    // The first frame on every connection, sent by the daemon (flag byte 0):
    // {"QuarnProtocol": 1}.
    static Value greeting();
    // Whether `message` is a greeting of this protocol version.
    static bool isGreeting(const Value& message);
    // What goes out instead of a reply over the frame limit.
    static Value oversizedReply();
};

} // namespace quarn
