#include "Daemon/support/UUID.h"

#include <cstring>
#include <uuid/uuid.h>

namespace quarn {

UUID UUID::random() {
    Bytes b;
    uuid_generate_random(b.data());
    return UUID(b);
}

std::optional<UUID> UUID::parse(std::string_view text) {
    if (text.size() != 36) {
        return std::nullopt;
    }
    char buf[37];
    std::memcpy(buf, text.data(), 36);
    buf[36] = '\0';
    Bytes b;
    if (uuid_parse(buf, b.data()) != 0) {
        return std::nullopt;
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
