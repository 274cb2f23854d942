#include "Daemon/platform/SandboxExtensionToken.h"

#include <gtest/gtest.h>

#include <sstream>
#include <vector>

using namespace quarn;

namespace {

SandboxExtensionToken::Key keyOf(std::uint8_t fill) {
    SandboxExtensionToken::Key key;
    key.fill(fill);
    return key;
}

std::vector<std::string> fieldsOf(const std::string& token) {
    std::vector<std::string> parts;
    std::stringstream in(token);
    for (std::string part; std::getline(in, part, ';');) {
        parts.push_back(part);
    }
    return parts;
}

std::string joined(const std::vector<std::string>& parts) {
    std::string token;
    for (const auto& part : parts) {
        token += (token.empty() ? "" : ";") + part;
    }
    return token;
}

// Flips the last hex digit of a field (0 <-> 1 keeps it lower-case hex).
std::string flippedHex(std::string field) {
    field.back() = field.back() == '0' ? '1' : '0';
    return field;
}

const std::string kClass = "com.orvex.sandbox.container";
const std::string kPath = "/private/var/mobile/Containers/Data/Application/X;Y";

} // namespace

TEST(SandboxExtensionTokenTest, MadeTokenParsesBackAndVerifiesOnlyUnderItsKey) {
    const auto token = SandboxExtensionToken::make(keyOf(7), kClass, kPath, 4242, 123456789);
    ASSERT_TRUE(token);
    const auto fields = SandboxExtensionToken::parse(*token);
    ASSERT_TRUE(fields);
    EXPECT_EQ(fields->extensionClass, kClass);
    EXPECT_EQ(fields->path, kPath);
    EXPECT_EQ(fields->pid, 4242u);
    EXPECT_EQ(fields->startTime, 123456789u);
    EXPECT_TRUE(SandboxExtensionToken::verify(*token, keyOf(7)));
    EXPECT_FALSE(SandboxExtensionToken::verify(*token, keyOf(8)));
}

TEST(SandboxExtensionTokenTest, AnyChangedFieldFailsVerification) {
    const auto token = SandboxExtensionToken::make(keyOf(1), kClass, kPath, 4242, 99);
    ASSERT_TRUE(token);
    const std::vector<std::string> original = fieldsOf(*token);
    ASSERT_EQ(original.size(), 6u);
    std::vector<std::vector<std::string>> changed(5, original);
    changed[0][1] = "com.orvex.sandbox.application-group";
    changed[1][2] = "4243";
    changed[2][3] = "100";
    changed[3][4] = flippedHex(original[4]);
    changed[4][5] = flippedHex(original[5]);
    for (const auto& parts : changed) {
        const std::string forged = joined(parts);
        EXPECT_TRUE(SandboxExtensionToken::parse(forged)) << forged;
        EXPECT_FALSE(SandboxExtensionToken::verify(forged, keyOf(1))) << forged;
    }
}

TEST(SandboxExtensionTokenTest, FieldBoundariesAreNotInterchangeable) {
    // Class "a.b" with path "/c" and class "a" with path ".b/c" concatenate
    // alike; the MAC of one must not carry over to the other.
    const auto first = SandboxExtensionToken::make(keyOf(3), "a.b", "/c", 1, 2);
    const auto second = SandboxExtensionToken::make(keyOf(3), "a", ".b/c", 1, 2);
    ASSERT_TRUE(first && second);
    auto spliced = fieldsOf(*second);
    spliced[5] = fieldsOf(*first)[5];
    EXPECT_FALSE(SandboxExtensionToken::verify(joined(spliced), keyOf(3)));
}

TEST(SandboxExtensionTokenTest, MakeRefusesFieldsThatCannotBeWritten) {
    const auto key = keyOf(0);
    EXPECT_FALSE(SandboxExtensionToken::make(key, "", kPath, 1, 1));
    EXPECT_FALSE(SandboxExtensionToken::make(key, "a;b", kPath, 1, 1));
    EXPECT_FALSE(SandboxExtensionToken::make(key, "with space", kPath, 1, 1));
    EXPECT_FALSE(SandboxExtensionToken::make(key, kClass, "", 1, 1));
    EXPECT_FALSE(SandboxExtensionToken::make(
        key, kClass, std::string(SandboxExtensionToken::kMaxPathSize + 1, 'p'), 1, 1));
}

TEST(SandboxExtensionTokenTest, ParseRefusesGarbageAndSecondSpellings) {
    const auto token = SandboxExtensionToken::make(keyOf(5), "c", "/p", 12, 34);
    ASSERT_TRUE(token);
    const auto parts = fieldsOf(*token);
    auto with = [&](std::size_t index, std::string value) {
        auto copy = parts;
        copy[index] = std::move(value);
        return joined(copy);
    };
    std::string upper = parts[5];
    for (char& c : upper) {
        c = static_cast<char>(std::toupper(static_cast<unsigned char>(c)));
    }
    const std::vector<std::string> bad = {
        "",
        "v1",
        with(0, "v2"),
        *token + ";extra",
        joined({parts.begin(), parts.end() - 1}),
        with(2, "012"),
        with(2, "+12"),
        with(2, "4294967296"),
        with(3, "-1"),
        with(4, ""),
        with(4, parts[4] + "0"),
        with(4, "zz"),
        with(5, parts[5].substr(2)),
        with(5, upper),
        std::string(20000, 'a'),
    };
    for (const auto& text : bad) {
        EXPECT_FALSE(SandboxExtensionToken::parse(text)) << text;
        EXPECT_FALSE(SandboxExtensionToken::verify(text, keyOf(5))) << text;
    }
}
