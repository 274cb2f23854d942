#include "Daemon/platform/LinuxHostConfig.h"

#include "Daemon/platform/ConfigFile.h"
#include "Daemon/support/Log.h"

#include <charconv>
#include <cstring>

namespace quarn {

LinuxHostConfig::LinuxHostConfig(Paths paths) : paths_(std::move(paths)) {}

std::optional<std::uint32_t> LinuxHostConfig::parseFlags(std::string_view contents) {
    contents = ConfigFile::trimmed(contents);
    std::uint32_t flags = 0;
    const char* end = contents.data() + contents.size();
    // from_chars takes no sign and no base prefix, and fails on overflow.
    const auto [stop, error] = std::from_chars(contents.data(), end, flags, 10);
    if (contents.empty() || error != std::errc() || stop != end) {
        return std::nullopt;
    }
    return flags;
}

std::optional<std::uint32_t> LinuxHostConfig::multiUserFlags() const {
    const auto path = paths_.configDirectory() / "host-multiuser-flags";
    auto contents = ConfigFile::read(path, ConfigFile::Links::Follow, 256);
    if (!contents) {
        if (contents.error() != ENOENT) {
            QRN_LOG_ERROR(LogCategory::Unspecified, "Failed to read {}: {}", path.string(),
                          std::strerror(contents.error()));
        }
        return std::nullopt;
    }
    auto flags = parseFlags(*contents);
    if (!flags) {
        QRN_LOG_ERROR(LogCategory::Unspecified, "Unreadable host multi-user flags in {}",
                      path.string());
    }
    return flags;
}

} // namespace quarn
