// The request protocol end to end on a fake connection: which commands run,
// which rights an entitlement set gives, how many replies go out, and the
// container commands' argument checks, effects and typed reply values.

#include "VellEventFixture.h"

#include "Daemon/model/QRNContainerClass.h"
#include "Daemon/operations/QRNCommandQueue.h"
#include "Daemon/service/QRNCommandTable.h"
#include "Daemon/service/QRNVellReply.h"

using namespace quarn;
using namespace quarn::test;

namespace {

using VellEventTest = VellEventFixture;

TEST_F(VellEventTest, UnreadableCommandsAndMessagesWithoutReplyContext) {
    // Outside the table, or not a dictionary at all: 49 and nothing else.
    for (const Value& request :
         {dictionaryOf({{"Command", Value(33u)}}),
          dictionaryOf({{"Command", Value(~std::uint64_t{0})}}), arrayOf({Value(0u)})}) {
        EXPECT_EQ(send(request), dictionaryOf({{"ReplyError", Value(49u)}}))
            << request.description();
    }
    const Value create =
        dictionaryOf({{"ContainerClass", Value(2u)}, {"CreateIfNecessary", Value(true)}});
    auto quiet = std::make_shared<FakeIpcConnection>();
    QRNProcessVellEvent(quiet,
                        IpcConnection::Event{IpcConnection::Event::Kind::Message, create, false});
    EXPECT_TRUE(quiet->cancelled);
    EXPECT_TRUE(quiet->replies().empty());
    EXPECT_FALSE(cached(kVellClient, kQRNContainerClassAppData));
    // A missing or mistyped command runs command zero.
    Value mistyped = create;
    mistyped.set("Command", Value("5"));
    for (const Value& request : {create, mistyped}) {
        Value reply = send(request);
        EXPECT_EQ(replyError(reply), 1u);
        EXPECT_EQ(*reply.get("ReplyIdentifier"), Value(kVellClient));
    }

    auto invalidated = std::make_shared<FakeIpcConnection>();
    QRNProcessVellEvent(
        invalidated, IpcConnection::Event{IpcConnection::Event::Kind::Invalidated, Value(), true});
    EXPECT_FALSE(invalidated->cancelled);
    EXPECT_TRUE(invalidated->replies().empty());
}
TEST_F(VellEventTest, EntitlementsAdmitToCommands) {
    auto entitled = [](const char* name, Value value) {
        return std::optional<Value>(
            dictionaryOf({{(std::string("com.orvex.private.Quarn.") + name).c_str(), value}}));
    };
    const std::optional<Value> none = Value::dictionary(), unknown = std::nullopt;
    const auto allow = std::optional<Value>(allowed());
    const auto lookup = entitled("lookup", Value::dictionary());
    const struct {
        const char* name;
        std::optional<Value> entitlements; // none: a process the registry does not know
        std::uint64_t command;
        std::uint64_t expected;
    } cases[] = {
        {"allowed does not reach the test commands", allow, 25, 55},
        {"testability reaches the test commands", entitled("testability", Value(true)), 25, 49},
        {"retired number", allow, 27, 49},
        {"allowed as a string is not allowed", entitled("allowed", Value("true")), 27, 55},
        {"no entitlements, listing", none, 1, 55},
        {"a lookup dictionary admits to listing", lookup, 1, 1},
        {"lookup is not read where the command ignores it", lookup, 3, 55},
        {"no entitlements, own personas", none, 32, 1},
        {"wipe as a boolean", entitled("wipeContainer", Value(true)), 11, 55},
        {"wipe as a list", entitled("wipeContainer", arrayOf({Value("a")})), 11, 49},
        {"allowed reaches wipe without a list", allow, 11, 49},
        {"asynchronous command refused", none, 21, 55},
        {"asynchronous command not in this build", allow, 21, 49},
        // Commands that need no rights still run, with no identifier to take.
        {"unknown client, command needing no rights", unknown, 0, 18},
        {"unknown client, command needing rights", unknown, 6, 55},
    };
    for (const auto& c : cases) {
        registry_->info.reset();
        if (c.entitlements) {
            setClient(kVellClient, *c.entitlements);
        }
        EXPECT_EQ(
            codeOf(dictionaryOf({{"Command", Value(c.command)}, {"ContainerClass", Value(2u)}})),
            c.expected)
            << c.name;
    }
}

TEST_F(VellEventTest, RightsHandedToTheClientConnection) {
    auto queue = std::make_shared<QRNCommandQueue>();
    std::uint64_t error = 1;
    auto admit = [&](std::initializer_list<std::pair<const char*, Value>> granted,
                     std::uint64_t command) {
        Value entitlements = Value::dictionary();
        for (const auto& [name, value] : granted) {
            entitlements.set(std::string("com.orvex.private.Quarn.") + name, value);
        }
        return checkEntitlementsAndInitClientObject(clientIdentity(kVellClient, entitlements),
                                                    QRNCommandTable::entries()[command], queue,
                                                    error);
    };
    auto full = admit({{"allowed", Value(1u)}, {"lookup", Value::dictionary()}}, 0);
    ASSERT_TRUE(full);
    EXPECT_TRUE(full->entitled() && full->unrestricted() && full->allowOtherIdLookup());
    auto lesser = admit({{"otherIdLookup", Value(true)},
                         {"lookup", dictionaryOf({{"appData", arrayOf({Value("x")})}})}},
                        23);
    ASSERT_TRUE(lesser);
    EXPECT_FALSE(lesser->entitled() || lesser->unrestricted());
    EXPECT_TRUE(lesser->allowOtherIdLookup());
    EXPECT_TRUE(lesser->isEntitledForLookupWithClass(2, "x"));
    auto wiper = admit({{"wipeContainer", arrayOf({Value("com.example.a"), Value(3u)})}}, 11);
    ASSERT_TRUE(wiper);
    EXPECT_TRUE(wiper->entitled());
    EXPECT_EQ(wiper->entitledWipeIdentifiers(), std::vector<std::string>{"com.example.a"});
    EXPECT_EQ(error, 1u);
}

TEST_F(VellEventTest, RepliesGoOutOnceFromACompletionOrAnyCopy) {
    std::filesystem::path deathrow = QRNGlobalConfiguration::sharedInstance().deathrowDirectory();
    std::filesystem::create_directories(deathrow / "A" / "deep");
    // Refused: the dispatcher's reply is the only one.
    EXPECT_EQ(codeOf(dictionaryOf({{"Command", Value(4u)}})), 55u);
    drainBackground();
    EXPECT_TRUE(std::filesystem::exists(deathrow / "A"));
    connection_ = std::make_shared<FakeIpcConnection>();
    setClient(kVellClient,
              dictionaryOf({{"com.orvex.private.Quarn.userManagedAssets", Value(true)}}));
    dispatch(dictionaryOf({{"Command", Value(4u)}}));
    drainBackground();
    EXPECT_EQ(connection_->replies(),
              std::vector<Value>{dictionaryOf({{"ReplyError", Value(1u)}})});
    EXPECT_FALSE(std::filesystem::exists(deathrow / "A"));

    // A handler that replies from its completion keeps a copy; should the
    // dispatcher then report a late failure, the client must still get one
    // reply, not two that the next request would mistake for its own.
    connection_ = std::make_shared<FakeIpcConnection>();
    QRNVellReply reply(connection_);
    QRNVellReply completionCopy = reply;
    reply.sendWithError(40);
    completionCopy.sendWithError(1);
    reply.sendWithError(40);
    EXPECT_EQ(connection_->replies(),
              std::vector<Value>{dictionaryOf({{"ReplyError", Value(40u)}})});
}

// The container handlers: how request keys become arguments, which code a
// bad one answers and which reply keys carry the result. What the
// operations do is tested in tests/operations.
TEST_F(VellEventTest, ContainerCommandsMapRequestKeysToCodesAndReplyKeys) {
    setClient(kVellClient, allowed());
    auto request = [](std::uint64_t command, const std::string& identifier, std::uint64_t cls = 2) {
        return dictionaryOf({{"Command", Value(command)},
                             {"Identifier", Value(identifier)},
                             {"ContainerClass", Value(cls)}});
    };
    auto with = [](Value request, const char* key, Value value) {
        request.set(key, std::move(value));
        return request;
    };
    const Value creating = with(request(0, "com.example.app"), "CreateIfNecessary", Value(true));
    Value made = send(creating);
    ASSERT_EQ(replyError(made), 1u) << made.description();
    EXPECT_EQ(made.get("ReplyUUID")->kind(), Value::Kind::UUID);
    EXPECT_EQ(*made.get("ReplyExisted"), Value(false));
    EXPECT_EQ(*made.get("ReplyIdentifier"), Value("com.example.app"));
    EXPECT_TRUE(std::filesystem::is_directory(*made.get("ReplyPath")->asString()));
    EXPECT_EQ(made.get("ReplyPersonaUniqueString"), nullptr);
    Value found = send(request(0, "com.example.app"));
    EXPECT_EQ(*found.get("ReplyExisted"), Value(true));
    EXPECT_EQ(*found.get("ReplyUUID"), *made.get("ReplyUUID"));

    QRNMetadataPtr a = create("com.example.a", 2);
    QRNMetadataPtr b = create("com.example.b", 2);
    ASSERT_TRUE(a && b);
    const Value named =
        with(request(5, "com.example.a"), "UUID",
             Value(Value::Data(a->uuid().bytes().begin(), a->uuid().bytes().end())));
    const Value keyed = with(named, "Key", Value("K"));
    const Value getting = with(keyed, "Command", Value(6u));
    const Value stage = dictionaryOf(
        {{"Command", Value(3u)},
         {"ContainerClassesArray", arrayOf({Value(2u), Value(2u)})},
         {"UUIDsArray", arrayOf({Value(a->uuid()), Value(b->uuid().string())})},
         {"IdentifiersArray", arrayOf({Value("com.example.a"), Value("com.example.b")})},
         {"PersonaUniqueStringsArray", arrayOf({Value(""), Value("")})}});
    const Value fresh = with(creating, "Identifier", Value("com.example.new"));
    const struct {
        const char* what;
        Value request;
        std::uint64_t code;
    } cases[] = {
        {"class 0", with(fresh, "ContainerClass", Value(0u)), 20},
        {"class 14", with(fresh, "ContainerClass", Value(14u)), 20},
        {"class as a string", with(fresh, "ContainerClass", Value("2")), 20},
        {"identifier not a string", with(fresh, "Identifier", Value(7u)), 18},
        {"only a boolean asks for creation", with(fresh, "CreateIfNecessary", Value(1u)), 21},
        {"set an info value", with(keyed, "Value", Value("V")), 1},
        {"info value without a key", with(named, "Command", Value(6u)), 38},
        {"info value of an unknown UUID", with(getting, "UUID", Value(UUID::random())), 21},
        {"UUID not a UUID", with(keyed, "UUID", Value("not a uuid")), 11},
        {"listing without a class", dictionaryOf({{"Command", Value(1u)}}), 11},
        {"disk usage of a missing container", request(23, "com.example.missing"), 21},
        {"staged arrays of different lengths",
         with(stage, "PersonaUniqueStringsArray", arrayOf({Value("")})), 38},
        {"staged UUID not a UUID",
         with(stage, "UUIDsArray", arrayOf({Value(a->uuid()), Value(5u)})), 11},
    };
    for (const auto& c : cases) {
        EXPECT_EQ(codeOf(c.request), c.code) << c.what;
    }
    EXPECT_FALSE(cached("com.example.new", 2));

    EXPECT_EQ(*send(getting).get("ReplyInfoValue"), Value("V"));
    Value metadata =
        send(with(with(named, "Command", Value(7u)), "InfoDictRequested", Value(true)));
    EXPECT_EQ(*metadata.get("ReplyPath"), Value(a->url().string()));
    EXPECT_EQ(*metadata.get("ReplyTransient"), Value(false));
    EXPECT_EQ(*metadata.get("ReplyInfoDictionary"), dictionaryOf({{"K", Value("V")}}));
    EXPECT_EQ(codeOf(keyed), 1u) << "no value removes the key";
    EXPECT_EQ(codeOf(getting), 24u);

    Value listed = send(dictionaryOf({{"Command", Value(1u)}, {"ContainerClass", Value(2u)}}));
    const Value::Array& ids = *listed.get("ReplyIdsArray")->asArray();
    const Value::Array& uuids = *listed.get("ReplyUUIDsArray")->asArray();
    ASSERT_EQ(ids.size(), 3u) << listed.description();
    ASSERT_EQ(uuids.size(), 3u);
    for (std::size_t i = 0; i < ids.size(); ++i) {
        const std::string id = *ids[i].asString();
        EXPECT_EQ(uuids[i], id == "com.example.app"
                                ? *made.get("ReplyUUID")
                                : Value(id == "com.example.a" ? a->uuid() : b->uuid()));
    }
    EXPECT_EQ(listed.get("ReplyPersonaUniqueStringsArray")->size(), 0u);

    std::ofstream(a->url() / "Documents" / "blob", std::ios::binary)
        << std::string(256 * 1024, 'x');
    Value usage = send(request(23, "com.example.a"));
    ASSERT_EQ(usage.get("ReplyDiskUsage")->kind(), Value::Kind::UInt64) << usage.description();
    EXPECT_GE(*usage.get("ReplyDiskUsage")->asUInt64(), 256u * 1024u);

    EXPECT_TRUE(cached("com.example.a", 2) && cached("com.example.b", 2)) << "refused stages";
    EXPECT_EQ(codeOf(stage), 1u);
    EXPECT_FALSE(cached("com.example.a", 2) || cached("com.example.b", 2));
    EXPECT_EQ(codeOf(request(10, "com.example.app")), 1u);
    EXPECT_EQ(codeOf(request(10, "com.example.app")), 21u);

    // Without rights, others' system containers only when well known, and
    // its own only when its signature declares one.
    setClient(kVellClient, Value::dictionary());
    Value known = send(request(15, "com.orvex.devicesettings", 12));
    ASSERT_EQ(replyError(known), 1u) << known.description();
    EXPECT_EQ(std::filesystem::path(*known.get("ReplyPath")->asString()).filename(),
              "com.orvex.devicesettings");
    EXPECT_EQ(codeOf(request(15, "com.example.sysother", 12)), 55u);
    EXPECT_EQ(codeOf(dictionaryOf({{"Command", Value(15u)}})), 55u);
}

} // namespace
