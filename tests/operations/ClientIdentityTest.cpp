// Client identities and the rights they bring: what the code-signing
// registry says about the peer process, the installer's remembered
// identity, entitlements as booleans, the lookup entitlement per class and
// the protection class asked for.

#include "CreateFixture.h"

#include "Daemon/protection/QRNDataProtectionManager.h"

using namespace quarn;
using namespace quarn::test;

namespace {

class ClientIdentityTest : public CreateFixture {
protected:
    static QRNClientIdentityPtr identityOf(pid_t pid) {
        auto peer = IpcPeer::fromPID(pid);
        EXPECT_TRUE(peer);
        return peer ? QRNClientIdentity::clientIdentityWithPeer(*peer) : nullptr;
    }
};

} // namespace

TEST_F(ClientIdentityTest, IdentityCarriesTheRegisteredEntryAndOnlyTheInstallersIsKept) {
    EXPECT_FALSE(identityOf(::getpid())) << "no entry, no identity";
    registerSelf("com.orvex.tests", std::nullopt, true);
    auto identity = identityOf(::getpid());
    ASSERT_TRUE(identity);
    EXPECT_EQ(identity->entitlements(), Value::dictionary()) << "missing entitlements";
    EXPECT_EQ(clientIdentity(kClientBundle, Value("not a dictionary"))->entitlements(),
              Value::dictionary());

    const Value entitlements = Value::Dictionary{{"com.orvex.private.Quarn.allowed", true}};
    registerSelf("com.orvex.tests", entitlements, true);
    identity = identityOf(::getpid());
    ASSERT_TRUE(identity);
    EXPECT_EQ(identity->bundleIdentifier(), "com.orvex.tests");
    EXPECT_EQ(identity->entitlements(), entitlements);
    EXPECT_TRUE(identity->isSandboxed());
    EXPECT_EQ(identity->posixUID(), ::geteuid());
    EXPECT_EQ(identity->userIdentity()->posixUID(), kMobileUID) << "root acts for mobile";
    EXPECT_EQ(
        QRNClientIdentity::_bundleIdentifierFromAuditToken(identity->auditToken()).value_or(""),
        "com.orvex.tests");
    EXPECT_NE(identityOf(::getpid()), identity) << "only the installer's identity is kept";

    // The installer's identity is reused for the same process only, and
    // only the last one is remembered.
    registerSelf("com.orvex.installer", Value::dictionary());
    auto first = identityOf(::getpid());
    ASSERT_TRUE(first);
    EXPECT_EQ(identityOf(::getpid()), first);
    ForkedChild child;
    auto childIdentity = identityOf(child.pid());
    ASSERT_TRUE(childIdentity);
    EXPECT_EQ(childIdentity->posixPID(), child.pid());
    EXPECT_EQ(identityOf(child.pid()), childIdentity);
    EXPECT_NE(identityOf(::getpid()), first);
}

TEST_F(ClientIdentityTest,
       OnlyBooleansAndNumbersGrantAnEntitlementAndTheFirstProtectionKeyDecides) {
    auto identity =
        clientIdentity(kClientBundle, dictionaryOf({{"flag", Value(true)},
                                                    {"off", Value(false)},
                                                    {"one", Value(1)},
                                                    {"zero", Value(0)},
                                                    {"text", Value("true")},
                                                    {"dict", dictionaryOf({{"x", Value(true)}})},
                                                    {"list", arrayOf({Value(true)})}}));
    ASSERT_TRUE(identity);
    for (const char* name : {"flag", "off", "one", "zero", "text", "dict", "list", "absent"}) {
        const std::string_view granted(name);
        EXPECT_EQ(identity->boolValueOfEntitlement(name), granted == "flag" || granted == "one")
            << name;
    }

    // The protection class asked for follows the first key present.
    using M = QRNDataProtectionManager;
    const struct {
        Value entitlements;
        int expected;
    } cases[] = {
        {dictionaryOf({{"DataProtectionClass", Value(M::kProtectionWriteOnly)}}), 2},
        {dictionaryOf({{"data-protection-class", Value(M::kProtectionNone)},
                       {"DataProtectionClass", Value(M::kProtectionComplete)}}),
         4},
        // The first key present decides, even when it holds no string.
        {dictionaryOf({{"com.orvex.developer.default-data-protection", Value(1)},
                       {"DataProtectionClass", Value(M::kProtectionComplete)}}),
         0},
        {Value::dictionary(), 0},
        {dictionaryOf({{"DataProtectionClass", Value("Sometimes")}}), 0},
    };
    for (const auto& c : cases) {
        EXPECT_EQ(M::intendedDataProtectionClassForEntitlements(c.entitlements), c.expected)
            << c.entitlements.description();
    }
}
