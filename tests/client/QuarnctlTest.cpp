// quarnctl: class names on the command line, the JSON convention of its
// raw requests, and the subcommands against an in-test server.

#include "Client/quarnctl/Quarnctl.h"
#include "Client/quarnctl/ContainerClassName.h"
#include "Client/quarnctl/JsonConvention.h"
#include "Daemon/model/QRNContainerClass.h"
#include "FakeServer.h"
#include "common/TempRoot.h"
#include "common/shared/RequestValues.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <limits>
#include <sstream>

using namespace quarn;
using namespace quarn::ctl;
using namespace quarn::test;

// Container classes on the command line: numbers and short names of the
// class table, nothing outside 1..13.
TEST(ContainerClassName, EveryClassByNumberAndByNameAndNothingElse) {
    for (std::uint64_t cls = 1; cls <= 13; ++cls) {
        EXPECT_EQ(ContainerClassName::parse(std::to_string(cls)), cls);
        EXPECT_EQ(ContainerClassName::parse(QRNContainerClass::shortName(cls)), cls);
    }
    EXPECT_EQ(ContainerClassName::parse("APPDATA"), 2u);
    EXPECT_EQ(ContainerClassName::parse("systemgroup"), 13u);
    for (const char* text : {"0", "14", "-1", "+2", " 2", "2x", "", "appdata2", "Undefined", "MAX",
                             "99999999999999999999"}) {
        EXPECT_FALSE(ContainerClassName::parse(text)) << text;
    }
}

// The JSON convention of quarnctl: each kind of Value has its own form, read
// into that kind and printed back the same (the text tells signed from
// unsigned, which Value's equality does not).
TEST(JsonConvention, EachKindReadsAndPrintsInItsForm) {
    const Value uuid = *UUID::parse("E621E1F8-C36C-495A-93FC-0C247A3E6E5F");
    const std::pair<std::string, Value> forms[] = {
        {"18446744073709551615", std::numeric_limits<std::uint64_t>::max()},
        {"0", std::uint64_t{0}},
        {R"({"$int":-9223372036854775808})", std::numeric_limits<std::int64_t>::min()},
        {R"({"$int":5})", std::int64_t{5}},
        {"2.0", 2.0},
        {"-0.125", -0.125},
        {"false", false},
        {R"("text with \"quotes\" and ünïcode")", "text with \"quotes\" and ünïcode"},
        {R"({"$data":"AP8QIA=="})", Value::Data{0x00, 0xFF, 0x10, 0x20}},
        {R"({"$data":""})", Value::Data{}},
        {R"({"$date":1700000000.123457})", Date{1700000000123457}},
        {R"({"$date":-86400})", Date{-86400000000}},
        {R"({"$uuid":"E621E1F8-C36C-495A-93FC-0C247A3E6E5F"})", uuid},
        {"null", Value()},
        {R"({"$$$twice":2,"$$key":1})", dictionaryOf({{"$key", 1u}, {"$$twice", 2u}})},
        {R"([[],{},{"$int":-1}])", Value::Array{Value::Array{}, Value::dictionary(), -1}},
    };
    for (const auto& [json, value] : forms) {
        auto parsed = JsonConvention::parse(json);
        ASSERT_TRUE(parsed) << json << ": " << parsed.error().message;
        EXPECT_EQ(*parsed, value) << json;
        EXPECT_EQ(JsonConvention::print(*parsed, -1), json);
    }
    EXPECT_EQ(JsonConvention::print(*JsonConvention::parse("-3"), -1), R"({"$int":-3})");
    // Indented output keeps the typed objects on one line.
    EXPECT_EQ(JsonConvention::print(dictionaryOf({{"ReplyUUID", uuid}, {"Empty", Value::array()}})),
              "{\n  \"Empty\": [],\n"
              "  \"ReplyUUID\": {\"$uuid\": \"E621E1F8-C36C-495A-93FC-0C247A3E6E5F\"}\n}");
    // Bytes that are not UTF-8 are printed, not a failure.
    EXPECT_EQ(JsonConvention::print(Value(std::string("a\xFF") + "b"), -1).substr(0, 2), "\"a");
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

// quarnctl against an in-test server: the request each subcommand sends,
// text and JSON output, and the exit codes scripts rely on.
namespace {

class QuarnctlTest : public ::testing::Test {
protected:
    struct Run {
        int code;
        std::string out;
        std::string err;
    };

    Run run(std::vector<std::string> args, bool withSocket = true) {
        if (withSocket) {
            args.insert(args.begin(), {"--socket", server_.path.string()});
        }
        args.insert(args.begin(), "quarnctl");
        std::vector<const char*> argv;
        for (const auto& arg : args) {
            argv.push_back(arg.c_str());
        }
        std::ostringstream out, err;
        int code = Quarnctl(out, err).run(static_cast<int>(argv.size()), argv.data());
        return {code, out.str(), err.str()};
    }

    Value lastRequest() const { return server_.requests().back().first; }

    TempRoot root_{TempRoot::Options{.withMobileUser = true, .installContext = false}};
    Value nextReply_ = Value::dictionary();
    FakeServer server_{[this](const Value&) { return FakeServer::reply(nextReply_); }};
};

} // namespace

// One walk through the subcommands: the request each sends, text and JSON
// output, and the exit codes scripts rely on.
TEST_F(QuarnctlTest, SubcommandsSendTheirRequestAndPrintTheReply) {
    const auto sent = [&](const char* key) {
        const Value* v = lastRequest().get(key);
        return v ? *v : Value();
    };
    const UUID uuid = UUID::random();
    nextReply_ = dictionaryOf({{"ReplyError", 1u},
                               {"ReplyUUID", uuid},
                               {"ReplyExisted", false},
                               {"ReplyPath", "/data/X"},
                               {"ReplyIdentifier", "com.example.notes"}});
    auto result = run({"create", "-c", "appData", "com.example.notes"});
    EXPECT_EQ(result.code, Quarnctl::kSuccess) << result.err;
    EXPECT_EQ(result.out, "path        /data/X\nuuid        " + uuid.string() +
                              "\nidentifier  com.example.notes\nexisted     no\n");
    EXPECT_EQ(sent("CreateIfNecessary"), Value(true));
    EXPECT_EQ(sent("ContainerClass"), Value(2u));
    // Global options may follow the subcommand.
    result = run({"lookup", "--class", "2", "--json"});
    EXPECT_EQ(result.code, Quarnctl::kSuccess);
    EXPECT_NE(result.out.find("\"$uuid\": \"" + uuid.string() + "\""), std::string::npos)
        << result.out;
    EXPECT_EQ(sent("CreateIfNecessary"), Value(false));
    EXPECT_EQ(sent("Identifier"), Value());

    nextReply_ = dictionaryOf({{"ReplyError", 21u}});
    result = run({"info", "get", "-c", "appData", "com.example.gone", "Color"});
    EXPECT_EQ(result.code, Quarnctl::kFailed);
    EXPECT_EQ(result.err, "error 21 (ContainerNotFound)\n");
    EXPECT_EQ(result.out, "");
    EXPECT_EQ(sent("Key"), Value("Color"));

    nextReply_ = dictionaryOf({{"ReplyError", 1u}});
    EXPECT_EQ(run({"info", "set", "-c", "appData", "com.example.notes", "Color", "42"}).code, 0);
    EXPECT_EQ(sent("Value"), Value("42"));
    EXPECT_EQ(run({"info", "set", "-c", "2", "x", "Size", "--json-value", R"({"$int": -42})"}).code,
              0);
    EXPECT_EQ(sent("Value").asInt64(), -42);

    nextReply_ = dictionaryOf({{"ReplyError", 49u}, {"ReplyData", Value::Data{1, 2, 3}}});
    result =
        run({"raw", R"({"Command": 27, "Id": {"$uuid": "E621E1F8-C36C-495A-93FC-0C247A3E6E5F"}})"});
    EXPECT_EQ(result.code, Quarnctl::kFailed);
    EXPECT_EQ(result.err, "error 49 (InvalidCommand)\n");
    EXPECT_NE(result.out.find(R"("$data": "AQID")"), std::string::npos) << result.out;
    EXPECT_EQ(sent("Id").kind(), Value::Kind::UUID);

    // Usage errors send nothing.
    const auto sentBefore = server_.requests().size();
    for (const std::vector<std::string>& args : std::vector<std::vector<std::string>>{
             {"info", "set", "-c", "2", "x", "K", "--json-value", "{"},
             {"raw", "[1, 2]"},
             {"create", "-c", "appdata2", "x"},
             {"create", "x"}, // no class
             {"metadata", "-c", "2", "--uuid", "nope", "x"},
             {}}) {
        EXPECT_EQ(run(args).code, Quarnctl::kUsage) << (args.empty() ? "" : args[0]);
    }
    EXPECT_EQ(run({"--help"}).code, Quarnctl::kSuccess);
    EXPECT_EQ(server_.requests().size(), sentBefore);

    result = run({"--root", root_.path().string(), "personas"}, false);
    EXPECT_EQ(result.code, Quarnctl::kUnreachable);
    EXPECT_NE(result.err.find("cannot connect"), std::string::npos) << result.err;
}
