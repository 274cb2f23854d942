#include "HexCbor.h"

#include "Daemon/platform/CborCodec.h"

#include <sodium.h>

#include <cerrno>
#include <vector>

namespace quarn::test {

std::string HexCbor::encode(const Value& value) {
    const std::vector<std::uint8_t> bytes = CborCodec::encode(value);
    std::string hex(2 * bytes.size() + 1, '\0');
    sodium_bin2hex(hex.data(), hex.size(), bytes.data(), bytes.size());
    hex.pop_back(); // the terminating NUL
    return hex;
}

Result<Value> HexCbor::decode(std::string_view hex) {
    std::vector<std::uint8_t> bytes(hex.size() / 2);
    std::size_t length = 0;
    const char* end = nullptr;
    if (hex.size() % 2 != 0 ||
        sodium_hex2bin(bytes.data(), bytes.size(), hex.data(), hex.size(), nullptr, &length,
                       &end) != 0 ||
        end != hex.data() + hex.size()) {
        return QRN_UNEXPECTED(QRN_POSIX_ERROR(EINVAL, "not an even run of hex digits"));
    }
    bytes.resize(length);
    return CborCodec::decode(bytes);
}

} // namespace quarn::test
