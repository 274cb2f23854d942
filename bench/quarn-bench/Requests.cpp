#include "Requests.h"

#include <sodium.h>

namespace quarn::loadbench {

std::string toHex(const std::vector<std::uint8_t>& bytes) {
    std::string text(bytes.size() * 2 + 1, '\0');
    sodium_bin2hex(text.data(), text.size(), bytes.data(), bytes.size());
    text.pop_back();
    return text;
}

std::vector<std::uint8_t> fromHex(const std::string& text) {
    std::vector<std::uint8_t> bytes(text.size() / 2);
    std::size_t length = 0;
    const char* end = nullptr;
    if (text.size() % 2 != 0 ||
        sodium_hex2bin(bytes.data(), bytes.size(), text.data(), text.size(), nullptr, &length,
                       &end) != 0 ||
        length != bytes.size()) {
        return {};
    }
    return bytes;
}

} // namespace quarn::loadbench
