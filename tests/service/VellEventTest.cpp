// The request protocol end to end on a fake connection: which commands run,
// which rights an entitlement set gives, how many replies go out, and the
// container commands' argument checks, effects and typed reply values.

#include "VellEventFixture.h"

#include "Daemon/model/QRNContainerClass.h"
#include "Daemon/model/QRNGlobalConfiguration.h"
#include "Daemon/operations/QRNCommandQueue.h"
#include "Daemon/service/QRNCommandTable.h"
#include "Daemon/service/QRNVellReply.h"

#include <filesystem>
#include <fstream>
#include <limits>

using namespace quarn;
using namespace quarn::test;

namespace {

using VellEventTest = VellEventFixture;

TEST_F(VellEventTest, CommandNumbersOutsideTheTableAnswer49WithNothingElse) {
    for (std::uint64_t command : {std::uint64_t(33), std::numeric_limits<std::uint64_t>::max()}) {
        Value reply = send(dictionaryOf({{"Command", Value(command)}}));
        EXPECT_EQ(reply, dictionaryOf({{"ReplyError", Value(49u)}})) << command;
    }
    // Not a dictionary at all: no command can be read from it.
    EXPECT_EQ(codeOf(arrayOf({Value(0u)})), 49u);
}

TEST_F(VellEventTest, AMissingOrMistypedCommandRunsCommandZero) {
    for (const Value& command : {Value(), Value("5")}) {
        Value request =
            dictionaryOf({{"ContainerClass", Value(2u)}, {"CreateIfNecessary", Value(true)}});
        if (!command.isNone()) {
            request.set("Command", command);
        }
        Value reply = send(request);
        EXPECT_EQ(replyError(reply), 1u);
        EXPECT_EQ(*reply.get("ReplyIdentifier"), Value(kVellClient));
    }
}

TEST_F(VellEventTest, AMessageWithoutReplyContextCancelsTheConnection) {
    QRNProcessVellEvent(connection_, eventOf(IpcConnection::Event::Kind::Message,
                                             dictionaryOf({{"ContainerClass", Value(2u)},
                                                           {"CreateIfNecessary", Value(true)}}),
                                             false));
    EXPECT_TRUE(connection_->cancelled());
    EXPECT_TRUE(connection_->replies().empty());
    EXPECT_FALSE(cached(kVellClient, kQRNContainerClassAppData));

    auto quiet = std::make_shared<FakeIpcConnection>();
    QRNProcessVellEvent(quiet, eventOf(IpcConnection::Event::Kind::Invalidated, Value(), true));
    EXPECT_FALSE(quiet->cancelled());
    EXPECT_TRUE(quiet->replies().empty());
}

TEST_F(VellEventTest, EntitlementsAdmitToCommands) {
    auto entitled = [](const char* name, Value value) {
        return std::optional<Value>(dictionaryOf({{name, std::move(value)}}));
    };
    const std::optional<Value> none = Value::dictionary(), unknown = std::nullopt;
    const auto allow = std::optional<Value>(allowed());
    const auto lookup = entitled("com.orvex.private.Quarn.lookup", Value::dictionary());
    const struct {
        const char* name;
        std::optional<Value> entitlements; // none: a process the registry does not know
        std::uint64_t command;
        std::uint64_t expected;
    } cases[] = {
        {"allowed does not reach the test commands", allow, 25, 55},
        {"allowed does not reach the test lock", allow, 31, 55},
        {"testability reaches the test commands",
         entitled("com.orvex.private.Quarn.testability", Value(true)), 25, 49},
        {"retired number", allow, 27, 49},
        {"allowed as a string is not allowed",
         entitled("com.orvex.private.Quarn.allowed", Value("true")), 27, 55},
        {"no entitlements, listing", none, 1, 55},
        {"a lookup dictionary admits to listing", lookup, 1, 1},
        {"lookup is not read where the command ignores it", lookup, 3, 55},
        {"no entitlements, own personas", none, 32, 1},
        {"no entitlements, own groups", none, 13, 1},
        {"no entitlements, own system groups", none, 16, 1},
        {"no entitlements, group identifiers", none, 14, 55},
        {"no entitlements, info values", none, 5, 55},
        {"wipe as a boolean", entitled("com.orvex.private.Quarn.wipeContainer", Value(true)), 11,
         55},
        {"wipe as a list", entitled("com.orvex.private.Quarn.wipeContainer", arrayOf({Value("a")})),
         11, 49},
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
    auto admit = [&](Value entitlements, std::uint64_t command) {
        auto identity = QRNClientIdentity::initWithBundleIdentifier(
            kVellClient, kMobileUID, kMobileUID, 7, user(), std::move(entitlements), false, {},
            false);
        return checkEntitlementsAndInitClientObject(identity, QRNCommandTable::entries()[command],
                                                    queue, error);
    };
    auto full = admit(dictionaryOf({{"com.orvex.private.Quarn.allowed", Value(1u)},
                                    {"com.orvex.private.Quarn.lookup", Value::dictionary()}}),
                      0);
    ASSERT_TRUE(full);
    EXPECT_TRUE(full->entitled() && full->unrestricted() && full->allowOtherIdLookup());
    EXPECT_FALSE(full->lookup()) << "allowed needs no lookup dictionary";
    EXPECT_EQ(full->commandQueue(), queue);

    auto lesser = admit(dictionaryOf({{"com.orvex.private.Quarn.otherIdLookup", Value(true)},
                                      {"com.orvex.private.Quarn.lookup",
                                       dictionaryOf({{"appData", arrayOf({Value("x")})}})}}),
                        23);
    ASSERT_TRUE(lesser);
    EXPECT_FALSE(lesser->entitled() || lesser->unrestricted());
    EXPECT_TRUE(lesser->allowOtherIdLookup());
    EXPECT_TRUE(lesser->isEntitledForLookupWithClass(2, "x"));

    auto wiper = admit(dictionaryOf({{"com.orvex.private.Quarn.wipeContainer",
                                      arrayOf({Value("com.example.a"), Value(3u)})}}),
                       11);
    ASSERT_TRUE(wiper);
    EXPECT_TRUE(wiper->entitled());
    EXPECT_EQ(wiper->entitledWipeIdentifiers(), std::vector<std::string>{"com.example.a"});
    EXPECT_EQ(error, 1u);

    auto anonymous =
        checkEntitlementsAndInitClientObject(nullptr, QRNCommandTable::entries()[0], queue, error);
    ASSERT_TRUE(anonymous);
    EXPECT_FALSE(anonymous->entitled() || anonymous->allowOtherIdLookup() ||
                 anonymous->unrestricted());
    EXPECT_FALSE(
        checkEntitlementsAndInitClientObject(nullptr, QRNCommandTable::entries()[1], queue, error));
    EXPECT_EQ(error, 55u);
}

TEST_F(VellEventTest, DeathRowDeletionRepliesOnceFromItsCompletion) {
    std::filesystem::path deathrow = QRNGlobalConfiguration::sharedInstance().deathrowDirectory();
    std::filesystem::create_directories(deathrow / "A" / "deep");
    // Refused: the dispatcher's reply is the only one.
    EXPECT_EQ(codeOf(dictionaryOf({{"Command", Value(4u)}})), 55u);
    drainDeathRow();
    EXPECT_TRUE(std::filesystem::exists(deathrow / "A"));
    connection_ = std::make_shared<FakeIpcConnection>();
    setClient(kVellClient,
              dictionaryOf({{"com.orvex.private.Quarn.userManagedAssets", Value(true)}}));
    dispatch(dictionaryOf({{"Command", Value(4u)}}));
    drainDeathRow();
    EXPECT_EQ(connection_->replies(),
              std::vector<Value>{dictionaryOf({{"ReplyError", Value(1u)}})});
    EXPECT_FALSE(std::filesystem::exists(deathrow / "A"));
}

TEST_F(VellEventTest, AReplyAndItsCopiesGoOutOnceBetweenThem) {
    // A handler that replies from its completion keeps a copy; should the
    // dispatcher then report a late failure, the client must still get one
    // reply, not two that the next request would mistake for its own.
    QRNVellReply reply(connection_);
    QRNVellReply completionCopy = reply;
    reply.sendWithError(40);
    completionCopy.sendWithError(1);
    reply.sendWithError(40);
    EXPECT_EQ(connection_->replies(),
              std::vector<Value>{dictionaryOf({{"ReplyError", Value(40u)}})});
}

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
