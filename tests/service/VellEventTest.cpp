// The request protocol end to end on a fake connection: which commands run,
// which rights an entitlement set gives, and how many replies go out.

#include "VellEventFixture.h"

#include "Daemon/model/QRNContainerClass.h"
#include "Daemon/model/QRNGlobalConfiguration.h"
#include "Daemon/operations/QRNCommandQueue.h"
#include "Daemon/service/QRNCommandTable.h"
#include "Daemon/service/QRNVellEvent.h"
#include "Daemon/service/QRNVellReply.h"

#include <filesystem>
#include <limits>

using namespace quarn;
using namespace quarn::test;

namespace {

const QRNCommandTableEntry& entry(std::uint64_t command) {
    return QRNCommandTable::entries()[command];
}

class VellEventTest : public VellEventFixture {};

TEST_F(VellEventTest, CommandNumbersOutsideTheTableAnswer49WithNothingElse) {
    for (std::uint64_t command : {std::uint64_t(33), std::numeric_limits<std::uint64_t>::max()}) {
        Value reply = send(dictionaryOf({{"Command", Value(command)}}));
        EXPECT_EQ(reply, dictionaryOf({{"ReplyError", Value(49u)}})) << command;
    }
    // Not a dictionary at all: no command can be read from it.
    EXPECT_EQ(replyError(send(arrayOf({Value(0u)}))), 49u);
}

TEST_F(VellEventTest, AMissingOrMistypedCommandRunsCommandZero) {
    for (const Value& request :
         {dictionaryOf({{"ContainerClass", Value(2u)}, {"CreateIfNecessary", Value(true)}}),
          dictionaryOf({{"Command", Value("5")},
                        {"ContainerClass", Value(2u)},
                        {"CreateIfNecessary", Value(true)}})}) {
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

struct AdmissionCase {
    const char* name;
    Value entitlements;
    std::uint64_t command;
    std::uint64_t expected;
};

TEST_F(VellEventTest, EntitlementsAdmitToCommands) {
    const Value allowed = dictionaryOf({{"com.orvex.private.Quarn.allowed", Value(true)}});
    const Value none = Value::dictionary();
    const Value lookup = dictionaryOf({{"com.orvex.private.Quarn.lookup", Value::dictionary()}});
    const AdmissionCase cases[] = {
        {"allowed does not reach the test commands", allowed, 25, 55},
        {"allowed does not reach the test lock", allowed, 31, 55},
        {"testability reaches the test commands",
         dictionaryOf({{"com.orvex.private.Quarn.testability", Value(true)}}), 25, 49},
        {"retired number", allowed, 27, 49},
        {"allowed as a string is not allowed",
         dictionaryOf({{"com.orvex.private.Quarn.allowed", Value("true")}}), 27, 55},
        {"no entitlements, listing", none, 1, 55},
        {"a lookup dictionary admits to listing", lookup, 1, 1},
        {"lookup is not read where the command ignores it", lookup, 3, 55},
        {"no entitlements, own personas", none, 32, 1},
        {"no entitlements, own groups", none, 13, 1},
        {"no entitlements, own system groups", none, 16, 1},
        {"no entitlements, group identifiers", none, 14, 55},
        {"no entitlements, info values", none, 5, 55},
        {"wipe as a boolean",
         dictionaryOf({{"com.orvex.private.Quarn.wipeContainer", Value(true)}}), 11, 55},
        {"wipe as a list",
         dictionaryOf({{"com.orvex.private.Quarn.wipeContainer", arrayOf({Value("a")})}}), 11, 49},
        {"allowed reaches wipe without a list", allowed, 11, 49},
        {"asynchronous command refused", none, 21, 55},
        {"asynchronous command not in this build", allowed, 21, 49},
    };
    for (const AdmissionCase& c : cases) {
        setClient(kVellClient, c.entitlements);
        Value reply =
            send(dictionaryOf({{"Command", Value(c.command)}, {"ContainerClass", Value(2u)}}));
        EXPECT_EQ(replyError(reply), c.expected) << c.name;
    }
}

TEST_F(VellEventTest, ClientsWithoutAnIdentityRunOnlyWhatNeedsNone) {
    // A process the registry does not know: commands that need no rights
    // still run, with no identifier to take.
    setUnknownClient();
    EXPECT_EQ(
        replyError(send(dictionaryOf({{"Command", Value(0u)}, {"ContainerClass", Value(2u)}}))),
        18u);
    EXPECT_EQ(replyError(send(dictionaryOf({{"Command", Value(6u)}}))), 55u);
}

TEST_F(VellEventTest, RightsHandedToTheClientConnection) {
    auto identity = [&](Value entitlements) {
        return QRNClientIdentity::initWithBundleIdentifier(kVellClient, kMobileUID, kMobileUID, 7,
                                                           user(), std::move(entitlements), false,
                                                           {}, false);
    };
    auto queue = std::make_shared<QRNCommandQueue>();
    std::uint64_t error = 1;

    auto full = checkEntitlementsAndInitClientObject(
        identity(dictionaryOf({{"com.orvex.private.Quarn.allowed", Value(1u)},
                               {"com.orvex.private.Quarn.lookup", Value::dictionary()}})),
        entry(0), queue, error);
    ASSERT_TRUE(full);
    EXPECT_TRUE(full->entitled() && full->unrestricted() && full->allowOtherIdLookup());
    EXPECT_FALSE(full->lookup()) << "allowed needs no lookup dictionary";
    EXPECT_EQ(full->commandQueue(), queue);

    auto lesser = checkEntitlementsAndInitClientObject(
        identity(dictionaryOf({{"com.orvex.private.Quarn.otherIdLookup", Value(true)},
                               {"com.orvex.private.Quarn.lookup",
                                dictionaryOf({{"appData", arrayOf({Value("x")})}})}})),
        entry(23), queue, error);
    ASSERT_TRUE(lesser);
    EXPECT_FALSE(lesser->entitled() || lesser->unrestricted());
    EXPECT_TRUE(lesser->allowOtherIdLookup());
    EXPECT_TRUE(lesser->isEntitledForLookupWithClass(2, "x"));

    auto wiper = checkEntitlementsAndInitClientObject(
        identity(dictionaryOf({{"com.orvex.private.Quarn.wipeContainer",
                                arrayOf({Value("com.example.a"), Value(3u)})}})),
        entry(11), queue, error);
    ASSERT_TRUE(wiper);
    EXPECT_TRUE(wiper->entitled());
    EXPECT_EQ(wiper->entitledWipeIdentifiers(), std::vector<std::string>{"com.example.a"});
    EXPECT_EQ(error, 1u);

    auto anonymous = checkEntitlementsAndInitClientObject(nullptr, entry(0), queue, error);
    ASSERT_TRUE(anonymous);
    EXPECT_FALSE(anonymous->entitled() || anonymous->allowOtherIdLookup() ||
                 anonymous->unrestricted());
    EXPECT_FALSE(checkEntitlementsAndInitClientObject(nullptr, entry(1), queue, error));
    EXPECT_EQ(error, 55u);
}

TEST_F(VellEventTest, DeathRowDeletionRepliesOnceFromItsCompletion) {
    std::filesystem::path deathrow = QRNGlobalConfiguration::sharedInstance().deathrowDirectory();
    std::filesystem::create_directories(deathrow / "A" / "deep");
    // Refused: the dispatcher's reply is the only one.
    EXPECT_EQ(replyError(send(dictionaryOf({{"Command", Value(4u)}}))), 55u);
    drainDeathRow();
    EXPECT_TRUE(std::filesystem::exists(deathrow / "A"));
    connection_ = std::make_shared<FakeIpcConnection>();
    setClient(kVellClient,
              dictionaryOf({{"com.orvex.private.Quarn.userManagedAssets", Value(true)}}));
    dispatch(dictionaryOf({{"Command", Value(4u)}}));
    drainDeathRow();
    std::vector<Value> replies = connection_->replies();
    ASSERT_EQ(replies.size(), 1u);
    EXPECT_EQ(replies[0], dictionaryOf({{"ReplyError", Value(1u)}}));
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
    std::vector<Value> replies = connection_->replies();
    ASSERT_EQ(replies.size(), 1u);
    EXPECT_EQ(replyError(replies[0]), 40u);
}

} // namespace
