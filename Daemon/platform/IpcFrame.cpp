#include "Daemon/platform/IpcFrame.h"

#include "Daemon/platform/CborEncoder.h"
#include "Daemon/support/Log.h"
#include "Daemon/support/QRNError.h"

#include <algorithm>
#include <limits>

namespace quarn {

std::array<std::uint8_t, IpcFrame::kHeaderSize> IpcFrame::encodeHeader(std::uint32_t length,
                                                                       bool expectsReply) {
    return {static_cast<std::uint8_t>(length), static_cast<std::uint8_t>(length >> 8),
            static_cast<std::uint8_t>(length >> 16), static_cast<std::uint8_t>(length >> 24),
            expectsReply ? kExpectsReply : std::uint8_t{0}};
}

std::optional<IpcFrame::Header>
IpcFrame::decodeHeader(std::span<const std::uint8_t, kHeaderSize> bytes) {
    if ((bytes[4] & ~kExpectsReply) != 0) {
        return std::nullopt;
    }
    Header header;
    header.length =
        static_cast<std::uint32_t>(bytes[0]) | static_cast<std::uint32_t>(bytes[1]) << 8 |
        static_cast<std::uint32_t>(bytes[2]) << 16 | static_cast<std::uint32_t>(bytes[3]) << 24;
    header.expectsReply = (bytes[4] & kExpectsReply) != 0;
    return header;
}

bool IpcFrame::appendMessage(const Value& message, bool expectsReply,
                             std::vector<std::uint8_t>& out) {
    const std::size_t start = out.size();
    out.resize(start + kHeaderSize);
    CborEncoder::append(message, out);
    const std::size_t length = out.size() - start - kHeaderSize;
    if (length > std::numeric_limits<std::uint32_t>::max()) {
        QRN_LOG_FAULT(LogCategory::Vell, "A message of {} bytes does not fit a frame", length);
        out.resize(start);
        return false;
    }
    const auto header = encodeHeader(static_cast<std::uint32_t>(length), expectsReply);
    std::copy(header.begin(), header.end(), out.begin() + static_cast<std::ptrdiff_t>(start));
    return true;
}

std::vector<std::uint8_t> IpcFrame::encodeMessage(const Value& message, bool expectsReply) {
    std::vector<std::uint8_t> out;
    appendMessage(message, expectsReply, out);
    return out;
}

Value IpcFrame::greeting() {
    return Value(Value::Dictionary{{"QuarnProtocol", Value(kProtocolVersion)}});
}

bool IpcFrame::isGreeting(const Value& message) {
    return message == greeting();
}

Value IpcFrame::oversizedReply() {
    return Value(Value::Dictionary{{"ReplyError", Value(std::uint64_t{kQRNErrorException})}});
}

} // namespace quarn
