#pragma once
// The requests the tool sends.

#include "Daemon/support/Value.h"

#include <cstdint>
#include <string>

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

} // namespace quarn::loadbench
