#pragma once
// The host's multi-user configuration, as the boot cleanup consults it.

#include <cstdint>
#include <optional>

namespace quarn {

class HostConfig {
public:
    virtual ~HostConfig() = default;
    // nullopt when the host does not say or says something unreadable.
    virtual std::optional<std::uint32_t> multiUserFlags() const = 0;
};

} // namespace quarn
