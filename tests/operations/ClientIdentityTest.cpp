// Client identities made from a connection: what the code-signing registry
// says about the peer process, and the installer's remembered identity.

#include "Daemon/operations/QRNClientIdentity.h"
#include "Daemon/platform/IpcConnection.h"
#include "Daemon/support/PropertyList.h"

#include "common/LogCapture.h"
#include "common/TempRoot.h"

#include <gtest/gtest.h>

#include <sys/wait.h>
#include <unistd.h>

using namespace quarn;
using namespace quarn::test;

namespace {

class FakeConnection final : public IpcConnection {
public:
    explicit FakeConnection(IpcPeer peer) : peer_(std::move(peer)) {}
    const IpcPeer& peer() const override { return peer_; }
    void setEventHandler(EventHandler) override {}
    void resume() override {}
    void sendReply(const Value&) override {}
    void cancel() override {}

private:
    IpcPeer peer_;
};

// A forked copy of this process that lives until the object goes: the same
// executable, another audit token.
class ChildProcess {
public:
    ChildProcess() {
        EXPECT_EQ(::pipe(pipe_), 0);
        pid_ = ::fork();
        if (pid_ == 0) {
            ::close(pipe_[1]); // else the read below never sees the parent close its end
            char byte;
            [[maybe_unused]] ssize_t n = ::read(pipe_[0], &byte, 1);
            ::_exit(0);
        }
        ::close(pipe_[0]);
    }
    ~ChildProcess() {
        ::close(pipe_[1]);
        ::waitpid(pid_, nullptr, 0);
    }
    pid_t pid() const { return pid_; }

private:
    int pipe_[2] = {-1, -1};
    pid_t pid_ = -1;
};

class ClientIdentityTest : public TempRootTest {
protected:
    void registerSelf(const std::string& identifier, std::optional<Value> entitlements,
                      bool sandboxed = false) {
        Value plist = Value::dictionary();
        plist.set("Program", std::filesystem::read_symlink("/proc/self/exe").string());
        plist.set("Identifier", identifier);
        plist.set("Sandboxed", sandboxed);
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
        if (!peer) {
            return nullptr;
        }
        return QRNClientIdentity::clientIdentityWithVellConnection(FakeConnection(*peer));
    }
};

} // namespace

TEST_F(ClientIdentityTest, IdentityCarriesTheRegisteredEntry) {
    const Value entitlements = Value::Dictionary{{"com.orvex.private.Quarn.allowed", true},
                                                 {"com.orvex.private.Quarn.lookup", "true"}};
    registerSelf("com.orvex.tests", entitlements, true);
    auto peer = IpcPeer::fromPID(::getpid());
    ASSERT_TRUE(peer);
    auto identity = QRNClientIdentity::clientIdentityWithVellConnection(FakeConnection(*peer));
    ASSERT_TRUE(identity);
    EXPECT_EQ(identity->bundleIdentifier(), "com.orvex.tests");
    EXPECT_EQ(identity->entitlements(), entitlements);
    EXPECT_TRUE(identity->isSandboxed());
    EXPECT_FALSE(identity->isKernel());
    EXPECT_EQ(identity->posixPID(), ::getpid());
    EXPECT_EQ(identity->posixUID(), ::geteuid());
    EXPECT_EQ(identity->auditToken(), peer->auditToken());
    ASSERT_TRUE(identity->userIdentity());
    EXPECT_EQ(identity->userIdentity()->posixUID(), kMobileUID) << "root acts for mobile";
    EXPECT_TRUE(identity->boolValueOfEntitlement("com.orvex.private.Quarn.allowed"));
    EXPECT_FALSE(identity->boolValueOfEntitlement("com.orvex.private.Quarn.lookup"))
        << "the string \"true\" is no boolean";

    auto bundle = QRNClientIdentity::_bundleIdentifierFromAuditToken(peer->auditToken());
    ASSERT_TRUE(bundle);
    EXPECT_EQ(*bundle, "com.orvex.tests");
    EXPECT_NE(identityOf(::getpid()), identity) << "only the installer's identity is kept";
}

TEST_F(ClientIdentityTest, MissingEntitlementsGiveAnEmptyDictionary) {
    registerSelf("com.orvex.tests", std::nullopt);
    LogCapture log;
    auto identity = identityOf(::getpid());
    ASSERT_TRUE(identity);
    EXPECT_EQ(identity->entitlements(), Value::dictionary());
    EXPECT_TRUE(
        log.contains(fmt::format("Missing or malformed entitlements for pid {}", ::getpid())))
        << log.all();
}

TEST_F(ClientIdentityTest, ProcessWithoutEntryHasNoIdentity) {
    LogCapture log;
    EXPECT_FALSE(identityOf(::getpid()));
    EXPECT_TRUE(log.contains(fmt::format("Failed to copy signing ID for pid {} : ", ::getpid())))
        << log.all();
    EXPECT_TRUE(log.contains("Vell client identity: (null)")) << log.all();
}

TEST_F(ClientIdentityTest, InstallerIdentityIsReusedForTheSameProcessOnly) {
    registerSelf("com.orvex.installer", Value::dictionary());
    auto first = identityOf(::getpid());
    ASSERT_TRUE(first);
    EXPECT_EQ(identityOf(::getpid()), first);

    ChildProcess child;
    auto childIdentity = identityOf(child.pid());
    ASSERT_TRUE(childIdentity);
    EXPECT_NE(childIdentity, first);
    EXPECT_EQ(childIdentity->posixPID(), child.pid());
    EXPECT_EQ(identityOf(child.pid()), childIdentity);
    // Only the last installer identity is remembered.
    EXPECT_NE(identityOf(::getpid()), first);
}
