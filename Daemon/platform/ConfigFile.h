#pragma once
// The small text files the platform keeps its state and settings in
// (os-release, host flags, lock state): read whole, bounded, regular files only.

#include "Daemon/support/Expected.h"

#include <cstddef>
#include <filesystem>
#include <string>
#include <string_view>

namespace quarn {

class ConfigFile {
public:
    static constexpr std::size_t kDefaultMaxBytes = 64 * 1024;

    enum class Links { Follow, Refuse };

    // The file's bytes, or an errno value: ENOENT when it is absent, EINVAL
    // when it is no regular file, EFBIG when it holds more than `maxBytes`.
    static Expected<std::string, int> read(const std::filesystem::path& path,
                                           Links links = Links::Follow,
                                           std::size_t maxBytes = kDefaultMaxBytes);

    // `text` without leading and trailing blanks (space, tab, CR, LF, VT, FF).
    static std::string_view trimmed(std::string_view text);
    static bool isBlank(char c);
};

} // namespace quarn
