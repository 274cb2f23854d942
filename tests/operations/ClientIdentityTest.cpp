// Client identities and the rights they bring: what the code-signing
// registry says about the peer process, the installer's remembered
// identity, entitlements as booleans, the lookup entitlement per class and
// the protection class asked for.

#include "Daemon/model/QRNUserIdentitySharedCache.h"
#include "Daemon/operations/QRNClientIdentity.h"
#include "Daemon/protection/QRNDataProtectionManager.h"
#include "Daemon/support/PropertyList.h"

#include "common/TempRoot.h"
#include "common/shared/RequestValues.h"

#include <gtest/gtest.h>

#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

using namespace quarn;
using namespace quarn::test;

namespace {

// A forked copy of this process, alive until the object goes: the same
// executable, another audit token.
struct ChildProcess {
    ChildProcess() {
        if (pid == 0) {
            ::pause();
            ::_exit(0);
        }
    }
    ~ChildProcess() {
        if (pid > 0) {
            ::kill(pid, SIGKILL);
            ::waitpid(pid, nullptr, 0);
        }
    }
    const pid_t pid = ::fork();
};

class ClientIdentityTest : public TempRootTest {
protected:
    void registerSelf(const std::string& identifier, std::optional<Value> entitlements,
                      bool sandboxed = false) {
        Value plist = dictionaryOf(
            {{"Program", Value(std::filesystem::read_symlink("/proc/self/exe").string())},
             {"Identifier", Value(identifier)},
             {"Sandboxed", Value(sandboxed)}});
        if (entitlements) {
            plist.set("Entitlements", *entitlements);
        }
        const auto directory = root_ / "/etc/quarnd/codesign.d";
        std::filesystem::create_directories(directory);
        ASSERT_TRUE(QRN_writeToURL(plist, directory / "self.plist", {.atomic = true}));
    }
    static QRNClientIdentityPtr identityOf(pid_t pid) {
        auto peer = IpcPeer::fromPID(pid);
        EXPECT_TRUE(peer);
        return peer ? QRNClientIdentity::clientIdentityWithPeer(*peer) : nullptr;
    }
    static QRNClientIdentityPtr client(Value entitlements) {
        return QRNClientIdentity::initWithBundleIdentifier(
            "com.example.client", kMobileUID, kMobileUID, 77,
            QRNUserIdentitySharedCache::sharedCache().defaultUserIdentity(),
            std::move(entitlements), true, QRNClientIdentity::AuditToken{}, false);
    }
};

} // namespace

TEST_F(ClientIdentityTest, IdentityCarriesTheRegisteredEntryAndOnlyTheInstallersIsKept) {
    EXPECT_FALSE(identityOf(::getpid())) << "no entry, no identity";
    registerSelf("com.orvex.tests", std::nullopt, true);
    auto identity = identityOf(::getpid());
    ASSERT_TRUE(identity);
    EXPECT_EQ(identity->entitlements(), Value::dictionary()) << "missing entitlements";
    EXPECT_EQ(client(Value("not a dictionary"))->entitlements(), Value::dictionary());

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
    ChildProcess child;
    auto childIdentity = identityOf(child.pid);
    ASSERT_TRUE(childIdentity);
    EXPECT_EQ(childIdentity->posixPID(), child.pid);
    EXPECT_EQ(identityOf(child.pid), childIdentity);
    EXPECT_NE(identityOf(::getpid()), first);
}

TEST_F(ClientIdentityTest,
       OnlyBooleansAndNumbersGrantAnEntitlementAndTheFirstProtectionKeyDecides) {
    auto identity = client(dictionaryOf({{"flag", Value(true)},
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
