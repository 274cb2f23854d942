// The client library against in-test servers and a throw-away root.

#include "Client/QRNClient.h"
#include "Client/QRNContainerClient.h"
#include "Client/QRNSandboxTokenVerifier.h"
#include "Daemon/platform/SandboxExtensionToken.h"
#include "FakeServer.h"
#include "common/TempRoot.h"
#include "common/shared/FrameSocket.h"
#include "common/shared/RequestValues.h"

#include <gtest/gtest.h>

#include <cerrno>

using namespace quarn;
using namespace quarn::test;

// The client connection against an in-test server: requests arrive framed
// with the reply flag, replies are read whole however they are split, and
// every broken reply is an error that closes the connection, not a crash.
namespace {

QRNClient adopt(FakeServer& server, QRNClient::Options options = {}) {
    auto client = QRNClient::adopt(server.takeClientEnd(), options);
    EXPECT_TRUE(client);
    return std::move(client).value();
}

Value request(std::uint64_t command) {
    return dictionaryOf({{"Command", Value(command)}});
}

// A reply frame whose header and body are as given.
FakeServer::Response rawFrame(std::uint32_t declaredLength, std::uint8_t flags,
                              std::vector<std::uint8_t> body, bool closeAfter) {
    return {FrameSocket::rawFrame(declaredLength, flags, body), closeAfter};
}

} // namespace

TEST(QRNClient, SendsFramedRequestsAndReadsRepliesInOrder) {
    // The reply to 7 is far larger than the first read: the rest comes in later reads.
    const Value blob = Value::Data(200 * 1024, 0xAB);
    FakeServer server([&](const Value& req) {
        Value keys = dictionaryOf({{"Echo", *req.get("Command")}, {"ReplyUUID", UUID::random()}});
        if (req == request(7)) {
            keys.set("Blob", blob);
        }
        return FakeServer::reply(keys);
    });
    QRNClient client = adopt(server);
    for (std::uint64_t command : {0u, 7u, 32u}) {
        auto reply = client.send(request(command));
        ASSERT_TRUE(reply) << reply.error().message;
        EXPECT_EQ(reply->get("Echo")->asUInt64(), command);
        EXPECT_EQ(reply->get("ReplyError")->asUInt64(), 1u);
        EXPECT_TRUE(reply->get("ReplyUUID")->asUUID());
        EXPECT_EQ(reply->get("Blob") ? *reply->get("Blob") : Value(),
                  command == 7 ? blob : Value());
    }
    client.close();
    EXPECT_EQ(server.requests().size(), 3u);
    EXPECT_EQ(server.replyFlags(), std::vector<bool>(3, true));
    EXPECT_EQ(server.requests()[1], request(7));
}

struct BrokenReply {
    const char* name;
    FakeServer::Response response;
    int expectedErrno;
    const char* messagePart;
};

class QRNClientBrokenReply : public ::testing::TestWithParam<BrokenReply> {};

TEST_P(QRNClientBrokenReply, IsAnErrorAndClosesTheConnection) {
    FakeServer server([](const Value&) { return GetParam().response; });
    QRNClient client = adopt(server);
    auto reply = client.send(request(0));
    ASSERT_FALSE(reply);
    EXPECT_TRUE(reply.error().isPOSIX(GetParam().expectedErrno)) << reply.error().description();
    EXPECT_NE(reply.error().message.find(GetParam().messagePart), std::string::npos)
        << reply.error().message;
    EXPECT_FALSE(client.isConnected());
    auto again = client.send(request(0));
    ASSERT_FALSE(again);
    EXPECT_TRUE(again.error().isPOSIX(ENOTCONN));
}

INSTANTIATE_TEST_SUITE_P(
    Replies, QRNClientBrokenReply,
    ::testing::Values(
        BrokenReply{"ClosedWithoutReply", {{}, true}, ECONNRESET, "without a reply"},
        BrokenReply{"TruncatedHeader", {{3, 0, 0}, true}, ECONNRESET, "after 3 of 5 bytes"},
        BrokenReply{"TruncatedBody", rawFrame(100, 0, std::vector<std::uint8_t>(10), true),
                    ECONNRESET, "after 15 of 105 bytes"},
        BrokenReply{"OverTheLimit", rawFrame(1024 * 1024 + 1, 0, {}, false), EMSGSIZE,
                    "1048577 bytes"},
        BrokenReply{"ReservedFlagBits", rawFrame(1, 0x02, {0xA0}, false), EPROTO, "flag"},
        BrokenReply{"NotCBOR", rawFrame(2, 0, {0xFF, 0xFF}, false), EBADMSG, "does not decode"},
        BrokenReply{"NotADictionary",
                    {FakeServer::frame(Value("text")), false},
                    EBADMSG,
                    "not a dictionary"},
        BrokenReply{"BytesAfterTheReply", rawFrame(1, 0, {0xA0, 0x00, 0x00}, false), EPROTO,
                    "2 unexpected bytes"}),
    [](const auto& info) { return info.param.name; });

TEST(QRNClient, TimesOutWhenNoReplyComes) {
    FakeServer server([](const Value&) { return FakeServer::Response{}; });
    QRNClient client = adopt(server, {std::chrono::milliseconds(20)});
    auto reply = client.send(request(0));
    ASSERT_FALSE(reply);
    EXPECT_TRUE(reply.error().isPOSIX(ETIMEDOUT)) << reply.error().description();
}

TEST(QRNClient, RefusesAnOversizeRequestWithoutSendingIt) {
    FakeServer server([](const Value&) { return FakeServer::reply(); });
    QRNClient client = adopt(server);
    Value huge = request(5);
    huge.set("Value", Value::Data(1024 * 1024, 0));
    auto refused = client.send(huge);
    ASSERT_FALSE(refused);
    EXPECT_TRUE(refused.error().isPOSIX(EMSGSIZE));
    // Nothing went out, so the connection is still in step.
    EXPECT_TRUE(client.send(request(0)));
    client.close();
    EXPECT_EQ(server.requests().size(), 1u);
}

TEST(QRNClient, ConnectsBelowARootPrefixAndReportsWhyItCannot) {
    TempRoot root(TempRoot::Options{.withMobileUser = true, .installContext = false});
    auto socketPath = QRNClient::socketPathForRoot(root.path());
    EXPECT_EQ(socketPath, root / "/private/var/run/quarnd/com.orvex.quarnd.sock");

    auto missing = QRNClient::connect(socketPath);
    ASSERT_FALSE(missing);
    EXPECT_TRUE(missing.error().isPOSIX(ENOENT));
    EXPECT_NE(missing.error().message.find(socketPath.string()), std::string::npos);

    auto tooLong = QRNClient::connect(root.path() / std::string(120, 'x'));
    ASSERT_FALSE(tooLong);
    EXPECT_TRUE(tooLong.error().isPOSIX(ENAMETOOLONG));

    std::filesystem::create_directories(socketPath.parent_path());
    FakeServer server(socketPath, [](const Value&) { return FakeServer::reply(); });
    for (int connection = 0; connection < 2; ++connection) {
        auto client = QRNClient::connect(socketPath);
        ASSERT_TRUE(client) << client.error().message;
        EXPECT_TRUE(client->send(request(32)));
    }
}

// Typed requests and replies: the keys each helper sends, how reply keys
// become result fields, and that replies missing keys or holding the wrong
// types are errors naming the key.
namespace {

Value withError(std::uint64_t code, Value keys = Value::dictionary()) {
    keys.set("ReplyError", code);
    return keys;
}

class QRNContainerClientTest : public ::testing::Test {
protected:
    Value nextReply_ = withError(1);
    // Answers every request with `nextReply_`.
    FakeServer server_{
        [this](const Value&) { return FakeServer::Response{FakeServer::frame(nextReply_)}; }};
    QRNClient connection_ = std::move(QRNClient::adopt(server_.takeClientEnd(), {})).value();
    QRNContainerClient client_{connection_};

    Value lastRequest() {
        connection_.close();
        return server_.requests().back();
    }
};

} // namespace

TEST_F(QRNContainerClientTest, CreateOrLookupSendsItsKeysAndReadsTheContainer) {
    const UUID uuid = UUID::random();
    // The UUID as 16 bytes of data is read as well as a UUID value.
    nextReply_ = withError(
        1, dictionaryOf({{"ReplyUUID", Value::Data(uuid.bytes().begin(), uuid.bytes().end())},
                         {"ReplyExisted", true},
                         {"ReplyPath", "/private/var/mobile/Containers/Data/Application/X"},
                         {"ReplyIdentifier", "com.example.notes"}}));
    auto container = client_.createOrLookup("com.example.notes", 2, true, false);
    ASSERT_TRUE(container) << container.error().description();
    EXPECT_EQ(container->uuid, uuid);
    EXPECT_TRUE(container->existed);
    EXPECT_EQ(container->identifier, "com.example.notes");
    EXPECT_FALSE(container->sandboxToken);
    EXPECT_EQ(lastRequest(), dictionaryOf({{"Command", 0u},
                                           {"Identifier", "com.example.notes"},
                                           {"ContainerClass", 2u},
                                           {"CreateIfNecessary", true},
                                           {"Transient", false}}));
}

TEST_F(QRNContainerClientTest, NoIdentifierMeansTheCallersOwnAndAUUIDNamesTheContainer) {
    nextReply_ = withError(1, dictionaryOf({{"ReplyInfoValue", "blue"}}));
    const UUID uuid = UUID::random();
    auto value = client_.infoValue({std::nullopt, 2, uuid}, "Color");
    ASSERT_TRUE(value);
    EXPECT_EQ(*value, Value("blue"));
    auto sent = lastRequest();
    EXPECT_EQ(sent.get("Identifier"), nullptr);
    EXPECT_EQ(sent.get("UUID")->asUUID(), uuid);
    EXPECT_EQ(sent.get("Command")->asUInt64(), 6u);
}

TEST_F(QRNContainerClientTest, StageForDeleteSendsFourParallelArrays) {
    std::vector<QRNStagedContainer> containers = {{2, UUID::random(), "a", ""},
                                                  {7, UUID::random(), "group.b", "P"}};
    ASSERT_TRUE(client_.stageForDelete(containers));
    auto sent = lastRequest();
    for (const char* key :
         {"ContainerClassesArray", "UUIDsArray", "IdentifiersArray", "PersonaUniqueStringsArray"}) {
        ASSERT_NE(sent.get(key), nullptr) << key;
        EXPECT_EQ(sent.get(key)->size(), 2u) << key;
    }
    EXPECT_EQ(sent.get("UUIDsArray")->asArray()->at(1).asUUID(), containers[1].uuid);
}

TEST_F(QRNContainerClientTest, DaemonErrorsCarryTheirCodeAndName) {
    nextReply_ = withError(21);
    auto missing = client_.createOrLookup("com.example.gone", 2, false, false);
    ASSERT_FALSE(missing);
    EXPECT_EQ(missing.error().kind, ClientError::Kind::Daemon);
    EXPECT_EQ(missing.error().description(), "error 21 (ContainerNotFound)");

    nextReply_ = withError(49);
    EXPECT_EQ(client_.retired().error().code, 49u);
}

TEST_F(QRNContainerClientTest, RepliesWithoutThePromisedKeysAreBadReplies) {
    struct Case {
        Value reply;
        const char* mentions;
    };
    const std::vector<Case> cases = {
        {Value::dictionary(), "\"ReplyError\" is missing"},
        {dictionaryOf({{"ReplyError", "1"}}), "ReplyError"},
        {withError(1, dictionaryOf({{"ReplyPath", 5u}})), "\"ReplyPath\" is a"},
        {withError(1), "\"ReplyPath\" is missing"},
    };
    for (const auto& c : cases) {
        nextReply_ = c.reply;
        auto path = client_.systemContainerPath(std::nullopt);
        ASSERT_FALSE(path) << c.mentions;
        EXPECT_EQ(path.error().kind, ClientError::Kind::BadReply);
        EXPECT_NE(path.error().message.find(c.mentions), std::string::npos) << path.error().message;
    }
}

TEST_F(QRNContainerClientTest, ListsAndGroupDictionariesAreCheckedItemByItem) {
    const UUID uuid = UUID::random();
    nextReply_ = withError(1, dictionaryOf({{"ReplyIdsArray", Value::Array{"a", "b"}},
                                            {"ReplyUUIDsArray", Value::Array{uuid}}}));
    auto uneven = client_.containersOfClass(2, false);
    ASSERT_FALSE(uneven);
    EXPECT_EQ(uneven.error().kind, ClientError::Kind::BadReply);

    // An absent persona array reads as empty: containers without personas add nothing.
    nextReply_ = withError(1, dictionaryOf({{"ReplyIdsArray", Value::Array{"a"}},
                                            {"ReplyUUIDsArray", Value::Array{uuid}}}));
    auto list = client_.containersOfClass(2, false);
    ASSERT_TRUE(list) << list.error().description();
    EXPECT_EQ(list->uuids, std::vector<UUID>{uuid});
    EXPECT_TRUE(list->personaUniqueStrings.empty());

    nextReply_ =
        withError(1, dictionaryOf({{"ReplyGroupContainerDict", dictionaryOf({{"group.a", 3u}})}}));
    auto groups = client_.groupContainers("com.example.owner");
    ASSERT_FALSE(groups);
    EXPECT_NE(groups.error().message.find("\"group.a\""), std::string::npos);
}

TEST_F(QRNContainerClientTest, NoReplyIsATransportError) {
    connection_.close();
    auto personas = client_.personaUniqueStrings();
    ASSERT_FALSE(personas);
    EXPECT_EQ(personas.error().kind, ClientError::Kind::Transport);
    EXPECT_EQ(personas.error().code, 0u);
}

// Tokens from replies checked against the daemon's key file below its root.
TEST(QRNSandboxTokenVerifier, AcceptsOnlyTokensOfTheDaemonsCurrentKey) {
    TempRoot root(TempRoot::Options{.withMobileUser = true, .installContext = false});
    SandboxExtensionToken::Key key{}, otherKey{};
    key.fill(0x5A);
    otherKey.fill(0x33);
    auto token = SandboxExtensionToken::make(key, "com.orvex.sandbox.container",
                                             "/private/var/mobile/Containers/Data/X", 42, 1000);
    ASSERT_TRUE(token);

    auto noKeyYet = QRNSandboxTokenVerifier::verifySandboxToken(*token, root.path());
    ASSERT_FALSE(noKeyYet);
    EXPECT_TRUE(noKeyYet.error().isPOSIX(ENOENT));

    const std::string keyFile = "/private/var/run/quarnd/extension.key";
    root.writeFile(keyFile, std::string(key.begin(), key.end()));
    EXPECT_EQ(QRNSandboxTokenVerifier::verifySandboxToken(*token, root.path()).value_or(false),
              true);
    auto tampered = *token;
    tampered[tampered.size() - 1] = tampered.back() == '0' ? '1' : '0';
    EXPECT_EQ(QRNSandboxTokenVerifier::verifySandboxToken(tampered, root.path()).value_or(true),
              false);

    root.writeFile(keyFile, std::string(otherKey.begin(), otherKey.end()));
    EXPECT_EQ(QRNSandboxTokenVerifier::verifySandboxToken(*token, root.path()).value_or(true),
              false);

    root.writeFile(keyFile, "short");
    auto broken = QRNSandboxTokenVerifier::verifySandboxToken(*token, root.path());
    ASSERT_FALSE(broken);
    EXPECT_TRUE(broken.error().isPOSIX(EINVAL));
}
