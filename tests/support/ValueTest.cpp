#include "Daemon/support/Value.h"
#include "Daemon/support/QRNError.h"
#include "common/LogCapture.h"

#include <gtest/gtest.h>

#include <uuid/uuid.h>

#include <algorithm>
#include <unordered_set>

using namespace quarn;

TEST(Value, TypedAccessorsEqualityHashAndCopies) {
    Value s("text");
    EXPECT_FALSE(s.asUInt64() || s.asBool() || s.asDictionary() || s.asArray() || s.get("key"));
    EXPECT_EQ(*s.asString(), "text");
    // Integers convert between signedness only where the value fits.
    EXPECT_EQ(Value(-1).asUInt64(), std::nullopt);
    EXPECT_EQ(Value(7).asUInt64(), 7u);
    EXPECT_EQ(Value(UINT64_MAX).asInt64(), std::nullopt);
    EXPECT_EQ(Value(2.5).asUInt64(), std::nullopt);
    EXPECT_EQ(Value(true).asUInt64(), std::nullopt);
    EXPECT_EQ(Value(3u).asDouble(), 3.0);
    EXPECT_TRUE(Value(3u).isNumber() && !Value(true).isNumber());

    // Equality and hash agree; copies are independent.
    EXPECT_NE(Value(5), Value(5.0));
    EXPECT_NE(Value(1), Value(true));
    EXPECT_NE(Value("a"), Value(Value::Data{'a'}));
    UUID u = UUID::random();
    Value a =
        Value::Dictionary{{"k", Value::Array{1, "two", u, Date{42}}}, {"d", Value::Data{1, 2}}};
    Value b =
        Value::Dictionary{{"d", Value::Data{1, 2}}, {"k", Value::Array{1u, "two", u, Date{42}}}};
    EXPECT_EQ(a, b);
    std::unordered_set<Value> set{a, b, Value("x"), Value(5), Value(5u)};
    EXPECT_EQ(set.size(), 3u);
    // Changing a copy, even deep inside, leaves the original alone.
    Value c = a;
    c.mutableDictionary()["k"].append(3);
    c.set("y", 2);
    EXPECT_NE(a, c);
    EXPECT_EQ(a, b);
    EXPECT_TRUE(c.erase("y"));
    EXPECT_FALSE(c.erase("y"));

    // The description is deterministic and readable.
    Value v =
        Value::Dictionary{{"b", Value::Array{1, "s"}}, {"a", true}, {"c", Value::Dictionary{}}};
    EXPECT_EQ(v.description(),
              "{\n    \"a\" = true;\n    \"b\" = (\n        1,\n        \"s\"\n    );\n"
              "    \"c\" = {};\n}");
    EXPECT_EQ(Value().description(), "(null)");
    EXPECT_EQ(Value(Value::Data{0xde, 0xad}).description(), "<dead>");
}

// Every one-character change of valid texts (in both cases) is accepted or
// refused as libuuid does, and gives its bytes; the string form is upper case.
TEST(UUID, ParseAgreesWithLibuuidAndCanonicalFormIsUpperCase) {
    auto libuuidParse = [](const std::string& text) -> std::optional<UUID> {
        UUID::Bytes bytes;
        if (text.size() != 36 || uuid_parse(text.c_str(), bytes.data()) != 0)
            return std::nullopt;
        return UUID(bytes);
    };
    for (int round = 0; round < 4; ++round) {
        std::string text = UUID::random().string();
        EXPECT_EQ(text.find_first_of("abcdef"), std::string::npos) << text;
        if (round % 2)
            std::transform(text.begin(), text.end(), text.begin(), ::tolower);
        ASSERT_TRUE(UUID::parse(text)) << text;
        EXPECT_EQ(UUID::parse(text), libuuidParse(text)) << text;
        EXPECT_EQ(UUID::parse(UUID::parse(text)->string()), UUID::parse(text));
        for (std::size_t i = 0; i < text.size(); ++i)
            for (char c : std::string("0a9fAFgG-_ /:@`{")) {
                std::string changed = text;
                changed[i] = c;
                EXPECT_EQ(UUID::parse(changed), libuuidParse(changed)) << changed;
            }
        EXPECT_FALSE(UUID::parse(text + "0"));
        EXPECT_FALSE(UUID::parse(text.substr(1)));
    }
    EXPECT_NE(UUID::random(), UUID::random());
    EXPECT_TRUE(UUID().isNil() && !UUID::random().isNil());
}

TEST(QRNError, CarriesFunctionLineAndLogsOnce) {
    test::LogCapture capture;
    Error inner = QRN_POSIX_ERROR(ENOENT, "stat of [{}] failed: {}", "/x", "No such file");
    Error outer = QRN_ERROR_UNDERLYING(inner, kQRNErrorMoveDirFailed,
                                       "Failed to move dir: {} to: {}", "/a", "/b");
    EXPECT_TRUE(inner.isPOSIX(ENOENT));
    EXPECT_EQ(outer.qrnCode(99), 4u); // the code clients see
    EXPECT_EQ(inner.qrnCode(99), 99u);
    EXPECT_EQ(outer.message, "Failed to move dir: /a to: /b");
    EXPECT_NE(outer.function.find("CarriesFunctionLineAndLogsOnce"), std::string::npos);
    ASSERT_TRUE(outer.underlying);
    EXPECT_EQ(outer.underlying->code, ENOENT);
    EXPECT_EQ(capture.count("Failed to move dir: /a to: /b"), 1u) << capture.all();
    EXPECT_TRUE(capture.contains(std::to_string(outer.line) + ": Failed to move dir: /a to: /b ("));
    EXPECT_NE(outer.description().find("QRNErrorDomain"), std::string::npos);

    EXPECT_EQ(qualifiedFunctionName("quarn::Result<int> quarn::A::f(int, std::map<int, int>)"),
              "quarn::A::f");
    EXPECT_EQ(qualifiedFunctionName("void f()"), "f");
    EXPECT_EQ(qualifiedFunctionName("static std::vector<std::pair<int, int> > quarn::B::g() const"),
              "quarn::B::g");
}
