// The identities of a connection's writers: each writer is identified by
// its own process, once, until its process, its ids or the code-signing
// registry change. Who an identity says the writer is is tested in
// tests/operations.

#include "VellEventFixture.h"

#include "Daemon/service/QRNClientIdentityCache.h"

using namespace quarn;
using namespace quarn::test;

namespace {

class ClientIdentityCacheTest : public CreateFixture {
protected:
    QRNClientIdentityPtr identityOf(std::optional<IpcConnection::Sender> sender) {
        connection_.sender = sender;
        return cache_.identityFor(connection_);
    }
    static IpcConnection::Sender writer(pid_t pid) { return {pid, ::getuid(), ::getgid()}; }
    static IpcConnection::Sender self() { return writer(::getpid()); }

    FakeIpcConnection connection_{*IpcPeer::fromPID(::getpid())};
    QRNClientIdentityCache cache_;
};

const Value kAllowed = Value::Dictionary{{"com.orvex.private.Quarn.allowed", true}};

} // namespace

TEST_F(ClientIdentityCacheTest, AWriterKeepsItsIdentityUntilItsProcessIdsOrTheRegistryChange) {
    registerSelf("com.orvex.tests", kAllowed);
    const auto parent = identityOf(self());
    ASSERT_TRUE(parent);
    EXPECT_EQ(identityOf(self()), parent) << "a writer is identified once";
    EXPECT_EQ(identityOf(std::nullopt), parent) << "without a writer the peer is the writer";

    // A child sharing the connection writes as itself, and an exec after its
    // first message (to a program the registry does not know) changes nothing.
    ForkedChild forked;
    const auto child = identityOf(writer(forked.pid()));
    ASSERT_TRUE(child);
    EXPECT_NE(child, parent);
    EXPECT_EQ(child->posixPID(), forked.pid());
    forked.exec();
    EXPECT_EQ(identityOf(writer(forked.pid())), child);
    const IpcConnection::Sender gone = writer(forked.pid());
    forked.reap();
    EXPECT_FALSE(identityOf(gone)) << "an exited writer is not answered from the cache";

    IpcConnection::Sender changed = self();
    changed.uid += 1000;
    const auto again = identityOf(changed);
    ASSERT_TRUE(again);
    EXPECT_NE(again, parent) << "other ids are another key";
    EXPECT_EQ(again->posixUID(), ::geteuid()) << "the ids are read again from the process";
    EXPECT_FALSE(identityOf(IpcConnection::Sender{0, 0, 0}))
        << "a writer the kernel could not name has no identity";

    registerSelf("com.orvex.tests", Value::dictionary());
    const auto after = identityOf(self());
    ASSERT_TRUE(after);
    EXPECT_FALSE(after->boolValueOfEntitlement("com.orvex.private.Quarn.allowed"))
        << "a registry change is seen by the next message";
}
