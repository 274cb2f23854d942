// Requests of client programs with different entitlements to one daemon:
// what each command answers, who is admitted, and what lands on disk.

#include "Client/QRNClientRequests.h"
#include "SharedDaemonTest.h"

#include <algorithm>

namespace quarn::test {

namespace {

using P = ClientPrograms;
using Requests = QRNClientRequests;

class CommandRequests : public SharedDaemonTest {
protected:
    // Runs `program` and expects one reply per request.
    static std::vector<Value> repliesOf(std::string_view program,
                                        const std::vector<Value>& requests) {
        DaemonHarness::ClientRun run = daemon().runClient(program, requests);
        EXPECT_EQ(run.replies.size(), requests.size()) << program << ": " << run.failure;
        EXPECT_TRUE(run.exit && run.exit->exitedWith(0))
            << program << ": " << (run.exit ? run.exit->description() : "did not end");
        run.replies.resize(requests.size());
        return run.replies;
    }
    static Value createOrLookup(const std::string& identifier, std::uint64_t containerClass,
                                bool create = true) {
        return Requests::createOrLookup(identifier, containerClass, create, false);
    }
};

constexpr const char* kWellKnown = "com.orvex.devicesettings";

Value command(std::uint64_t number, Value::Dictionary keys = {}) {
    keys.emplace("Command", number);
    return Value(std::move(keys));
}

std::string stringAt(const Value& reply, std::string_view key) {
    const Value* value = reply.get(key);
    return value && value->asString() ? *value->asString() : std::string();
}

std::optional<bool> boolAt(const Value& reply, std::string_view key) {
    const Value* value = reply.get(key);
    return value ? value->asBool() : std::nullopt;
}

const Value::Array* arrayAt(const Value& reply, std::string_view key) {
    const Value* value = reply.get(key);
    return value ? value->asArray() : nullptr;
}

std::optional<UUID> uuidAt(const Value& reply, std::string_view key) {
    const Value* value = reply.get(key);
    return value ? value->asUUID() : std::nullopt;
}

} // namespace

TEST_F(CommandRequests, CreateThenLookUpFindsTheSameContainerWithItsSubdirectories) {
    struct Case {
        std::uint64_t containerClass;
        std::string classDirectory;
        std::vector<std::string> subdirectories;
    };
    const std::vector<Case> cases{
        {2,
         "Data/Application",
         {"Documents", "Library", "Library/Caches", "Library/Preferences", "SystemData", "tmp"}},
        {7, "Shared/AppGroup", {"Library", "Library/Caches", "Library/Preferences"}},
        {10, "Data/InternalDaemon", {"Library", "Library/Caches", "Library/Preferences", "tmp"}},
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(c.containerClass);
        const std::string identifier = "com.orvex.test.created." + std::to_string(c.containerClass);
        const auto replies = repliesOf(P::kAllowed, {createOrLookup(identifier, c.containerClass),
                                                     createOrLookup(identifier, c.containerClass)});
        ASSERT_EQ(replyError(replies[0]), kQRNErrorNone) << replies[0].description();
        EXPECT_EQ(boolAt(replies[0], "ReplyExisted"), false);
        EXPECT_EQ(stringAt(replies[0], "ReplyIdentifier"), identifier);
        const std::optional<UUID> uuid = uuidAt(replies[0], "ReplyUUID");
        ASSERT_TRUE(uuid);
        const std::filesystem::path path = stringAt(replies[0], "ReplyPath");
        EXPECT_EQ(path.filename(), uuid->string());
        EXPECT_EQ(path.parent_path(),
                  daemon() / "/private/var/mobile/Containers" / c.classDirectory);
        EXPECT_TRUE(std::filesystem::exists(path / ".com.orvex.quarn_store.metadata.plist"));
        for (const std::string& subdirectory : c.subdirectories) {
            EXPECT_TRUE(std::filesystem::is_directory(path / subdirectory)) << subdirectory;
        }
        ASSERT_EQ(replyError(replies[1]), kQRNErrorNone);
        EXPECT_EQ(boolAt(replies[1], "ReplyExisted"), true);
        EXPECT_EQ(uuidAt(replies[1], "ReplyUUID"), uuid);
        EXPECT_EQ(stringAt(replies[1], "ReplyPath"), path.string());
    }
}

TEST_F(CommandRequests, MissingKeysTakeTheirDefaultsAndBadNumbersAreRefused) {
    const auto replies =
        repliesOf(P::kAllowed, {command(0, {{"ContainerClass", 2u}, {"CreateIfNecessary", true}}),
                                Value(Value::Dictionary{{"Identifier", "com.orvex.test.nocommand"},
                                                        {"ContainerClass", 2u},
                                                        {"CreateIfNecessary", true}}),
                                createOrLookup("com.orvex.test.class0", 0),
                                createOrLookup("com.orvex.test.class14", 14), command(33),
                                command(UINT64_MAX), command(27)});
    // No "Identifier": the client's own code-signing identifier.
    EXPECT_EQ(replyError(replies[0]), kQRNErrorNone);
    EXPECT_EQ(stringAt(replies[0], "ReplyIdentifier"), P::identifierOf(P::kAllowed));
    // No "Command": command 0.
    EXPECT_EQ(replyError(replies[1]), kQRNErrorNone);
    EXPECT_EQ(stringAt(replies[1], "ReplyIdentifier"), "com.orvex.test.nocommand");
    for (std::size_t i : {2, 3}) {
        EXPECT_EQ(replyError(replies[i]), kQRNErrorUnexpectedContainerType) << i;
        EXPECT_EQ(replies[i].get("ReplyPath"), nullptr) << i;
    }
    // Out of range and retired: nothing but the error in the reply.
    for (std::size_t i : {4, 5, 6}) {
        EXPECT_EQ(replyError(replies[i]), kQRNErrorInvalidCommand) << i;
        EXPECT_EQ(replies[i].size(), 1u) << replies[i].description();
    }
    EXPECT_FALSE(std::filesystem::exists(daemon() / "/private/var/mobile/Containers/Undefined"));
}

TEST_F(CommandRequests, EntitlementsAdmitClientsToCommands) {
    struct Case {
        std::string_view program;
        std::vector<std::pair<Value, std::uint64_t>> requests; // and the expected error
    };
    const Value wipeOwn = command(11, {{"Identifier", P::identifierOf(P::kWipeArray)}});
    const Value testLock = command(31, {{"TestLock", 1u}, {"Enable", true}});
    const std::vector<Case> cases{
        // "allowed" does not reach the test commands; it does reach the wipe.
        {P::kAllowed,
         {{testLock, kQRNErrorNotEntitled},
          {command(25), kQRNErrorNotEntitled},
          {command(11, {{"Identifier", "com.orvex.test.any"}}), kQRNErrorInvalidCommand}}},
        {P::kTestability,
         {{testLock, kQRNErrorInvalidCommand}, {command(1), kQRNErrorNotEntitled}}},
        // Without entitlements: only the commands open to everyone, on the
        // client's own identity.
        {P::kNone,
         {{createOrLookup(P::identifierOf(P::kNone), 2), kQRNErrorNone},
          {command(32), kQRNErrorNone},
          {command(13), kQRNErrorNone},
          {command(16), kQRNErrorNone},
          {command(17, {{"GroupIdentifier", "systemgroup.com.orvex.sharedpclogging"}}),
           kQRNErrorNone},
          {Requests::containersOfClass(2, false), kQRNErrorNotEntitled},
          {command(14), kQRNErrorNotEntitled},
          {command(5, {{"ContainerClass", 2u}, {"Key", "k"}, {"Value", "v"}}),
           kQRNErrorNotEntitled}}},
        // A lookup dictionary opens the commands that honour it, and no others.
        {P::kLookup,
         {{Requests::containersOfClass(2, false), kQRNErrorNone},
          {command(6, {{"ContainerClass", 2u}, {"Key", "k"}}), kQRNErrorNotEntitled}}},
        // Only a list of identifiers entitles to wipe.
        {P::kWipeBool, {{wipeOwn, kQRNErrorNotEntitled}}},
        {P::kWipeArray, {{wipeOwn, kQRNErrorInvalidCommand}}},
    };
    for (const Case& c : cases) {
        std::vector<Value> requests;
        for (const auto& request : c.requests) {
            requests.push_back(request.first);
        }
        const auto replies = repliesOf(c.program, requests);
        for (std::size_t i = 0; i < requests.size(); ++i) {
            EXPECT_EQ(replyError(replies[i]), c.requests[i].second)
                << c.program << " " << requests[i].description() << " -> "
                << replies[i].description();
        }
    }
}

TEST_F(CommandRequests, UnentitledClientStaysWithinItsOwnIdentity) {
    const auto replies =
        repliesOf(P::kNone, {command(15), command(15, {{"Identifier", kWellKnown}}),
                             createOrLookup("com.orvex.test.someone-else", 2)});
    // Its own system container only when its code signature declares one.
    EXPECT_EQ(replyError(replies[0]), kQRNErrorNotEntitled) << replies[0].description();
    // A well-known system container is open to all, and named by its identifier.
    EXPECT_EQ(replyError(replies[1]), kQRNErrorNone) << replies[1].description();
    const std::filesystem::path path = stringAt(replies[1], "ReplyPath");
    EXPECT_EQ(path, daemon() / "/private/var/containers/Data/System" / kWellKnown);
    EXPECT_TRUE(std::filesystem::is_directory(path));
    // Another identifier's container is out of reach, and nothing is made.
    EXPECT_EQ(replyError(replies[2]), kQRNErrorNotEntitled);
    EXPECT_EQ(replies[2].get("ReplyPath"), nullptr);
    EXPECT_EQ(replies[2].size(), 1u);
}

TEST_F(CommandRequests, StageForDeleteRefusesUnevenArraysAndStagesEvenOnes) {
    const std::string identifier = "com.orvex.test.staged";
    const auto created = repliesOf(P::kAllowed, {createOrLookup(identifier, 2)});
    const std::optional<UUID> uuid = uuidAt(created[0], "ReplyUUID");
    ASSERT_TRUE(uuid);
    const std::filesystem::path path = stringAt(created[0], "ReplyPath");
    const auto stage = [&](Value identifiers) {
        return command(3, {{"ContainerClassesArray", Value(Value::Array{2u})},
                           {"UUIDsArray", Value(Value::Array{*uuid})},
                           {"IdentifiersArray", std::move(identifiers)},
                           {"PersonaUniqueStringsArray", Value(Value::Array{""})}});
    };
    const auto uneven = repliesOf(P::kAllowed, {stage(Value(Value::Array{identifier, identifier})),
                                                createOrLookup(identifier, 2, false)});
    EXPECT_EQ(replyError(uneven[0]), kQRNErrorBadRequestArgument);
    EXPECT_EQ(uuidAt(uneven[1], "ReplyUUID"), uuid) << "staged although refused";
    EXPECT_TRUE(std::filesystem::exists(path));

    const auto even = repliesOf(P::kAllowed, {stage(Value(Value::Array{identifier})),
                                              createOrLookup(identifier, 2, false)});
    EXPECT_EQ(replyError(even[0]), kQRNErrorNone);
    EXPECT_NE(replyError(even[1]), kQRNErrorNone) << even[1].description();
    EXPECT_FALSE(std::filesystem::exists(path));
}

TEST_F(CommandRequests, InfoValuesAreSetReadAndRemoved) {
    const std::string identifier = "com.orvex.test.info";
    const Value::Dictionary container{{"Identifier", identifier}, {"ContainerClass", 2u}};
    const auto with = [&](std::uint64_t number, Value::Dictionary keys) {
        keys.insert(container.begin(), container.end());
        return command(number, std::move(keys));
    };
    const auto replies =
        repliesOf(P::kAllowed,
                  {createOrLookup(identifier, 2), with(5, {{"Key", "Colour"}, {"Value", "blue"}}),
                   with(6, {{"Key", "Colour"}}), with(7, {{"InfoDictRequested", true}}),
                   with(5, {{"Key", "Colour"}}), with(6, {{"Key", "Colour"}})});
    for (std::size_t i = 0; i < 5; ++i) {
        ASSERT_EQ(replyError(replies[i]), kQRNErrorNone) << i << " " << replies[i].description();
    }
    EXPECT_EQ(stringAt(replies[2], "ReplyInfoValue"), "blue");
    const Value* info = replies[3].get("ReplyInfoDictionary");
    ASSERT_NE(info, nullptr);
    EXPECT_EQ(stringAt(*info, "Colour"), "blue");
    EXPECT_EQ(stringAt(replies[3], "ReplyPath"), stringAt(replies[0], "ReplyPath"));
    // Removed: reading it again fails and carries no value.
    EXPECT_NE(replyError(replies[5]), kQRNErrorNone);
    EXPECT_EQ(replies[5].get("ReplyInfoValue"), nullptr);
}

TEST_F(CommandRequests, ListingAndDeletionOfContainers) {
    // Class 9 is used by no other test of this daemon, so the list is exact.
    const std::vector<std::string> identifiers{"com.orvex.test.listed.a",
                                               "com.orvex.test.listed.b"};
    const auto created = repliesOf(
        P::kAllowed, {createOrLookup(identifiers[0], 9), createOrLookup(identifiers[1], 9)});
    const auto listed = repliesOf(P::kAllowed, {Requests::containersOfClass(9, false)});
    ASSERT_EQ(replyError(listed[0]), kQRNErrorNone);
    const Value::Array* ids = arrayAt(listed[0], "ReplyIdsArray");
    const Value::Array* uuids = arrayAt(listed[0], "ReplyUUIDsArray");
    ASSERT_TRUE(ids && uuids);
    ASSERT_EQ(ids->size(), 2u);
    ASSERT_EQ(uuids->size(), 2u);
    for (std::size_t i = 0; i < 2; ++i) {
        const std::string* id = (*ids)[i].asString();
        ASSERT_NE(id, nullptr);
        const auto at = std::find(identifiers.begin(), identifiers.end(), *id);
        ASSERT_NE(at, identifiers.end()) << *id;
        EXPECT_EQ((*uuids)[i].asUUID(), uuidAt(created[at - identifiers.begin()], "ReplyUUID"));
    }

    const std::filesystem::path path = stringAt(created[0], "ReplyPath");
    const auto deleted =
        repliesOf(P::kAllowed, {Requests::deleteContainer(identifiers[0], 9, false),
                                createOrLookup(identifiers[0], 9, false),
                                Requests::containersOfClass(9, false)});
    EXPECT_EQ(replyError(deleted[0]), kQRNErrorNone);
    EXPECT_FALSE(std::filesystem::exists(path));
    EXPECT_EQ(replyError(deleted[1]), kQRNErrorContainerNotFound) << deleted[1].description();
    EXPECT_EQ(deleted[1].get("ReplyPath"), nullptr);
    const Value::Array* left = arrayAt(deleted[2], "ReplyIdsArray");
    ASSERT_NE(left, nullptr);
    EXPECT_EQ(Value(*left), Value(Value::Array{identifiers[1]})) << Value(*left).description();
}

TEST_F(CommandRequests, CommandsReplyingFromTheirCompletionReplyOnce) {
    const std::string identifier = "com.orvex.test.death-row";
    // Deleted, so that death row holds something when the pass runs; each
    // reply must belong to its own request, so a second reply to 4 or 21
    // would show up as the reply to the request after it.
    const auto replies =
        repliesOf(P::kAllowed,
                  {createOrLookup(identifier, 2), Requests::deleteContainer(identifier, 2, false),
                   Requests::deleteContainersOnDeathRow(), command(32),
                   command(21, {{"Identifier", identifier}, {"ContainerClass", 2u}}), command(32)});
    EXPECT_EQ(replyError(replies[1]), kQRNErrorNone);
    EXPECT_EQ(replyError(replies[2]), kQRNErrorNone) << replies[2].description();
    EXPECT_EQ(replies[2].size(), 1u) << replies[2].description();
    EXPECT_EQ(replyError(replies[4]), kQRNErrorInvalidCommand) << replies[4].description();
    EXPECT_EQ(replies[4].size(), 1u) << replies[4].description();
    for (std::size_t i : {3, 5}) {
        EXPECT_NE(replies[i].get("ReplyPersonaUniqueStringsArray"), nullptr)
            << replies[i].description();
    }
    // The pass replied when it was done: death row is empty.
    const std::filesystem::path deathRow =
        daemon() / "/private/var/root/Library/Caches/com.orvex.quarnd/Dead";
    EXPECT_TRUE(std::filesystem::is_empty(deathRow));
}

TEST_F(CommandRequests, SandboxedClientWithoutEnterprisePersonaGetsNoTokens) {
    const std::string identifier = "com.orvex.test.sandboxed.data";
    const auto replies =
        repliesOf(P::kSandboxed,
                  {createOrLookup(identifier, 2),
                   command(7, {{"Identifier", identifier}, {"ContainerClass", 2u}}), command(13)});
    for (const Value& reply : replies) {
        ASSERT_EQ(replyError(reply), kQRNErrorNone) << reply.description();
    }
    // Personas are not supported here, so no container is an enterprise one.
    EXPECT_EQ(replies[0].get("ReplySandboxToken"), nullptr);
    EXPECT_EQ(replies[1].get("ReplySandboxToken"), nullptr);
    EXPECT_EQ(replies[2].get("ReplySandboxTokenDict"), nullptr);
}

TEST_F(CommandRequests, ProgramNotMatchingItsDigestHasNoIdentity) {
    const auto replies = repliesOf(P::kBadDigest, {command(0, {{"ContainerClass", 2u}}),
                                                   Requests::containersOfClass(2, false)});
    EXPECT_EQ(replyError(replies[0]), kQRNErrorMissingIdentifier);
    EXPECT_EQ(replyError(replies[1]), kQRNErrorNotEntitled);
    EXPECT_NE(daemon().log().find("does not match the digest"), std::string::npos);
}

} // namespace quarn::test
