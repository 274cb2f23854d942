// The JSON convention of quarnctl: every kind of Value survives a print and
// a parse with its kind intact, and malformed input is refused with a reason.

#include "Client/quarnctl/JsonConvention.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <limits>

using namespace quarn;
using namespace quarn::ctl;

namespace {

// Deep equality that also tells signed from unsigned integers apart, which
// Value's own equality deliberately does not.
bool sameKinds(const Value& a, const Value& b) {
    if (a.kind() != b.kind() || !(a == b)) {
        return false;
    }
    if (const auto* items = a.asArray()) {
        return std::equal(items->begin(), items->end(), b.asArray()->begin(), sameKinds);
    }
    const auto* entries = a.asDictionary();
    return !entries || std::all_of(entries->begin(), entries->end(), [&](const auto& entry) {
        return sameKinds(entry.second, *b.get(entry.first));
    });
}

Value everyKind() {
    Value dictionary = Value::dictionary();
    dictionary.set("unsigned", std::numeric_limits<std::uint64_t>::max());
    dictionary.set("zero", std::uint64_t{0});
    dictionary.set("signed", std::numeric_limits<std::int64_t>::min());
    dictionary.set("signedPositive", std::int64_t{5});
    dictionary.set("real", 2.0);
    dictionary.set("fraction", -0.125);
    dictionary.set("bool", false);
    dictionary.set("string", "text with \"quotes\" and ünïcode");
    dictionary.set("data", Value::Data{0x00, 0xFF, 0x10, 0x20});
    dictionary.set("empty data", Value::Data{});
    dictionary.set("date", Date{1700000000123457});
    dictionary.set("old date", Date{-86400000000});
    dictionary.set("uuid", *UUID::parse("e621e1f8-c36c-495a-93fc-0c247a3e6e5f"));
    dictionary.set("none", Value());
    dictionary.set("$dollar", "escaped key");
    dictionary.set("$$double", "escaped twice");
    dictionary.set("list", Value::Array{Value::Array{}, Value::dictionary(), std::int64_t{-1}});
    return dictionary;
}

} // namespace

TEST(JsonConvention, EveryKindRoundTripsWithItsKind) {
    const Value original = everyKind();
    for (int indent : {2, -1}) {
        auto parsed = JsonConvention::parse(JsonConvention::print(original, indent));
        ASSERT_TRUE(parsed) << parsed.error().message;
        EXPECT_TRUE(sameKinds(*parsed, original)) << parsed->description();
    }
}

TEST(JsonConvention, ReadsTheDocumentedForms) {
    auto parsed = JsonConvention::parse(R"({"Command": 0, "n": -3, "i": {"$int": 7},
        "u": {"$uuid": "E621E1F8-C36C-495A-93FC-0C247A3E6E5F"}, "d": {"$data": "3q2+7w=="},
        "t": {"$date": 1.5}, "$$k": 1})");
    ASSERT_TRUE(parsed) << parsed.error().message;
    EXPECT_EQ(parsed->get("Command")->kind(), Value::Kind::UInt64);
    EXPECT_EQ(parsed->get("n")->kind(), Value::Kind::Int64);
    EXPECT_EQ(parsed->get("i")->kind(), Value::Kind::Int64);
    EXPECT_EQ(parsed->get("u")->asUUID()->string(), "E621E1F8-C36C-495A-93FC-0C247A3E6E5F");
    EXPECT_EQ(*parsed->get("d")->asData(), (Value::Data{0xDE, 0xAD, 0xBE, 0xEF}));
    EXPECT_EQ(parsed->get("t")->asDate()->microsecondsSince1970, 1500000);
    EXPECT_NE(parsed->get("$k"), nullptr);
    EXPECT_EQ(JsonConvention::print(Value(std::int64_t{7}), -1), R"({"$int":7})");
    // Indented output keeps the typed objects on one line.
    Value reply = Value::dictionary();
    reply.set("ReplyUUID", *parsed->get("u"));
    reply.set("Empty", Value::array());
    EXPECT_EQ(JsonConvention::print(reply),
              "{\n  \"Empty\": [],\n"
              "  \"ReplyUUID\": {\"$uuid\": \"E621E1F8-C36C-495A-93FC-0C247A3E6E5F\"}\n}");
}

TEST(JsonConvention, RefusesMalformedInput) {
    const std::string tooDeep = std::string(JsonConvention::kMaxNesting + 1, '[') +
                                std::string(JsonConvention::kMaxNesting + 1, ']');
    const std::pair<std::string, std::string_view> cases[] = {
        {R"({"$uuid": "not-a-uuid"})", "UUID"},
        {R"({"$uuid": 5})", "UUID"},
        {R"({"$data": "3q2+7w="})", "base64"},
        {R"({"$data": "3q2+7w==!"})", "base64"},
        {R"({"$date": "yesterday"})", "$date"},
        {R"({"$date": 1e300})", "$date"},
        {R"({"$int": 9223372036854775808})", "$int"},
        {R"({"$int": 1.0})", "$int"},
        {R"({"$when": 1})", "unknown key \"$when\""},
        {R"({"$uuid": "E621E1F8-C36C-495A-93FC-0C247A3E6E5F", "x": 1})", "only key"},
        {"18446744073709551616", "does not fit in 64 bits"},
        {"-9223372036854775809", "does not fit in 64 bits"},
        {"{\"a\": ", "not JSON"},
        {tooDeep, "nested deeper"},
    };
    for (const auto& [text, reason] : cases) {
        auto parsed = JsonConvention::parse(text);
        ASSERT_FALSE(parsed) << text << " parsed as " << parsed->description();
        EXPECT_NE(parsed.error().message.find(reason), std::string::npos)
            << text << ": " << parsed.error().message;
    }
}

TEST(JsonConvention, PrintsBytesThatAreNotUTF8InsteadOfFailing) {
    auto printed = JsonConvention::print(Value(std::string("a\xFF") + "b"), -1);
    EXPECT_EQ(printed.front(), '"');
    EXPECT_NE(printed.find('a'), std::string::npos);
}
