// The identity of a connection's process: settled once when the connection
// is handed over, made again only when the registry changes, and none for a
// process that exec'd in between. Who an identity says the client is is
// tested in tests/operations.

#include "VellEventFixture.h"

#include "Daemon/service/QRNClientIdentityCache.h"

using namespace quarn;
using namespace quarn::test;

namespace {

const Value kAllowed = Value::Dictionary{{"com.orvex.private.Quarn.allowed", true}};

class ClientIdentityCacheTest : public CreateFixture {
protected:
    FakeIpcConnection connection_{*IpcPeer::fromPID(::getpid())};
};

} // namespace

TEST_F(ClientIdentityCacheTest, TheIdentitySettledAtHandOverHoldsUntilTheRegistryChanges) {
    registerSelf("com.orvex.tests", kAllowed);
    QRNClientIdentityCache cache(connection_);
    const auto settled = cache.identityFor(connection_);
    ASSERT_TRUE(settled);
    EXPECT_EQ(settled->posixPID(), ::getpid());

    // What the registry says after the hand-over is not looked at again
    // while its generation stays; a reload is seen by the next message.
    registerSelf("com.orvex.tests", Value::dictionary());
    const auto after = cache.identityFor(connection_);
    ASSERT_TRUE(after);
    EXPECT_NE(after, settled);
    EXPECT_FALSE(after->boolValueOfEntitlement("com.orvex.private.Quarn.allowed"));
    EXPECT_EQ(cache.identityFor(connection_), after) << "made once per change";
}

TEST_F(ClientIdentityCacheTest, AProcessThatExecdWhileBeingIdentifiedHasNoIdentity) {
    registerSelf("com.orvex.tests", kAllowed);
    connection_.sameProgram = false;
    QRNClientIdentityCache cache(connection_);
    EXPECT_FALSE(cache.identityFor(connection_));
    // Nor after a reload, should the transport still let it write.
    registerSelf("com.orvex.tests", Value::dictionary());
    EXPECT_FALSE(cache.identityFor(connection_));
    connection_.sameProgram = true;
    registerSelf("com.orvex.tests", kAllowed);
    EXPECT_TRUE(cache.identityFor(connection_));
}
