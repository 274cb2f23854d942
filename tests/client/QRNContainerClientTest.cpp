// Typed requests and replies: the keys each helper sends, how reply keys
// become result fields, and that replies missing keys or holding the wrong
// types are errors naming the key.

#include "Client/QRNContainerClient.h"

#include "FakeServer.h"
#include "common/shared/RequestValues.h"

#include <gtest/gtest.h>

using namespace quarn;
using namespace quarn::test;

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
