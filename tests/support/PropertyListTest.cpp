#include "Daemon/support/PropertyList.h"

#include <gtest/gtest.h>

#include <cstring>
#include <limits>
#include <random>

using namespace quarn;

namespace {

using Bytes = std::vector<std::uint8_t>;
constexpr std::int64_t k2001 = 978307200LL * 1000000; // microseconds from 1970 to 2001

Value roundTrip(const Value& v) {
    auto bytes = binaryPropertyList(v);
    EXPECT_TRUE(bytes) << bytes.error().message;
    auto back = valueFromPropertyListBytes(*bytes);
    EXPECT_TRUE(back) << back.error().message;
    return back.value_or(Value());
}

Result<Value> parse(std::string_view text) {
    return valueFromPropertyListBytes(
        std::span(reinterpret_cast<const std::uint8_t*>(text.data()), text.size()));
}

// A binary list from encoded objects, with one-byte offsets and two-byte
// references, for shapes no writer produces.
Bytes binaryFrom(const std::vector<Bytes>& objects, std::uint64_t top = 0) {
    Bytes b = {'b', 'p', 'l', 'i', 's', 't', '0', '0'};
    std::vector<std::size_t> offsets;
    for (const auto& o : objects) {
        offsets.push_back(b.size());
        b.insert(b.end(), o.begin(), o.end());
    }
    std::size_t table = b.size();
    for (auto o : offsets) {
        b.push_back(static_cast<std::uint8_t>(o >> 8));
        b.push_back(static_cast<std::uint8_t>(o));
    }
    Bytes trailer(32, 0);
    trailer[6] = 2; // offset size
    trailer[7] = 2; // reference size
    for (int i = 0; i < 8; ++i) {
        trailer[15 - i] = static_cast<std::uint8_t>(objects.size() >> (8 * i));
        trailer[23 - i] = static_cast<std::uint8_t>(top >> (8 * i));
        trailer[31 - i] = static_cast<std::uint8_t>(table >> (8 * i));
    }
    b.insert(b.end(), trailer.begin(), trailer.end());
    return b;
}

Bytes arrayOf(std::vector<std::uint16_t> refs) {
    Bytes o = {static_cast<std::uint8_t>(0xA0 | refs.size())};
    for (auto r : refs) {
        o.push_back(static_cast<std::uint8_t>(r >> 8));
        o.push_back(static_cast<std::uint8_t>(r));
    }
    return o;
}

std::string messageOf(const Result<Value>& r) {
    return r ? "" : r.error().message;
}

} // namespace

TEST(PropertyList, EveryTypeRoundTripsThroughTheBinaryForm) {
    UUID uuid = UUID::random();
    Value v = Value::Dictionary{
        {"unsigned", Value::Array{0u, 255u, 65536u, 1ull << 32, UINT64_MAX / 2 + 1, UINT64_MAX}},
        {"signed", Value::Array{-1, -300, std::numeric_limits<std::int64_t>::min()}},
        {"real", Value::Array{0.5, -1e300, 0.0}},
        {"bool", Value::Array{true, false}},
        {"string", Value::Array{"", "h\xC3\xA9llo", std::string(5000, 'x')}},
        {"data", Value::Array{Value::Data{0, 1, 0, 255}, Value::Data{}}},
        {"date", Value::Array{Date{k2001}, Date{k2001 - 250000}, Date{k2001 + 1},
                              Date{631152000LL * 1000000 + 123456}, Date{-631152000LL * 1000000},
                              Date::now()}},
        {"nested",
         Value::Dictionary{{"empty array", Value::array()},
                           {"empty dictionary", Value::dictionary()},
                           {"deeper", Value::Array{Value::Array{Value::Dictionary{{"k", 1u}}}}}}},
        {"", "empty key"},
        {"uuid", uuid},
    };
    Value expected = v;
    expected.set("uuid", uuid.string()); // no property-list type: its canonical string
    Value back = roundTrip(v);
    EXPECT_EQ(back, expected) << back.description();

    // Signedness survives, not just the bits.
    const auto& u = *back.get("unsigned")->asArray();
    EXPECT_EQ(u[5].asUInt64(), UINT64_MAX);
    EXPECT_EQ(u[4].asUInt64(), 1ull << 63);
    const auto& s = *back.get("signed")->asArray();
    EXPECT_EQ(s[0].asInt64(), -1);
    EXPECT_EQ(s[2].asInt64(), std::numeric_limits<std::int64_t>::min());
}

TEST(PropertyList, IntegersUseTheFormatsSignedAndUnsignedEncodings) {
    // Other readers take an 8-byte integer as signed and a 16-byte one as
    // unsigned: check the encoding itself.
    auto minusOne = *binaryPropertyList(Value(-1));
    Bytes eightFF(8, 0xFF);
    ASSERT_GE(minusOne.size(), 17u);
    EXPECT_EQ(minusOne[8], 0x13);
    EXPECT_TRUE(std::equal(eightFF.begin(), eightFF.end(), minusOne.begin() + 9));
    auto max = *binaryPropertyList(Value(UINT64_MAX));
    ASSERT_GE(max.size(), 25u);
    EXPECT_EQ(max[8], 0x14);
    EXPECT_TRUE(std::all_of(max.begin() + 9, max.begin() + 17, [](auto b) { return b == 0; }));
    EXPECT_TRUE(std::equal(eightFF.begin(), eightFF.end(), max.begin() + 17));
}

TEST(PropertyList, ReadsXML) {
    auto v = parse(R"(<?xml version="1.0" encoding="UTF-8"?>
<!DOCTYPE plist PUBLIC "-//Apple//DTD PLIST 1.0//EN" "http://www.apple.com/DTDs/PropertyList-1.0.dtd">
<plist version="1.0"><dict>
  <key>negative</key><integer>-3</integer>
  <key>big</key><integer>18446744073709551615</integer>
  <key>real</key><real>2.5</real>
  <key>yes</key><true/>
  <key>text</key><string>a &amp; b</string>
  <key>data</key><data>AAEC</data>
  <key>date</key><date>2000-06-01T12:00:00Z</date>
  <!-- <array> in a comment is not an element -->
  <key>list</key><array><integer>1</integer><dict/></array>
</dict></plist>)");
    ASSERT_TRUE(v) << v.error().message;
    EXPECT_EQ(v->get("negative")->asInt64(), -3);
    EXPECT_EQ(v->get("big")->asUInt64(), UINT64_MAX);
    EXPECT_EQ(*v->get("real"), Value(2.5));
    EXPECT_EQ(*v->get("yes"), Value(true));
    EXPECT_EQ(*v->get("text"), Value("a & b"));
    EXPECT_EQ(*v->get("data"), Value(Value::Data{0, 1, 2}));
    EXPECT_EQ(v->get("date")->asDate(), Date{959860800LL * 1000000});
    EXPECT_EQ(*v->get("list"), Value(Value::Array{1u, Value::dictionary()}));
}

TEST(PropertyList, RefusesValuesWithoutAPropertyListForm) {
    Value deep = 1u;
    for (int i = 0; i < 300; ++i) {
        deep = Value::Array{deep};
    }
    for (const Value& bad : {Value(), Value(std::string("a\0b", 3)),
                             Value(Value::Dictionary{{std::string("k\0", 2), 1u}}),
                             Value(Date{k2001 - 70LL * 365 * 86400 * 1000000}),
                             Value(Date{k2001 + 70LL * 365 * 86400 * 1000000}),
                             Value(Date{std::numeric_limits<std::int64_t>::min()}), deep}) {
        auto r = binaryPropertyList(Value::Array{bad});
        ASSERT_FALSE(r) << bad.description();
        EXPECT_EQ(r.error().domain, Error::Domain::General);
        EXPECT_EQ(r.error().code, kGeneralErrorPropertyListWriteInvalid);
    }
}

TEST(PropertyList, HostileBytesGiveErrorsNotCrashes) {
    auto good = *binaryPropertyList(Value::Dictionary{
        {"a", Value::Array{1u, "two", 3.0, Date{k2001}}}, {"b", Value::Data{1, 2, 3}}});
    // Every truncation of a valid list.
    for (std::size_t n = 0; n < good.size(); ++n) {
        EXPECT_FALSE(valueFromPropertyListBytes(std::span(good.data(), n))) << n;
    }
    // Random corruption of binary and XML lists: any outcome but a crash.
    auto xmlText =
        std::string("<plist><dict><key>a</key><array><integer>1</integer>"
                    "<string>x</string><date>2001-01-01T00:00:00Z</date><data>AA==</data>"
                    "</array></dict></plist>");
    Bytes xml(xmlText.begin(), xmlText.end());
    std::mt19937 random(1234);
    for (const Bytes& base : {good, xml}) {
        for (int i = 0; i < 3000; ++i) {
            Bytes b = base;
            for (int j = 0; j < 1 + static_cast<int>(random() % 4); ++j) {
                b[random() % b.size()] = static_cast<std::uint8_t>(random());
            }
            (void)valueFromPropertyListBytes(b);
        }
    }
    for (std::string_view junk : {"", "bplist00", "<plist>", "not a plist at all", "<plist><"}) {
        auto r = parse(junk);
        ASSERT_FALSE(r) << junk;
        EXPECT_EQ(r.error().code, kGeneralErrorPropertyListReadCorrupt);
    }
}

TEST(PropertyList, RefusesShapesThatWouldExhaustTheParser) {
    auto refusal = [](const Bytes& bytes) { return messageOf(valueFromPropertyListBytes(bytes)); };
    std::string deepXML = "<plist>";
    for (int i = 0; i < 100000; ++i)
        deepXML += "<array>";
    EXPECT_NE(messageOf(parse(deepXML)).find("nested too deeply"), std::string::npos);

    auto chain = [](std::uint16_t levels) {
        std::vector<Bytes> objects;
        for (std::uint16_t i = 1; i < levels; ++i)
            objects.push_back(arrayOf({i}));
        objects.push_back({0x10, 0x05});
        return binaryFrom(objects);
    };
    EXPECT_NE(refusal(chain(5000)).find("nested too deeply"), std::string::npos);
    EXPECT_TRUE(valueFromPropertyListBytes(chain(100)));

    // Each level refers twice to the next: 2^40 nodes once expanded.
    std::vector<Bytes> laughs;
    for (std::uint16_t i = 1; i <= 40; ++i)
        laughs.push_back(arrayOf({i, i}));
    laughs.push_back({0x10, 0x01});
    EXPECT_NE(refusal(binaryFrom(laughs)).find("too many objects"), std::string::npos);
    EXPECT_NE(refusal(binaryFrom({arrayOf({0})})).find("cycle"), std::string::npos);
    EXPECT_NE(refusal(binaryFrom({arrayOf({7})})).find("outside"), std::string::npos);
    // A keyed-archive UID means nothing outside its archive.
    EXPECT_FALSE(valueFromPropertyListBytes(binaryFrom({arrayOf({1}), {0x80, 0x01}})));
}
