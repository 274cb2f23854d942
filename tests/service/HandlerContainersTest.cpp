// Handlers of the container commands, driven through the request protocol:
// argument checks, what each leaves on disk and in the cache, and the typed
// reply values.

#include "VellEventFixture.h"

#include <filesystem>
#include <fstream>
#include <string>

using namespace quarn;
using namespace quarn::test;

namespace {

class HandlerContainersTest : public VellEventFixture {
protected:
    HandlerContainersTest() { setClient(kVellClient, allowed()); }

    static Value request(std::uint64_t command, const std::string& identifier,
                         std::uint64_t cls = 2) {
        return dictionaryOf({{"Command", Value(command)},
                             {"Identifier", Value(identifier)},
                             {"ContainerClass", Value(cls)}});
    }
    static Value with(Value request, const char* key, Value value) {
        request.set(key, std::move(value));
        return request;
    }
};

TEST_F(HandlerContainersTest, CreateOrLookupAnswersTypedValuesAndRefusesBadArguments) {
    const Value create = with(request(0, "com.example.app"), "CreateIfNecessary", Value(true));
    const struct {
        const char* key;
        Value value;
        std::uint64_t code;
    } refused[] = {
        {"ContainerClass", Value(0u), 20},    {"ContainerClass", Value(14u), 20},
        {"ContainerClass", Value("2"), 20},   {"Identifier", Value(7u), 18},
        {"CreateIfNecessary", Value(1u), 21}, // only a boolean asks for creation
    };
    for (const auto& c : refused) {
        EXPECT_EQ(codeOf(with(create, c.key, c.value)), c.code)
            << c.key << " " << c.value.description();
    }
    EXPECT_FALSE(cached("com.example.app", 2));

    Value made = send(create);
    ASSERT_EQ(replyError(made), 1u) << made.description();
    EXPECT_EQ(made.get("ReplyUUID")->kind(), Value::Kind::UUID);
    EXPECT_EQ(*made.get("ReplyExisted"), Value(false));
    EXPECT_EQ(*made.get("ReplyIdentifier"), Value("com.example.app"));
    const std::string path = *made.get("ReplyPath")->asString();
    EXPECT_TRUE(std::filesystem::is_directory(std::filesystem::path(path) / "Library"));
    EXPECT_EQ(made.get("ReplySandboxToken"), nullptr);
    EXPECT_EQ(made.get("ReplyPersonaUniqueString"), nullptr);

    Value found = send(request(0, "com.example.app"));
    EXPECT_EQ(*found.get("ReplyExisted"), Value(true));
    EXPECT_EQ(*found.get("ReplyUUID"), *made.get("ReplyUUID"));
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

    EXPECT_EQ(codeOf(with(stage, "PersonaUniqueStringsArray", arrayOf({Value("")}))), 38u);
    EXPECT_EQ(codeOf(with(stage, "UUIDsArray", arrayOf({Value(a->uuid()), Value(5u)}))), 11u);
    EXPECT_TRUE(cached("com.example.a", 2) && cached("com.example.b", 2));
    EXPECT_TRUE(std::filesystem::exists(a->url()));

    EXPECT_EQ(codeOf(stage), 1u);
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
    EXPECT_EQ(codeOf(dictionaryOf({{"Command", Value(1u)}})), 11u);
}

TEST_F(HandlerContainersTest, DeleteStagesTheContainerForTheEndOfTheRequest) {
    QRNMetadataPtr a = create("com.example.a", 2);
    EXPECT_EQ(codeOf(request(10, "com.example.a")), 1u);
    EXPECT_FALSE(cached("com.example.a", 2));
    EXPECT_FALSE(std::filesystem::exists(a->url()));
    EXPECT_EQ(codeOf(request(10, "com.example.a")), 21u);
}

TEST_F(HandlerContainersTest, InfoValuesAndMetadataOfOneContainer) {
    QRNMetadataPtr a = create("com.example.a", 2);
    const Value named =
        with(request(5, "com.example.a"), "UUID",
             Value(Value::Data(a->uuid().bytes().begin(), a->uuid().bytes().end())));
    const Value keyed = with(named, "Key", Value("K"));
    EXPECT_EQ(codeOf(with(keyed, "Value", Value("V"))), 1u);

    EXPECT_EQ(*send(with(keyed, "Command", Value(6u))).get("ReplyInfoValue"), Value("V"));
    EXPECT_EQ(codeOf(with(named, "Command", Value(6u))), 38u) << "no key";
    EXPECT_EQ(codeOf(with(with(keyed, "Command", Value(6u)), "UUID", Value(UUID::random()))), 21u);
    EXPECT_EQ(codeOf(with(keyed, "UUID", Value("not a uuid"))), 11u);

    Value metadata =
        send(with(with(named, "Command", Value(7u)), "InfoDictRequested", Value(true)));
    EXPECT_EQ(*metadata.get("ReplyPath"), Value(a->url().string()));
    EXPECT_EQ(*metadata.get("ReplyTransient"), Value(false));
    EXPECT_EQ(*metadata.get("ReplyInfoDictionary"), dictionaryOf({{"K", Value("V")}}));

    // No value removes the key.
    EXPECT_EQ(codeOf(keyed), 1u);
    EXPECT_EQ(codeOf(with(keyed, "Command", Value(6u))), 24u);
}

TEST_F(HandlerContainersTest, DiskUsageCountsWhatTheContainerHolds) {
    QRNMetadataPtr a = create("com.example.a", 2);
    std::ofstream(a->url() / "Documents" / "blob", std::ios::binary)
        << std::string(256 * 1024, 'x');
    Value reply = send(request(23, "com.example.a"));
    ASSERT_EQ(reply.get("ReplyDiskUsage")->kind(), Value::Kind::UInt64) << reply.description();
    EXPECT_GE(*reply.get("ReplyDiskUsage")->asUInt64(), 256u * 1024u);
    EXPECT_EQ(codeOf(request(23, "com.example.missing")), 21u);
}

TEST_F(HandlerContainersTest, SystemContainersOfOthersOnlyWhenWellKnown) {
    setClient(kVellClient, Value::dictionary());
    Value known = send(request(15, "com.orvex.devicesettings", 12));
    ASSERT_EQ(replyError(known), 1u) << known.description();
    EXPECT_EQ(std::filesystem::path(*known.get("ReplyPath")->asString()).filename(),
              "com.orvex.devicesettings");
    EXPECT_EQ(codeOf(request(15, "com.example.sysother", 12)), 55u);
    // Its own system container only when its signature declares one.
    EXPECT_EQ(codeOf(dictionaryOf({{"Command", Value(15u)}})), 55u);
}

} // namespace
