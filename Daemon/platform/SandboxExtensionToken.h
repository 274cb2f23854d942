#pragma once
// The printable form of a sandbox extension:
//   "v1;<class>;<pid>;<start time>;<hex path>;<hex mac>"
// The MAC is HMAC-SHA256 under the daemon's per-boot key over a
// length-prefixed encoding of class, path, pid and start time, so no two
// different field sets share an encoding. Pure: no I/O, no state.

#include <array>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

namespace quarn {

class SandboxExtensionToken {
public:
    static constexpr std::size_t kKeySize = 32;
    static constexpr std::size_t kMacSize = 32;
    // Longer tokens are refused unread; a path beyond PATH_MAX is no path.
    static constexpr std::size_t kMaxPathSize = 4096;
    using Key = std::array<std::uint8_t, kKeySize>;
    using Mac = std::array<std::uint8_t, kMacSize>;

    struct Fields {
        std::string extensionClass;
        std::string path;
        std::uint32_t pid = 0;
        std::uint64_t startTime = 0;
        Mac mac{};
    };

    // None when the class is empty, longer than 256 bytes or holds anything
    // but printable ASCII other than ';', or when the path is empty or too long.
    static std::optional<std::string> make(const Key& key, std::string_view extensionClass,
                                           std::string_view path, std::uint32_t pid,
                                           std::uint64_t startTime);
    // The fields of a well-formed token (its MAC unchecked), or none.
    static std::optional<Fields> parse(std::string_view token);
    // True when the token is well-formed and its MAC is that of its fields
    // under `key` (compared in constant time).
    static bool verify(std::string_view token, const Key& key);

private:
    static bool isValidClass(std::string_view extensionClass);
    static std::string signedMessage(std::string_view extensionClass, std::string_view path,
                                     std::uint32_t pid, std::uint64_t startTime);
};

} // namespace quarn
