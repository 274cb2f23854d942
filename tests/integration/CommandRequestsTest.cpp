// Requests of client programs with different entitlements to one daemon:
// that the registry's identity and entitlements reach the commands, what
// lands on disk, and that each request gets exactly its own reply. What
// each handler answers is the unit tests' concern.

#include "Client/QRNClientRequests.h"
#include "DaemonHarness.h"

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

// The reply's value at `key`; none when absent.
Value at(const Value& reply, std::string_view key) {
    const Value* value = reply.get(key);
    return value ? *value : Value();
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
        EXPECT_EQ(at(replies[0], "ReplyExisted"), Value(false));
        EXPECT_EQ(at(replies[0], "ReplyIdentifier"), Value(identifier));
        const std::optional<UUID> uuid = at(replies[0], "ReplyUUID").asUUID();
        const Value replyPath = at(replies[0], "ReplyPath");
        ASSERT_TRUE(uuid && replyPath.asString());
        const std::filesystem::path path = *replyPath.asString();
        EXPECT_EQ(path.filename(), uuid->string());
        EXPECT_EQ(path.parent_path(),
                  daemon() / "/private/var/mobile/Containers" / c.classDirectory);
        EXPECT_TRUE(std::filesystem::exists(path / ".com.orvex.quarn_store.metadata.plist"));
        for (const std::string& subdirectory : c.subdirectories) {
            EXPECT_TRUE(std::filesystem::is_directory(path / subdirectory)) << subdirectory;
        }
        ASSERT_EQ(replyError(replies[1]), kQRNErrorNone);
        EXPECT_EQ(at(replies[1], "ReplyExisted"), Value(true));
        EXPECT_EQ(at(replies[1], "ReplyUUID"), Value(*uuid));
        EXPECT_EQ(at(replies[1], "ReplyPath"), Value(path.string()));
    }
}

TEST_F(CommandRequests, EntitlementsFromTheRegistryAdmitClientsToCommands) {
    struct Case {
        std::string_view program;
        Value request;
        std::uint64_t expected;
    };
    const Value wipeOwn = command(11, {{"Identifier", P::identifierOf(P::kWipeArray)}});
    const std::vector<Case> cases{
        {P::kAllowed, command(25), kQRNErrorNotEntitled},
        {P::kAllowed, command(11, {{"Identifier", "com.orvex.test.any"}}), kQRNErrorInvalidCommand},
        {P::kTestability, command(31, {{"TestLock", 1u}, {"Enable", true}}),
         kQRNErrorInvalidCommand},
        {P::kTestability, command(1), kQRNErrorNotEntitled},
        {P::kNone, command(32), kQRNErrorNone},
        {P::kNone, Requests::containersOfClass(2, false), kQRNErrorNotEntitled},
        {P::kLookup, Requests::containersOfClass(2, false), kQRNErrorNone},
        {P::kLookup, command(6, {{"ContainerClass", 2u}, {"Key", "k"}}), kQRNErrorNotEntitled},
        {P::kWipeBool, wipeOwn, kQRNErrorNotEntitled},
        {P::kWipeArray, wipeOwn, kQRNErrorInvalidCommand},
        // A program that does not match its digest has no identity at all.
        {P::kBadDigest, command(0, {{"ContainerClass", 2u}}), kQRNErrorMissingIdentifier},
        {P::kBadDigest, Requests::containersOfClass(2, false), kQRNErrorNotEntitled},
    };
    for (const Case& c : cases) {
        const Value reply = repliesOf(c.program, {c.request})[0];
        EXPECT_EQ(replyError(reply), c.expected)
            << c.program << " " << c.request.description() << " -> " << reply.description();
    }
    EXPECT_NE(daemon().log().find("does not match the digest"), std::string::npos);
}

TEST_F(CommandRequests, UnentitledClientStaysWithinItsOwnIdentity) {
    const auto replies =
        repliesOf(P::kNone, {command(0, {{"ContainerClass", 2u}, {"CreateIfNecessary", true}}),
                             command(15), command(15, {{"Identifier", kWellKnown}}),
                             createOrLookup("com.orvex.test.someone-else", 2)});
    // No "Identifier": the client's own, as the registry names it.
    EXPECT_EQ(replyError(replies[0]), kQRNErrorNone) << replies[0].description();
    EXPECT_EQ(at(replies[0], "ReplyIdentifier"), Value(P::identifierOf(P::kNone)));
    // Its own system container only when its code signature declares one.
    EXPECT_EQ(replyError(replies[1]), kQRNErrorNotEntitled) << replies[1].description();
    // A well-known system container is open to all, and named by its identifier.
    EXPECT_EQ(replyError(replies[2]), kQRNErrorNone) << replies[2].description();
    const std::filesystem::path path =
        daemon() / "/private/var/containers/Data/System" / kWellKnown;
    EXPECT_EQ(at(replies[2], "ReplyPath"), Value(path.string()));
    EXPECT_TRUE(std::filesystem::is_directory(path));
    // Another identifier's container is out of reach, and nothing is made.
    EXPECT_EQ(replyError(replies[3]), kQRNErrorNotEntitled);
    EXPECT_EQ(replies[3].size(), 1u);
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

} // namespace quarn::test
