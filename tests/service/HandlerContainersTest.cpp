// Handlers of the container commands, driven through the request protocol:
// argument checks, what each leaves on disk and in the cache, and the typed
// reply values.

#include "VellEventFixture.h"

#include "Daemon/model/QRNContainerClass.h"

#include <filesystem>
#include <fstream>
#include <string>

using namespace quarn;
using namespace quarn::test;

namespace {

class HandlerContainersTest : public VellEventFixture {
protected:
    HandlerContainersTest() {
        setClient(kVellClient, dictionaryOf({{"com.orvex.private.Quarn.allowed", Value(true)}}));
    }

    static Value request(std::uint64_t command, const std::string& identifier, std::uint64_t cls) {
        return dictionaryOf({{"Command", Value(command)},
                             {"Identifier", Value(identifier)},
                             {"ContainerClass", Value(cls)}});
    }
    static Value with(Value request, const char* key, Value value) {
        request.set(key, std::move(value));
        return request;
    }
    static Value dataOf(const UUID& uuid) {
        return Value(Value::Data(uuid.bytes().begin(), uuid.bytes().end()));
    }
};

TEST_F(HandlerContainersTest, CreateOrLookupAnswersTypedValues) {
    Value made = send(with(request(0, "com.example.app", 2), "CreateIfNecessary", Value(true)));
    ASSERT_EQ(replyError(made), 1u) << made.description();
    EXPECT_EQ(made.get("ReplyUUID")->kind(), Value::Kind::UUID);
    EXPECT_EQ(*made.get("ReplyExisted"), Value(false));
    EXPECT_EQ(*made.get("ReplyIdentifier"), Value("com.example.app"));
    const std::string path = *made.get("ReplyPath")->asString();
    EXPECT_TRUE(std::filesystem::is_directory(std::filesystem::path(path) / "Library"));
    EXPECT_EQ(made.get("ReplySandboxToken"), nullptr);
    EXPECT_EQ(made.get("ReplyPersonaUniqueString"), nullptr);

    Value found = send(request(0, "com.example.app", 2));
    EXPECT_EQ(*found.get("ReplyExisted"), Value(true));
    EXPECT_EQ(*found.get("ReplyUUID"), *made.get("ReplyUUID"));
}

TEST_F(HandlerContainersTest, CreateOrLookupRefusesBadArguments) {
    Value base = with(request(0, "com.example.app", 2), "CreateIfNecessary", Value(true));
    EXPECT_EQ(replyError(send(with(base, "ContainerClass", Value(0u)))), 20u);
    EXPECT_EQ(replyError(send(with(base, "ContainerClass", Value(14u)))), 20u);
    EXPECT_EQ(replyError(send(with(base, "ContainerClass", Value("2")))), 20u);
    EXPECT_EQ(replyError(send(with(base, "Identifier", Value(7u)))), 18u);
    // Only a boolean asks for creation.
    EXPECT_EQ(replyError(send(with(base, "CreateIfNecessary", Value(1u)))), 21u);
    EXPECT_FALSE(cached("com.example.app", 2));
}

TEST_F(HandlerContainersTest, StagedDeletesNeedMatchingArraysAndSoundElements) {
    QRNMetadataPtr a = create("com.example.a", 2);
    QRNMetadataPtr b = create("com.example.b", 2);
    ASSERT_TRUE(a && b);
    Value stage = dictionaryOf(
        {{"Command", Value(3u)},
         {"ContainerClassesArray", arrayOf({Value(2u), Value(2u)})},
         {"UUIDsArray", arrayOf({Value(a->uuid()), Value(b->uuid().string())})},
         {"IdentifiersArray", arrayOf({Value("com.example.a"), Value("com.example.b")})},
         {"PersonaUniqueStringsArray", arrayOf({Value(""), Value("")})}});

    EXPECT_EQ(replyError(send(with(stage, "PersonaUniqueStringsArray", arrayOf({Value("")})))),
              38u);
    EXPECT_EQ(replyError(send(with(stage, "UUIDsArray", arrayOf({Value(a->uuid()), Value(5u)})))),
              11u);
    EXPECT_TRUE(cached("com.example.a", 2) && cached("com.example.b", 2));
    EXPECT_TRUE(std::filesystem::exists(a->url()));

    EXPECT_EQ(replyError(send(stage)), 1u);
    EXPECT_FALSE(cached("com.example.a", 2) || cached("com.example.b", 2));
    EXPECT_FALSE(std::filesystem::exists(a->url()) || std::filesystem::exists(b->url()));
}

TEST_F(HandlerContainersTest, ListingGivesParallelArrays) {
    QRNMetadataPtr a = create("com.example.a", 2);
    QRNMetadataPtr b = create("com.example.b", 2);
    Value reply = send(dictionaryOf({{"Command", Value(1u)}, {"ContainerClass", Value(2u)}}));
    ASSERT_EQ(replyError(reply), 1u);
    const Value::Array& ids = *reply.get("ReplyIdsArray")->asArray();
    const Value::Array& uuids = *reply.get("ReplyUUIDsArray")->asArray();
    ASSERT_EQ(ids.size(), 2u);
    ASSERT_EQ(uuids.size(), 2u);
    for (std::size_t i = 0; i < ids.size(); ++i) {
        EXPECT_EQ(uuids[i], Value(*ids[i].asString() == "com.example.a" ? a->uuid() : b->uuid()));
    }
    EXPECT_EQ(reply.get("ReplyPersonaUniqueStringsArray")->size(), 0u);
    EXPECT_EQ(replyError(send(dictionaryOf({{"Command", Value(1u)}}))), 11u);
}

TEST_F(HandlerContainersTest, DeleteStagesTheContainerForTheEndOfTheRequest) {
    QRNMetadataPtr a = create("com.example.a", 2);
    EXPECT_EQ(replyError(send(request(10, "com.example.a", 2))), 1u);
    EXPECT_FALSE(cached("com.example.a", 2));
    EXPECT_FALSE(std::filesystem::exists(a->url()));
    EXPECT_EQ(replyError(send(request(10, "com.example.a", 2))), 21u);
}

TEST_F(HandlerContainersTest, InfoValuesAndMetadataOfOneContainer) {
    QRNMetadataPtr a = create("com.example.a", 2);
    Value named = with(request(5, "com.example.a", 2), "UUID", dataOf(a->uuid()));
    EXPECT_EQ(replyError(send(with(with(named, "Key", Value("K")), "Value", Value("V")))), 1u);

    Value got = send(with(with(named, "Command", Value(6u)), "Key", Value("K")));
    EXPECT_EQ(*got.get("ReplyInfoValue"), Value("V"));
    EXPECT_EQ(replyError(send(with(named, "Command", Value(6u)))), 38u) << "no key";
    EXPECT_EQ(replyError(send(with(with(request(6, "com.example.a", 2), "Key", Value("K")), "UUID",
                                   Value(UUID::random())))),
              21u);
    EXPECT_EQ(replyError(send(with(with(named, "Key", Value("K")), "UUID", Value("not a uuid")))),
              11u);

    Value metadata =
        send(with(with(named, "Command", Value(7u)), "InfoDictRequested", Value(true)));
    EXPECT_EQ(*metadata.get("ReplyPath"), Value(a->url().string()));
    EXPECT_EQ(*metadata.get("ReplyTransient"), Value(false));
    EXPECT_EQ(*metadata.get("ReplyInfoDictionary"), dictionaryOf({{"K", Value("V")}}));

    // No value removes the key.
    EXPECT_EQ(replyError(send(with(named, "Key", Value("K")))), 1u);
    EXPECT_EQ(replyError(send(with(with(named, "Command", Value(6u)), "Key", Value("K")))), 24u);
}

TEST_F(HandlerContainersTest, DiskUsageCountsWhatTheContainerHolds) {
    QRNMetadataPtr a = create("com.example.a", 2);
    {
        std::ofstream out(a->url() / "Documents" / "blob", std::ios::binary);
        out << std::string(256 * 1024, 'x');
    }
    Value reply = send(request(23, "com.example.a", 2));
    ASSERT_EQ(reply.get("ReplyDiskUsage")->kind(), Value::Kind::UInt64) << reply.description();
    EXPECT_GE(*reply.get("ReplyDiskUsage")->asUInt64(), 256u * 1024u);
    EXPECT_EQ(replyError(send(request(23, "com.example.missing", 2))), 21u);
}

TEST_F(HandlerContainersTest, SystemContainersOfOthersOnlyWhenWellKnown) {
    setClient(kVellClient, Value::dictionary());
    Value known = send(request(15, "com.orvex.devicesettings", 12));
    ASSERT_EQ(replyError(known), 1u) << known.description();
    EXPECT_EQ(std::filesystem::path(*known.get("ReplyPath")->asString()).filename(),
              "com.orvex.devicesettings");
    EXPECT_EQ(replyError(send(request(15, "com.example.sysother", 12))), 55u);
    // Its own system container only when its signature declares one.
    EXPECT_EQ(replyError(send(dictionaryOf({{"Command", Value(15u)}}))), 55u);
}

} // namespace
