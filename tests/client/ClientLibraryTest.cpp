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

namespace {

Value request(std::uint64_t command) {
    return dictionaryOf({{"Command", Value(command)}});
}

Value withError(std::uint64_t code, Value keys = Value::dictionary()) {
    keys.set("ReplyError", code);
    return keys;
}

FakeServer::Response rawFrame(std::uint32_t length, std::uint8_t flags,
                              std::vector<std::uint8_t> body, bool closeAfter = false) {
    return {FrameSocket::rawFrame(length, flags, body), closeAfter};
}

} // namespace

// Requests go out framed with the reply flag; replies are read whole however
// they are split; an oversize request is refused before anything is sent.
TEST(QRNClient, SendsFramedRequestsAndReadsRepliesInOrder) {
    const Value blob = Value::Data(200 * 1024, 0xAB); // far larger than the first read
    FakeServer server([&](const Value& req) {
        Value keys = dictionaryOf({{"Echo", *req.get("Command")}, {"ReplyUUID", UUID::random()}});
        if (req == request(7)) {
            keys.set("Blob", blob);
        }
        return FakeServer::reply(withError(1, keys));
    });
    auto client = QRNClient::connect(server.path);
    ASSERT_TRUE(client);
    Value huge = request(5);
    huge.set("Value", Value::Data(1024 * 1024, 0));
    auto refused = client->send(huge);
    ASSERT_FALSE(refused);
    EXPECT_TRUE(refused.error().isPOSIX(EMSGSIZE));
    for (std::uint64_t command : {0u, 7u, 32u}) {
        auto reply = client->send(request(command));
        ASSERT_TRUE(reply) << reply.error().message;
        EXPECT_EQ(reply->get("Echo")->asUInt64(), command);
        EXPECT_EQ(reply->get("ReplyError")->asUInt64(), 1u);
        EXPECT_TRUE(reply->get("ReplyUUID")->asUUID());
        EXPECT_EQ(reply->get("Blob") ? *reply->get("Blob") : Value(),
                  command == 7 ? blob : Value());
    }
    client->close();
    const auto sent = server.requests();
    ASSERT_EQ(sent.size(), 3u);
    EXPECT_TRUE(sent[0].second && sent[1].second && sent[2].second); // the reply flag
    EXPECT_EQ(sent[1].first, request(7));
}

// Every broken or missing reply is an error that closes the connection.
TEST(QRNClient, BrokenRepliesAreErrorsThatCloseTheConnection) {
    struct Case {
        FakeServer::Response response;
        int expectedErrno;
        const char* messagePart;
    };
    const Case cases[] = {
        {{{}, true}, ECONNRESET, "without a reply"},
        {{{3, 0, 0}, true}, ECONNRESET, "after 3 of 5 bytes"},
        {rawFrame(100, 0, std::vector<std::uint8_t>(10), true), ECONNRESET,
         "after 15 of 105 bytes"},
        {rawFrame(1024 * 1024 + 1, 0, {}), EMSGSIZE, "1048577 bytes"},
        {rawFrame(1, 0x02, {0xA0}), EPROTO, "flag"},
        {rawFrame(2, 0, {0xFF, 0xFF}), EBADMSG, "does not decode"},
        {FakeServer::reply(Value("text")), EBADMSG, "not a dictionary"},
        {rawFrame(1, 0, {0xA0, 0x00, 0x00}), EPROTO, "2 unexpected bytes"},
        {{}, ETIMEDOUT, ""}, // no reply at all
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(c.messagePart);
        FakeServer server([&](const Value&) { return c.response; });
        auto client = QRNClient::connect(
            server.path, {std::chrono::milliseconds(c.expectedErrno == ETIMEDOUT ? 20 : 30000)});
        ASSERT_TRUE(client);
        auto reply = client->send(request(0));
        ASSERT_FALSE(reply);
        EXPECT_TRUE(reply.error().isPOSIX(c.expectedErrno)) << reply.error().description();
        EXPECT_NE(reply.error().message.find(c.messagePart), std::string::npos)
            << reply.error().message;
        EXPECT_FALSE(client->isConnected());
        auto again = client->send(request(0));
        ASSERT_FALSE(again);
        EXPECT_TRUE(again.error().isPOSIX(ENOTCONN));
    }
}

// Connecting for real is the daemon's integration tests' business; here only
// why a connection cannot be made.
TEST(QRNClient, ReportsWhyItCannotConnect) {
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
}

// Typed requests and replies over one connection: the keys each helper
// sends, how reply keys become result fields, and that replies missing keys
// or holding the wrong types are errors naming the key.
TEST(QRNContainerClient, RequestKeysReplyFieldsAndBadReplies) {
    Value next;
    FakeServer server([&](const Value&) { return FakeServer::reply(next); });
    auto connection = QRNClient::connect(server.path);
    ASSERT_TRUE(connection);
    QRNContainerClient client(*connection);
    const auto sent = [&] { return server.requests().back().first; };

    // The UUID as 16 bytes of data is read as well as a UUID value.
    const UUID uuid = UUID::random();
    next = withError(
        1, dictionaryOf({{"ReplyUUID", Value::Data(uuid.bytes().begin(), uuid.bytes().end())},
                         {"ReplyExisted", true},
                         {"ReplyPath", "/private/var/mobile/Containers/Data/Application/X"},
                         {"ReplyIdentifier", "com.example.notes"}}));
    auto container = client.createOrLookup("com.example.notes", 2, true, false);
    ASSERT_TRUE(container) << container.error().description();
    EXPECT_EQ(container->uuid, uuid);
    EXPECT_TRUE(container->existed);
    EXPECT_EQ(container->identifier, "com.example.notes");
    EXPECT_FALSE(container->sandboxToken);
    EXPECT_EQ(sent(), dictionaryOf({{"Command", 0u},
                                    {"Identifier", "com.example.notes"},
                                    {"ContainerClass", 2u},
                                    {"CreateIfNecessary", true},
                                    {"Transient", false}}));

    // No identifier means the caller's own; a UUID names the container.
    next = withError(1, dictionaryOf({{"ReplyInfoValue", "blue"}}));
    EXPECT_EQ(client.infoValue({std::nullopt, 2, uuid}, "Color").value_or(Value()), Value("blue"));
    EXPECT_EQ(sent().get("Identifier"), nullptr);
    EXPECT_EQ(sent().get("UUID")->asUUID(), uuid);
    EXPECT_EQ(sent().get("Command")->asUInt64(), 6u);

    next = withError(1);
    std::vector<QRNStagedContainer> staged = {{2, UUID::random(), "a", ""},
                                              {7, UUID::random(), "group.b", "P"}};
    ASSERT_TRUE(client.stageForDelete(staged));
    for (const char* key :
         {"ContainerClassesArray", "UUIDsArray", "IdentifiersArray", "PersonaUniqueStringsArray"}) {
        ASSERT_NE(sent().get(key), nullptr) << key;
        EXPECT_EQ(sent().get(key)->size(), 2u) << key;
    }
    EXPECT_EQ(sent().get("UUIDsArray")->asArray()->at(1).asUUID(), staged[1].uuid);

    // Daemon errors carry their code and name.
    next = withError(21);
    auto gone = client.createOrLookup("com.example.gone", 2, false, false);
    ASSERT_FALSE(gone);
    EXPECT_EQ(gone.error().kind, ClientError::Kind::Daemon);
    EXPECT_EQ(gone.error().description(), "error 21 (ContainerNotFound)");
    next = withError(49);
    EXPECT_EQ(client.retired().error().code, 49u);

    const std::pair<Value, const char*> badReplies[] = {
        {Value::dictionary(), "\"ReplyError\" is missing"},
        {dictionaryOf({{"ReplyError", "1"}}), "ReplyError"},
        {withError(1, dictionaryOf({{"ReplyPath", 5u}})), "\"ReplyPath\" is a"},
        {withError(1), "\"ReplyPath\" is missing"},
        // Lists are checked item by item.
        {withError(1, dictionaryOf({{"ReplyIdsArray", Value::Array{"a", "b"}},
                                    {"ReplyUUIDsArray", Value::Array{uuid}}})),
         "differ in length"},
        {withError(1, dictionaryOf({{"ReplyGroupContainerDict", dictionaryOf({{"group.a", 3u}})}})),
         "\"group.a\""},
    };
    const auto failure = [](const auto& r) { return r ? ClientError{} : r.error(); };
    for (const auto& [reply, mentions] : badReplies) {
        next = reply;
        const auto error = reply.get("ReplyIdsArray") ? failure(client.containersOfClass(2, false))
                           : reply.get("ReplyGroupContainerDict")
                               ? failure(client.groupContainers("com.example.owner"))
                               : failure(client.systemContainerPath(std::nullopt));
        EXPECT_EQ(error.kind, ClientError::Kind::BadReply) << mentions;
        EXPECT_NE(error.message.find(mentions), std::string::npos) << error.message;
    }

    // An absent persona array reads as empty.
    next = withError(1, dictionaryOf({{"ReplyIdsArray", Value::Array{"a"}},
                                      {"ReplyUUIDsArray", Value::Array{uuid}}}));
    auto list = client.containersOfClass(2, false);
    ASSERT_TRUE(list) << list.error().description();
    EXPECT_EQ(list->uuids, std::vector<UUID>{uuid});
    EXPECT_TRUE(list->personaUniqueStrings.empty());

    connection->close();
    auto personas = client.personaUniqueStrings();
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
    const auto verify = [&](const std::string& t) {
        return QRNSandboxTokenVerifier::verifySandboxToken(t, root.path());
    };
    EXPECT_TRUE(verify(*token).error().isPOSIX(ENOENT)); // no key yet

    const std::string keyFile = "/private/var/run/quarnd/extension.key";
    root.writeFile(keyFile, std::string(key.begin(), key.end()));
    EXPECT_EQ(verify(*token).value_or(false), true);
    auto tampered = *token;
    tampered.back() = tampered.back() == '0' ? '1' : '0';
    EXPECT_EQ(verify(tampered).value_or(true), false);
    root.writeFile(keyFile, std::string(otherKey.begin(), otherKey.end()));
    EXPECT_EQ(verify(*token).value_or(true), false);
    root.writeFile(keyFile, "short");
    EXPECT_TRUE(verify(*token).error().isPOSIX(EINVAL));
}
