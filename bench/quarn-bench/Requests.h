#pragma once
// The requests the tool sends, and the hex form in which a reply is handed
// to the echo server.

#include "Daemon/support/Value.h"

#include <cstdint>
#include <string>
#include <vector>

namespace quarn::loadbench {

inline constexpr std::uint64_t kReplySuccess = 1;

// Command 0: create or look up a container of the mobile user.
inline Value containerRequest(const std::string& identifier, std::uint64_t containerClass,
                              bool create) {
    return Value(Value::Dictionary{{"Command", Value(0u)},
                                   {"Identifier", Value(identifier)},
                                   {"ContainerClass", Value(containerClass)},
                                   {"CreateIfNecessary", Value(create)},
                                   {"Transient", Value(false)}});
}

std::string toHex(const std::vector<std::uint8_t>& bytes);
// Empty on anything that is not an even number of hex digits.
std::vector<std::uint8_t> fromHex(const std::string& text);

} // namespace quarn::loadbench
