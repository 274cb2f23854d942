#pragma once
// 128-bit UUIDs: random generation, parsing and the canonical upper-case form
// used for container directory names.

#include <array>
#include <compare>
#include <cstdint>
#include <functional>
#include <optional>
#include <string>
#include <string_view>

namespace quarn {

class UUID {
public:
    using Bytes = std::array<std::uint8_t, 16>;

    UUID() = default; // the nil UUID
    explicit UUID(const Bytes& bytes) : bytes_(bytes) {}

    static UUID random();
    // Accepts the 36-character hyphenated form in either case; nothing else.
    static std::optional<UUID> parse(std::string_view text);

    // "E621E1F8-C36C-495A-93FC-0C247A3E6E5F"
    std::string string() const;
    const Bytes& bytes() const { return bytes_; }
    bool isNil() const;
    std::size_t hash() const;

    friend auto operator<=>(const UUID&, const UUID&) = default;

private:
    Bytes bytes_{};
};

} // namespace quarn

template <> struct std::hash<quarn::UUID> {
    std::size_t operator()(const quarn::UUID& u) const noexcept { return u.hash(); }
};
