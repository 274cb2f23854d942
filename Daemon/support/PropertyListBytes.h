#pragma once
// Byte-level knowledge of the property-list formats that libplist 2.2 does
// not offer.
//
// Its parsers recurse once per nesting level without a bound and expand every
// reference of a binary list into a fresh node, so a small hostile file can
// exhaust the stack or memory. `propertyListBytesProblem` rejects such input
// before it reaches the parser: too deep, too many objects once shared ones are
// expanded, reference cycles, offsets outside the data.
//
// The two questions about an encoded binary list answer what libplist's
// accessors lose: whether an integer was written as an unsigned 128-bit one,
// and the exact value of a date.

#include <cstddef>
#include <cstdint>
#include <optional>
#include <span>
#include <string>

namespace quarn {

struct PropertyListLimits {
    std::size_t maxDepth = 256;        // nested objects, the top one included
    std::size_t maxObjects = 1u << 18; // objects after expansion (XML: elements)
};

bool isBinaryPropertyList(std::span<const std::uint8_t> bytes);

// Why `bytes` must not be handed to the parser, or nullopt. Bytes that pass
// may still be malformed in ways the parser reports itself.
std::optional<std::string> propertyListBytesProblem(std::span<const std::uint8_t> bytes,
                                                    const PropertyListLimits& limits = {});

// Whether the top object of the binary list `bytes` is a 128-bit integer.
bool binaryTopObjectIsWideInteger(std::span<const std::uint8_t> bytes);
// The top object of the binary list `bytes` when it is a date: seconds
// since 2001-01-01 00:00:00 UTC.
std::optional<double> binaryTopObjectDate(std::span<const std::uint8_t> bytes);

} // namespace quarn
