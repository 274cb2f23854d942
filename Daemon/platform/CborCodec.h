#pragma once
// Value <-> CBOR, the wire format of requests and replies. Pure functions of
// bytes. UUIDs travel as tag 37 over 16 bytes, dates as tag 1 over the
// seconds since 1970; dictionaries are maps with text keys.

#include "Daemon/support/QRNError.h"
#include "Daemon/support/Value.h"

#include <cstddef>
#include <cstdint>
#include <limits>
#include <span>
#include <vector>

namespace quarn {

class CborCodec {
public:
    static constexpr std::uint64_t kTagDate = 1;
    static constexpr std::uint64_t kTagUUID = 37;

    struct Limits {
        std::size_t maxBytes = 1024 * 1024;
        std::size_t maxNesting = 32; // arrays and maps inside each other
        // Items decoded in all (scalars, map keys, arrays and maps): a Value
        // costs tens of bytes where its CBOR took one. An array or a map
        // counts kContainerCost items: it holds an allocation of its own.
        std::size_t maxItems = std::numeric_limits<std::size_t>::max();
    };
    static constexpr std::size_t kContainerCost = 8;

    // A none Value encodes as CBOR null.
    static std::vector<std::uint8_t> encode(const Value& value);

    // Refuses, with a message saying why: malformed or truncated input,
    // trailing bytes, input over the limits, declared lengths longer than
    // the input, more items than the budget, map keys that are not text, duplicate keys, tags other
    // than 1 and 37, a tag 37 not over 16 bytes, indefinite lengths,
    // undefined and other simple values. Null decodes as none.
    static Result<Value> decode(std::span<const std::uint8_t> bytes, const Limits& limits);
    static Result<Value> decode(std::span<const std::uint8_t> bytes) {
        return decode(bytes, Limits{});
    }
};

} // namespace quarn
