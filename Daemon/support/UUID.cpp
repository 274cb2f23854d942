#include "Daemon/support/UUID.h"

#include <cstring>
#include <uuid/uuid.h>

namespace quarn {

UUID UUID::random() {
    Bytes b;
    uuid_generate_random(b.data());
    return UUID(b);
}

namespace {

int hexDigit(char c) {
    if (c >= '0' && c <= '9') {
        return c - '0';
    }
    if (c >= 'a' && c <= 'f') {
        return c - 'a' + 10;
    }
    if (c >= 'A' && c <= 'F') {
        return c - 'A' + 10;
    }
    return -1;
}

} // namespace

// The canonical 8-4-4-4-12 form in either case, as libuuid accepts it; read
// by hand since every container name and metadata file is parsed on a
// cache rebuild and libuuid converts each byte through strtoul.
std::optional<UUID> UUID::parse(std::string_view text) {
    if (text.size() != 36) {
        return std::nullopt;
    }
    Bytes b;
    std::size_t out = 0;
    for (std::size_t i = 0; i < text.size();) {
        if (i == 8 || i == 13 || i == 18 || i == 23) {
            if (text[i] != '-') {
                return std::nullopt;
            }
            ++i;
            continue;
        }
        const int high = hexDigit(text[i]);
        const int low = hexDigit(text[i + 1]);
        if (high < 0 || low < 0) {
            return std::nullopt;
        }
        b[out++] = static_cast<std::uint8_t>(high << 4 | low);
        i += 2;
    }
    return UUID(b);
}

std::string UUID::string() const {
    char buf[37];
    uuid_unparse_upper(bytes_.data(), buf);
    return std::string(buf, 36);
}

bool UUID::isNil() const {
    for (auto b : bytes_) {
        if (b != 0) {
            return false;
        }
    }
    return true;
}

std::size_t UUID::hash() const {
    std::uint64_t a, b;
    std::memcpy(&a, bytes_.data(), 8);
    std::memcpy(&b, bytes_.data() + 8, 8);
    return std::hash<std::uint64_t>{}(a ^ (b * 0x9E3779B97F4A7C15ull));
}

} // namespace quarn
