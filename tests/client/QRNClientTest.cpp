// The client connection against an in-test server: requests arrive framed
// with the reply flag, replies are read whole however they are split, and
// every broken reply is an error that closes the connection, not a crash.

#include "Client/QRNClient.h"

#include "FakeServer.h"
#include "common/TempRoot.h"
#include "common/shared/FrameSocket.h"
#include "common/shared/RequestValues.h"

#include <gtest/gtest.h>

#include <cerrno>

using namespace quarn;
using namespace quarn::test;

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
    FakeServer server([](const Value& req) {
        Value keys = Value::dictionary();
        keys.set("Echo", *req.get("Command"));
        keys.set("ReplyUUID", UUID::random());
        return FakeServer::reply(keys);
    });
    QRNClient client = adopt(server);
    for (std::uint64_t command : {0u, 7u, 32u}) {
        auto reply = client.send(request(command));
        ASSERT_TRUE(reply) << reply.error().message;
        EXPECT_EQ(reply->get("Echo")->asUInt64(), command);
        EXPECT_EQ(reply->get("ReplyError")->asUInt64(), 1u);
        EXPECT_TRUE(reply->get("ReplyUUID")->asUUID());
    }
    client.close();
    EXPECT_EQ(server.requests().size(), 3u);
    EXPECT_EQ(server.replyFlags(), std::vector<bool>(3, true));
    EXPECT_EQ(server.requests()[1], request(7));
}

TEST(QRNClient, ReadsAReplyThatArrivesInPieces) {
    // A body far larger than the first read: the rest comes in later reads.
    Value big = Value::dictionary();
    big.set("ReplyError", std::uint64_t{1});
    big.set("Blob", Value::Data(200 * 1024, 0xAB));
    FakeServer server([&](const Value&) { return FakeServer::Response{FakeServer::frame(big)}; });
    QRNClient client = adopt(server);
    auto reply = client.send(request(0));
    ASSERT_TRUE(reply) << reply.error().message;
    EXPECT_EQ(*reply, big);
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
