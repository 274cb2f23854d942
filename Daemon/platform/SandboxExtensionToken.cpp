#include "Daemon/platform/SandboxExtensionToken.h"

#include <fmt/format.h>
#include <sodium.h>

#include <charconv>
#include <vector>

namespace quarn {

namespace {

constexpr std::string_view kVersion = "v1";
constexpr std::size_t kMaxClassSize = 256;
constexpr std::size_t kFieldCount = 6;

static_assert(SandboxExtensionToken::kKeySize == crypto_auth_hmacsha256_KEYBYTES);
static_assert(SandboxExtensionToken::kMacSize == crypto_auth_hmacsha256_BYTES);

void appendLittleEndian(std::string& out, std::uint64_t value, int bytes) {
    for (int i = 0; i < bytes; ++i) {
        out.push_back(static_cast<char>((value >> (8 * i)) & 0xff));
    }
}

void appendPrefixed(std::string& out, std::string_view field) {
    appendLittleEndian(out, field.size(), 8);
    out.append(field);
}

std::string toHex(std::string_view bytes) {
    std::string hex(bytes.size() * 2 + 1, '\0');
    sodium_bin2hex(hex.data(), hex.size(), reinterpret_cast<const unsigned char*>(bytes.data()),
                   bytes.size());
    hex.pop_back();
    return hex;
}

// Decodes exactly `hex` (even length, hex digits only) into `out`.
bool fromHex(std::string_view hex, std::uint8_t* out, std::size_t outSize) {
    if (hex.size() != outSize * 2) {
        return false;
    }
    std::size_t decoded = 0;
    const char* end = nullptr;
    const int rc = sodium_hex2bin(out, outSize, hex.data(), hex.size(), nullptr, &decoded, &end);
    return rc == 0 && decoded == outSize && end == hex.data() + hex.size();
}

template <class Int> std::optional<Int> decimal(std::string_view text) {
    Int value = 0;
    const char* end = text.data() + text.size();
    const auto [stop, error] = std::from_chars(text.data(), end, value, 10);
    if (text.empty() || error != std::errc() || stop != end) {
        return std::nullopt;
    }
    return value;
}

std::vector<std::string_view> split(std::string_view token) {
    std::vector<std::string_view> fields;
    while (fields.size() < kFieldCount + 1) {
        const std::size_t semicolon = token.find(';');
        fields.push_back(token.substr(0, semicolon));
        if (semicolon == std::string_view::npos) {
            break;
        }
        token.remove_prefix(semicolon + 1);
    }
    return fields;
}

std::string format(const SandboxExtensionToken::Fields& fields) {
    const std::string_view mac(reinterpret_cast<const char*>(fields.mac.data()), fields.mac.size());
    return fmt::format("{};{};{};{};{};{}", kVersion, fields.extensionClass, fields.pid,
                       fields.startTime, toHex(fields.path), toHex(mac));
}

} // namespace

bool SandboxExtensionToken::isValidClass(std::string_view extensionClass) {
    if (extensionClass.empty() || extensionClass.size() > kMaxClassSize) {
        return false;
    }
    for (char c : extensionClass) {
        if (c < 0x21 || c > 0x7e || c == ';') {
            return false;
        }
    }
    return true;
}

std::string SandboxExtensionToken::signedMessage(std::string_view extensionClass,
                                                 std::string_view path, std::uint32_t pid,
                                                 std::uint64_t startTime) {
    std::string message;
    appendPrefixed(message, kVersion);
    appendPrefixed(message, extensionClass);
    appendPrefixed(message, path);
    appendLittleEndian(message, pid, 4);
    appendLittleEndian(message, startTime, 8);
    return message;
}

std::optional<std::string> SandboxExtensionToken::make(const Key& key,
                                                       std::string_view extensionClass,
                                                       std::string_view path, std::uint32_t pid,
                                                       std::uint64_t startTime) {
    if (!isValidClass(extensionClass) || path.empty() || path.size() > kMaxPathSize) {
        return std::nullopt;
    }
    Fields fields{std::string(extensionClass), std::string(path), pid, startTime, {}};
    const std::string message = signedMessage(extensionClass, path, pid, startTime);
    crypto_auth_hmacsha256(fields.mac.data(),
                           reinterpret_cast<const unsigned char*>(message.data()), message.size(),
                           key.data());
    return format(fields);
}

std::optional<SandboxExtensionToken::Fields> SandboxExtensionToken::parse(std::string_view token) {
    if (token.size() > 2 * kMaxPathSize + kMaxClassSize + 2 * kMacSize + 64) {
        return std::nullopt;
    }
    const std::vector<std::string_view> parts = split(token);
    if (parts.size() != kFieldCount || parts[0] != kVersion || !isValidClass(parts[1]) ||
        parts[4].empty() || parts[4].size() > 2 * kMaxPathSize) {
        return std::nullopt;
    }
    const auto pid = decimal<std::uint32_t>(parts[2]);
    const auto startTime = decimal<std::uint64_t>(parts[3]);
    Fields fields;
    fields.path.resize(parts[4].size() / 2);
    if (!pid || !startTime ||
        !fromHex(parts[4], reinterpret_cast<std::uint8_t*>(fields.path.data()),
                 fields.path.size()) ||
        !fromHex(parts[5], fields.mac.data(), fields.mac.size())) {
        return std::nullopt;
    }
    fields.extensionClass = std::string(parts[1]);
    fields.pid = *pid;
    fields.startTime = *startTime;
    // One token per field set: "007" or upper-case hex would be a second
    // spelling of the same grant.
    if (format(fields) != token) {
        return std::nullopt;
    }
    return fields;
}

bool SandboxExtensionToken::verify(std::string_view token, const Key& key) {
    const std::optional<Fields> fields = parse(token);
    if (!fields) {
        return false;
    }
    const std::string message =
        signedMessage(fields->extensionClass, fields->path, fields->pid, fields->startTime);
    return crypto_auth_hmacsha256_verify(fields->mac.data(),
                                         reinterpret_cast<const unsigned char*>(message.data()),
                                         message.size(), key.data()) == 0;
}

} // namespace quarn
