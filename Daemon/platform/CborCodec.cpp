#include "Daemon/platform/CborCodec.h"

#include "Daemon/platform/CborDecoder.h"
#include "Daemon/platform/CborEncoder.h"

namespace quarn {

std::vector<std::uint8_t> CborCodec::encode(const Value& value) {
    std::vector<std::uint8_t> out;
    CborEncoder::append(value, out);
    return out;
}

Result<Value> CborCodec::decode(std::span<const std::uint8_t> bytes, const Limits& limits) {
    return CborDecoder(limits).decode(bytes);
}

} // namespace quarn
