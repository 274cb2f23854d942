// quarnctl against an in-test server: the request each subcommand sends,
// text and JSON output, and the exit codes scripts rely on.

#include "Client/quarnctl/Quarnctl.h"

#include "FakeServer.h"
#include "common/TempRoot.h"

#include <gtest/gtest.h>

#include <sstream>

using namespace quarn;
using namespace quarn::ctl;
using namespace quarn::test;

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
            args.insert(args.begin(), {"--socket", socket_.string()});
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

    Value lastRequest() const { return server_.requests().back(); }

    TempRoot root_{TempRoot::Options{.withMobileUser = true, .installContext = false}};
    std::filesystem::path socket_ = root_.path() / "quarnd.sock";
    Value nextReply_ = Value::dictionary();
    FakeServer server_{socket_, [this](const Value&) {
                           return FakeServer::Response{FakeServer::frame(nextReply_)};
                       }};
};

} // namespace

TEST_F(QuarnctlTest, CreatePrintsTheContainerAndSendsCommandZero) {
    const UUID uuid = UUID::random();
    nextReply_.set("ReplyError", 1u);
    nextReply_.set("ReplyUUID", uuid);
    nextReply_.set("ReplyExisted", false);
    nextReply_.set("ReplyPath", "/data/X");
    nextReply_.set("ReplyIdentifier", "com.example.notes");
    auto result = run({"create", "-c", "appData", "com.example.notes"});
    EXPECT_EQ(result.code, 0) << result.err;
    EXPECT_EQ(result.out, "path        /data/X\nuuid        " + uuid.string() +
                              "\nidentifier  com.example.notes\nexisted     no\n");
    EXPECT_EQ(lastRequest().get("CreateIfNecessary")->asBool(), true);
    EXPECT_EQ(lastRequest().get("ContainerClass")->asUInt64(), 2u);

    // Global options may follow the subcommand.
    result = run({"lookup", "--class", "2", "--json"});
    EXPECT_EQ(result.code, 0);
    EXPECT_NE(result.out.find("\"$uuid\": \"" + uuid.string() + "\""), std::string::npos)
        << result.out;
    EXPECT_EQ(lastRequest().get("CreateIfNecessary")->asBool(), false);
    EXPECT_EQ(lastRequest().get("Identifier"), nullptr);
}

TEST_F(QuarnctlTest, DaemonErrorsGoToStderrWithExitOne) {
    nextReply_.set("ReplyError", 21u);
    auto result = run({"info", "get", "-c", "appData", "com.example.gone", "Color"});
    EXPECT_EQ(result.code, Quarnctl::kFailed);
    EXPECT_EQ(result.err, "error 21 (ContainerNotFound)\n");
    EXPECT_EQ(result.out, "");
    EXPECT_EQ(*lastRequest().get("Key"), Value("Color"));
}

TEST_F(QuarnctlTest, InfoSetReadsTheValueAsTextOrAsJson) {
    nextReply_.set("ReplyError", 1u);
    ASSERT_EQ(run({"info", "set", "-c", "appData", "com.example.notes", "Color", "42"}).code, 0);
    EXPECT_EQ(*lastRequest().get("Value")->asString(), "42");
    ASSERT_EQ(run({"info", "set", "-c", "appData", "com.example.notes", "Size", "--json-value",
                   R"({"$int": -42})"})
                  .code,
              0);
    EXPECT_EQ(lastRequest().get("Value")->asInt64(), -42);
    EXPECT_EQ(run({"info", "set", "-c", "2", "x", "K", "--json-value", "{"}).code,
              Quarnctl::kUsage);
}

TEST_F(QuarnctlTest, RawSendsTheJsonRequestAndPrintsTheReplyInTheConvention) {
    nextReply_.set("ReplyError", 49u);
    nextReply_.set("ReplyData", Value::Data{1, 2, 3});
    auto result =
        run({"raw", R"({"Command": 27, "Id": {"$uuid": "E621E1F8-C36C-495A-93FC-0C247A3E6E5F"}})"});
    EXPECT_EQ(result.code, Quarnctl::kFailed);
    EXPECT_EQ(result.err, "error 49 (InvalidCommand)\n");
    EXPECT_NE(result.out.find(R"("$data": "AQID")"), std::string::npos) << result.out;
    EXPECT_EQ(lastRequest().get("Id")->kind(), Value::Kind::UUID);
    EXPECT_EQ(run({"raw", "[1, 2]"}).code, Quarnctl::kUsage);
}

TEST_F(QuarnctlTest, UsageErrorsAndAnUnreachableDaemonHaveTheirOwnCodes) {
    EXPECT_EQ(run({"create", "-c", "appdata2", "x"}).code, Quarnctl::kUsage);
    EXPECT_EQ(run({"create", "x"}).code, Quarnctl::kUsage); // no class
    EXPECT_EQ(run({"metadata", "-c", "2", "--uuid", "nope", "x"}).code, Quarnctl::kUsage);
    EXPECT_EQ(run({}).code, Quarnctl::kUsage);
    EXPECT_EQ(run({"--help"}).code, Quarnctl::kSuccess);
    EXPECT_TRUE(server_.requests().empty());

    auto result = run({"--root", root_.path().string(), "personas"}, false);
    EXPECT_EQ(result.code, Quarnctl::kUnreachable);
    EXPECT_NE(result.err.find("cannot connect"), std::string::npos) << result.err;
}
