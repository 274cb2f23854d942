#include "Daemon/platform/CborCodec.h"

#include <gtest/gtest.h>

#include <cmath>
#include <cstdint>
#include <limits>
#include <string>
#include <vector>

using namespace quarn;

namespace {

using Bytes = std::vector<std::uint8_t>;

Bytes concat(Bytes a, const Bytes& b) {
    a.insert(a.end(), b.begin(), b.end());
    return a;
}

// `depth` arrays inside each other around a 0.
Bytes nestedArrays(std::size_t depth) {
    return concat(Bytes(depth, 0x81), Bytes{0x00});
}

Value everyKind() {
    Value::Dictionary d;
    d["uints"] = Value::Array{0u,
                              23u,
                              24u,
                              255u,
                              256u,
                              65536u,
                              std::uint64_t{1} << 32,
                              std::numeric_limits<std::uint64_t>::max()};
    d["ints"] = Value::Array{-1, -24, -25, -257, std::numeric_limits<std::int64_t>::min()};
    d["reals"] = Value::Array{1.5, -0.25, 1e300};
    d["bools"] = Value::Array{true, false};
    d["texts"] = Value::Array{Value(""), Value("Identifier"), Value("h\xC3\xA9llo \xE2\x9C\x93")};
    d["data"] = Value::Array{Value(Value::Data{}), Value(Value::Data{0, 0xff, 0x10})};
    d["dates"] = Value::Array{Value(Date{1700000000123456}), Value(Date{-86400000001})};
    d["uuid"] = Value(UUID::random());
    d["none"] = Value();
    d["nested"] = Value::Array{Value::array(), Value::dictionary(),
                               Value::Array{Value(Value::Dictionary{{"k", Value::Array{1u}}})}};
    return Value(std::move(d));
}

} // namespace

TEST(CborCodecTest, EveryKindRoundTripsAndKeepsItsSign) {
    const Value original = everyKind();
    const auto decoded = CborCodec::decode(CborCodec::encode(original));
    ASSERT_TRUE(decoded) << decoded.error().message;
    EXPECT_EQ(*decoded, original) << decoded->description();
    EXPECT_EQ(decoded->get("ints")->asArray()->front().kind(), Value::Kind::Int64);
    EXPECT_EQ(decoded->get("uints")->asArray()->back().kind(), Value::Kind::UInt64);
    EXPECT_EQ(decoded->get("uuid")->kind(), Value::Kind::UUID);
    EXPECT_EQ(decoded->get("dates")->asArray()->front().kind(), Value::Kind::Date);
}

TEST(CborCodecTest, WireFormIsPlainCborOtherClientsCanRead) {
    UUID::Bytes raw{};
    for (std::size_t i = 0; i < raw.size(); ++i) {
        raw[i] = static_cast<std::uint8_t>(i);
    }
    EXPECT_EQ(CborCodec::encode(Value(UUID(raw))),
              concat(Bytes({0xd8, 0x25, 0x50}), Bytes(raw.begin(), raw.end())));
    EXPECT_EQ(CborCodec::encode(Value(Date{1500000})),
              Bytes({0xc1, 0xfb, 0x3f, 0xf8, 0, 0, 0, 0, 0, 0}));
    EXPECT_EQ(CborCodec::encode(Value(Value::Dictionary{{"a", Value(1u)}, {"b", Value(-1)}})),
              Bytes({0xa2, 0x61, 'a', 0x01, 0x61, 'b', 0x20}));
    EXPECT_EQ(CborCodec::encode(Value()), Bytes({0xf6}));
    EXPECT_EQ(CborCodec::encode(Value(Value::Data{7})), Bytes({0x41, 0x07}));

    // What other encoders may send: short floats, a date in whole seconds.
    EXPECT_EQ(*CborCodec::decode(Bytes({0xf9, 0x3e, 0x00})), Value(1.5));
    EXPECT_EQ(*CborCodec::decode(Bytes({0xfa, 0x3f, 0xc0, 0, 0})), Value(1.5));
    EXPECT_EQ(*CborCodec::decode(Bytes({0xc1, 0x1a, 0x65, 0x53, 0xf1, 0x00})),
              Value(Date{1700000000LL * 1000000}));
    EXPECT_TRUE(CborCodec::decode(Bytes({0xf6}))->isNone());
}

TEST(CborCodecTest, EveryTruncationAndAnyTrailingByteIsRefused) {
    const Bytes valid = CborCodec::encode(everyKind());
    for (std::size_t length = 0; length < valid.size(); ++length) {
        const std::span<const std::uint8_t> prefix(valid.data(), length);
        EXPECT_FALSE(CborCodec::decode(prefix)) << "prefix of " << length << " bytes";
    }
    const auto trailing = CborCodec::decode(concat(valid, Bytes({0x00})));
    ASSERT_FALSE(trailing);
    EXPECT_NE(trailing.error().message.find("follow the value"), std::string::npos);
}

TEST(CborCodecTest, NestingAndSizeLimits) {
    EXPECT_TRUE(CborCodec::decode(nestedArrays(32)));
    EXPECT_FALSE(CborCodec::decode(nestedArrays(33)));
    EXPECT_TRUE(CborCodec::decode(nestedArrays(3), {.maxBytes = 64, .maxNesting = 3}));
    EXPECT_FALSE(CborCodec::decode(nestedArrays(4), {.maxBytes = 64, .maxNesting = 3}));
    // Maps count as nesting too.
    EXPECT_FALSE(CborCodec::decode(Bytes({0xa1, 0x61, 'k', 0x81, 0x81, 0x00}),
                                   {.maxBytes = 64, .maxNesting = 2}));

    const Bytes text = CborCodec::encode(Value(std::string(20, 'x')));
    EXPECT_TRUE(CborCodec::decode(text, {.maxBytes = text.size(), .maxNesting = 1}));
    EXPECT_FALSE(CborCodec::decode(text, {.maxBytes = text.size() - 1, .maxNesting = 1}));
}

TEST(CborCodecTest, MalformedInputIsRefusedForItsReason) {
    struct Case {
        const char* name;
        Bytes input;
        const char* reason;
    };
    const Case cases[] = {
        {"empty", {}, "ends after 0 bytes"},
        {"2^64-6 items", {0x9b, 0xff, 0xff, 0xff, 0xff, 0xff, 0xff, 0xff, 0xfa}, "declares"},
        {"map of 2^32 pairs", {0xbb, 0, 0, 0, 1, 0, 0, 0, 0, 0x00}, "declares"},
        {"array of 9 in 8 bytes", {0x89, 1, 2, 3, 4, 5, 6, 7}, "declares"},
        {"inner array too long",
         {0x82, 0x83, 0x01, 0x02, 0x03, 0x84, 0x01, 0x02, 0x03},
         "declares"},
        {"array and its siblings longer than the rest", {0x85, 0x84, 0, 0, 0, 0}, "declares"},
        {"byte string of 2^40", {0x5b, 0, 0, 1, 0, 0, 0, 0, 0, 0x00}, "ends inside"},
        {"text of 2^32-1", {0x7a, 0xff, 0xff, 0xff, 0xff, 'a'}, "ends inside"},
        {"integer key", {0xa1, 0x01, 0x02}, "not text"},
        {"byte string key", {0xa1, 0x41, 0x00, 0x02}, "not text"},
        {"array key", {0xa1, 0x80, 0x02}, "not text"},
        {"tagged key", {0xa1, 0xc1, 0x00, 0x02}, "tagged"},
        {"duplicate key", {0xa2, 0x61, 'a', 0x01, 0x61, 'a', 0x02}, "twice"},
        {"unknown tag", {0xc2, 0x41, 0x00}, "tag 2"},
        {"UUID of 15 bytes", concat(Bytes({0xd8, 0x25, 0x4f}), Bytes(15, 0)), "16 bytes"},
        {"UUID as text", concat(Bytes({0xd8, 0x25, 0x70}), Bytes(16, 'a')), "16 bytes"},
        {"date over text", {0xc1, 0x61, '1'}, "no time"},
        {"date over NaN", {0xc1, 0xf9, 0x7e, 0x00}, "no time"},
        {"date beyond range", {0xc1, 0x1b, 0x7f, 0, 0, 0, 0, 0, 0, 0}, "no time"},
        {"tag over tag", {0xc1, 0xc1, 0x00}, "another tag"},
        {"tag over array", {0xd8, 0x25, 0x80}, "over an array"},
        {"indefinite array", {0x9f, 0xff}, "indefinite"},
        {"indefinite map", {0xbf, 0xff}, "indefinite"},
        {"indefinite text", {0x7f, 0xff}, "indefinite"},
        {"lone break", {0xff}, "indefinite"},
        {"undefined", {0xf7}, "undefined"},
        {"simple value", {0xf8, 0x20}, "malformed"},
        {"reserved head", {0x1c}, "malformed"},
        {"integer below int64", {0x3b, 0x80, 0, 0, 0, 0, 0, 0, 0}, "below"},
        {"bad UTF-8", {0x62, 0xc3, 0x28}, "UTF-8"},
        {"overlong UTF-8", {0x62, 0xc0, 0x80}, "UTF-8"},
        {"UTF-8 surrogate", {0x63, 0xed, 0xa0, 0x80}, "UTF-8"},
    };
    for (const auto& c : cases) {
        const auto decoded = CborCodec::decode(c.input);
        ASSERT_FALSE(decoded) << c.name;
        EXPECT_EQ(decoded.error().code, kQRNErrorBadRequestArgument) << c.name;
        EXPECT_NE(decoded.error().message.find(c.reason), std::string::npos)
            << c.name << ": " << decoded.error().message;
    }
}
