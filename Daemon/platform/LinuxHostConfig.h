#pragma once
// HostConfig from "<config>/host-multiuser-flags": one unsigned 32-bit
// decimal number, blanks around it allowed.

#include "Daemon/platform/HostConfig.h"
#include "Daemon/platform/Paths.h"

#include <string_view>

namespace quarn {

class LinuxHostConfig final : public HostConfig {
public:
    explicit LinuxHostConfig(Paths paths);

    std::optional<std::uint32_t> multiUserFlags() const override;

    static std::optional<std::uint32_t> parseFlags(std::string_view contents);

private:
    Paths paths_;
};

} // namespace quarn
