#pragma once
// Numbers and names the platform fixes for the container model: who owns
// bundle and system containers, and the installer service.

#include <cstdint>
#include <string_view>

namespace quarn {

class QRNPlatformConstants {
public:
    // Owner (user and group) of bundle containers and their base directories.
    static constexpr std::uint32_t kInstallationUID = 33;
    // Owner (user and group) of system and system group containers.
    static constexpr std::uint32_t kSystemContainerUID = 0;
    static constexpr std::string_view kInstallerIdentifier = "com.orvex.installer";
    // A device path; take it below the root prefix before use.
    static constexpr std::string_view kInstallerHomeDirectory = "/private/var/installer";
};

} // namespace quarn
