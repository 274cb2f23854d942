#pragma once
// Writes Values as CBOR through libcbor's encoders, appending to a buffer the
// caller owns so that a frame header and its body share one allocation.

#include "Daemon/support/Value.h"

#include <cstdint>
#include <vector>

namespace quarn {

class CborEncoder {
public:
    // Integers as CBOR integers of their sign, reals as float64, data as a
    // byte string, dates as tag 1 over float64 seconds, UUIDs as tag 37
    // over 16 bytes, dictionaries as maps with text keys, none as null.
    static void append(const Value& value, std::vector<std::uint8_t>& out);

private:
    static void appendContainer(const Value& value, std::vector<std::uint8_t>& out);
};

} // namespace quarn
