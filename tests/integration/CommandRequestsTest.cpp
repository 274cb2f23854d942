// Requests of client programs with different entitlements to one daemon:
// that the registry's identity and entitlements reach the commands, what
// lands on disk, and that each request gets exactly its own reply. What
// each handler answers is the unit tests' concern.

#include "Client/QRNClientRequests.h"
#include "DaemonHarness.h"

namespace quarn::test {

namespace {

using namespace program;
using Requests = QRNClientRequests;

using CommandRequests = SharedDaemonTest;

Value command(std::uint64_t number, Value::Dictionary keys = {}) {
    keys.emplace("Command", number);
    return Value(std::move(keys));
}

Value create(const std::string& identifier, std::uint64_t containerClass = 2) {
    return Requests::createOrLookup(identifier, containerClass, true, false);
}

Value at(const Value& reply, std::string_view key) {
    const Value* value = reply.get(key);
    return value ? *value : Value();
}

} // namespace

TEST_F(CommandRequests, CreateThenLookUpFindsTheSameContainerWithItsSubdirectories) {
    const struct {
        std::uint64_t containerClass;
        std::string classDirectory;
        std::vector<std::string> subdirectories;
    } cases[] = {
        {2,
         "Data/Application",
         {"Documents", "Library", "Library/Caches", "Library/Preferences", "SystemData", "tmp"}},
        {7, "Shared/AppGroup", {"Library", "Library/Caches", "Library/Preferences"}},
        {10, "Data/InternalDaemon", {"Library", "Library/Caches", "Library/Preferences", "tmp"}},
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(c.containerClass);
        const std::string identifier = "com.orvex.test.created." + std::to_string(c.containerClass);
        const auto replies = daemon().replies(
            kAllowed, {create(identifier, c.containerClass), create(identifier, c.containerClass)});
        ASSERT_EQ(replyError(replies[0]), kQRNErrorNone) << replies[0].description();
        EXPECT_EQ(at(replies[0], "ReplyExisted"), Value(false));
        const std::optional<UUID> uuid = at(replies[0], "ReplyUUID").asUUID();
        ASSERT_TRUE(uuid && at(replies[0], "ReplyPath").asString());
        const std::filesystem::path path = *at(replies[0], "ReplyPath").asString();
        EXPECT_EQ(path,
                  daemon() / "/private/var/mobile/Containers" / c.classDirectory / uuid->string());
        EXPECT_TRUE(std::filesystem::exists(path / ".com.orvex.quarn_store.metadata.plist"));
        for (const std::string& subdirectory : c.subdirectories) {
            EXPECT_TRUE(std::filesystem::is_directory(path / subdirectory)) << subdirectory;
        }
        EXPECT_EQ(at(replies[1], "ReplyExisted"), Value(true));
        EXPECT_EQ(at(replies[1], "ReplyUUID"), Value(*uuid));
        EXPECT_EQ(at(replies[1], "ReplyPath"), Value(path.string()));
    }
}

TEST_F(CommandRequests, EntitlementsFromTheRegistryAdmitClientsToCommands) {
    constexpr const char* kWellKnown = "com.orvex.devicesettings";
    const Value wipeOwn = command(11, {{"Identifier", identifierOf(kWipeArray)}});
    const struct {
        std::string_view program;
        Value request;
        std::uint64_t expected;
    } cases[] = {
        {kAllowed, command(25), kQRNErrorNotEntitled},
        {kAllowed, command(11, {{"Identifier", "com.orvex.test.any"}}), kQRNErrorInvalidCommand},
        {kTestability, command(31, {{"TestLock", 1u}, {"Enable", true}}), kQRNErrorInvalidCommand},
        {kTestability, command(1), kQRNErrorNotEntitled},
        {kNone, command(32), kQRNErrorNone},
        {kNone, Requests::containersOfClass(2, false), kQRNErrorNotEntitled},
        // Its own system container only when its code signature declares one;
        // a well-known one is open to all; another identifier's is out of reach.
        {kNone, command(15), kQRNErrorNotEntitled},
        {kNone, command(15, {{"Identifier", kWellKnown}}), kQRNErrorNone},
        {kNone, create("com.orvex.test.someone-else"), kQRNErrorNotEntitled},
        {kLookup, Requests::containersOfClass(2, false), kQRNErrorNone},
        {kLookup, command(6, {{"ContainerClass", 2u}, {"Key", "k"}}), kQRNErrorNotEntitled},
        {kWipeBool, wipeOwn, kQRNErrorNotEntitled},
        {kWipeArray, wipeOwn, kQRNErrorInvalidCommand},
        // A program that does not match its digest has no identity at all.
        {kBadDigest, command(0, {{"ContainerClass", 2u}}), kQRNErrorMissingIdentifier},
        {kBadDigest, Requests::containersOfClass(2, false), kQRNErrorNotEntitled},
    };
    for (const auto& c : cases) {
        const Value reply = daemon().replies(c.program, {c.request})[0];
        EXPECT_EQ(replyError(reply), c.expected)
            << c.program << " " << c.request.description() << " -> " << reply.description();
    }
    EXPECT_TRUE(std::filesystem::is_directory(daemon() / "/private/var/containers/Data/System" /
                                              kWellKnown));
    // No "Identifier": the client's own, as the registry names it.
    const Value own = daemon().replies(
        kNone, {command(0, {{"ContainerClass", 2u}, {"CreateIfNecessary", true}})})[0];
    EXPECT_EQ(at(own, "ReplyIdentifier"), Value(identifierOf(kNone))) << own.description();
}

TEST_F(CommandRequests, CommandsReplyingFromTheirCompletionReplyOnce) {
    const std::string identifier = "com.orvex.test.death-row";
    // Deleted, so that death row holds something when the pass runs; a
    // second reply to 4 or 21 would show up as the reply to the next request.
    const auto replies = daemon().replies(
        kAllowed, {create(identifier), Requests::deleteContainer(identifier, 2, false),
                   Requests::deleteContainersOnDeathRow(), command(32),
                   command(21, {{"Identifier", identifier}, {"ContainerClass", 2u}}), command(32)});
    EXPECT_EQ(replyError(replies[1]), kQRNErrorNone);
    for (const auto& [i, expected] :
         {std::pair<int, std::uint64_t>{2, kQRNErrorNone}, {4, kQRNErrorInvalidCommand}}) {
        EXPECT_EQ(replyError(replies[i]), expected) << replies[i].description();
        EXPECT_EQ(replies[i].size(), 1u) << replies[i].description();
    }
    for (std::size_t i : {3, 5}) {
        EXPECT_NE(replies[i].get("ReplyPersonaUniqueStringsArray"), nullptr);
    }
    // The pass replied when it was done: death row is empty.
    EXPECT_TRUE(std::filesystem::is_empty(
        daemon() / "/private/var/root/Library/Caches/com.orvex.quarnd/Dead"));
}

} // namespace quarn::test
