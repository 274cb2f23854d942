#include "Daemon/support/UUID.h"

#include <gtest/gtest.h>
#include <uuid/uuid.h>

#include <cctype>
#include <optional>
#include <string>

using namespace quarn;

namespace {

// What libuuid makes of the text: the reference for the hand-written parser.
std::optional<UUID> libuuidParse(const std::string& text) {
    UUID::Bytes bytes;
    if (text.size() != 36 || uuid_parse(text.c_str(), bytes.data()) != 0) {
        return std::nullopt;
    }
    return UUID(bytes);
}

} // namespace

// Every one-character change of valid texts (in both cases) is accepted or
// refused as libuuid does, and gives its bytes.
TEST(UUIDParse, AgreesWithLibuuid) {
    const std::string replacements = "0a9fAFgG-_ /:@`{";
    for (int round = 0; round < 4; ++round) {
        std::string text = UUID::random().string();
        if (round % 2) {
            for (char& c : text) {
                c = static_cast<char>(std::tolower(static_cast<unsigned char>(c)));
            }
        }
        ASSERT_EQ(UUID::parse(text), libuuidParse(text)) << text;
        ASSERT_TRUE(UUID::parse(text)) << text;
        for (std::size_t i = 0; i < text.size(); ++i) {
            for (char c : replacements) {
                std::string changed = text;
                changed[i] = c;
                EXPECT_EQ(UUID::parse(changed), libuuidParse(changed)) << changed;
            }
        }
        EXPECT_FALSE(UUID::parse(text + "0"));
        EXPECT_FALSE(UUID::parse(text.substr(1)));
    }
}
