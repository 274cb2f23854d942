// The identities of a connection's writers: each writer is identified by
// its own process, once, until its process, its ids or the code-signing
// registry change.

#include "Daemon/service/QRNClientIdentityCache.h"
#include "Daemon/support/PropertyList.h"

#include "common/TempRoot.h"

#include <gtest/gtest.h>

#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <thread>

using namespace quarn;
using namespace quarn::test;

namespace {

constexpr const char* kSleep = "/usr/bin/sleep";

// A connection of this process whose current message was written by
// `sender`, as the transport reports it.
class WrittenConnection final : public IpcConnection {
public:
    explicit WrittenConnection(IpcPeer peer) : peer_(std::move(peer)) {}
    const IpcPeer& peer() const override { return peer_; }
    std::optional<Sender> messageSender() const override { return sender; }
    void setEventHandler(EventHandler) override {}
    void resume() override {}
    void sendReply(const Value&) override {}
    void cancel() override {}

    std::optional<Sender> sender;

private:
    IpcPeer peer_;
};

// A fork of this process that, when told, execs `sleep` and runs until it
// is killed.
class Child {
public:
    Child() {
        EXPECT_EQ(::pipe(pipe_), 0);
        pid_ = ::fork();
        if (pid_ == 0) {
            ::close(pipe_[1]);
            char byte = 0;
            if (::read(pipe_[0], &byte, 1) == 1) {
                ::execl(kSleep, kSleep, "60", nullptr);
            }
            ::_exit(0);
        }
        ::close(pipe_[0]);
    }
    ~Child() { reap(); }

    pid_t pid() const { return pid_; }
    IpcConnection::Sender sender() const { return {pid_, ::getuid(), ::getgid()}; }

    // Returns once the child runs `sleep`.
    void exec() {
        ASSERT_EQ(::write(pipe_[1], "x", 1), 1);
        const auto path = "/proc/" + std::to_string(pid_) + "/exe";
        for (int i = 0; i < 2000; ++i) {
            std::error_code error;
            if (std::filesystem::read_symlink(path, error) == kSleep) {
                return;
            }
            std::this_thread::sleep_for(std::chrono::milliseconds(5));
        }
        FAIL() << "the child never ran " << kSleep;
    }
    void reap() {
        if (pid_ > 0) {
            ::kill(pid_, SIGKILL);
            ::close(pipe_[1]);
            ::waitpid(pid_, nullptr, 0);
            pid_ = -1;
        }
    }

private:
    int pipe_[2] = {-1, -1};
    pid_t pid_ = -1;
};

class ClientIdentityCacheTest : public TempRootTest {
protected:
    void registerProgram(const std::string& file, const std::string& program,
                         const std::string& identifier, const Value& entitlements) {
        Value plist = Value::dictionary();
        plist.set("Program", program);
        plist.set("Identifier", identifier);
        plist.set("Entitlements", entitlements);
        const auto directory = root_ / "/etc/quarnd/codesign.d";
        std::filesystem::create_directories(directory);
        ASSERT_TRUE(QRN_writeToURL(plist, directory / file, {.atomic = true}));
    }
    void registerSelf(const Value& entitlements) {
        registerProgram("self.plist", std::filesystem::read_symlink("/proc/self/exe").string(),
                        "com.orvex.tests", entitlements);
    }

    QRNClientIdentityPtr identityOf(const IpcConnection::Sender& sender) {
        connection_.sender = sender;
        return cache_.identityFor(connection_);
    }
    static IpcConnection::Sender self() { return {::getpid(), ::getuid(), ::getgid()}; }
    static IpcPeer selfPeer() {
        auto peer = IpcPeer::fromPID(::getpid());
        EXPECT_TRUE(peer);
        return *peer;
    }

    WrittenConnection connection_{selfPeer()};
    QRNClientIdentityCache cache_;
};

const Value kAllowed = Value::Dictionary{{"com.orvex.private.Quarn.allowed", true}};

} // namespace

TEST_F(ClientIdentityCacheTest, EachWriterHasItsOwnIdentityFixedAtItsFirstMessage) {
    registerSelf(kAllowed);
    registerProgram("sleep.plist", kSleep, "com.orvex.sleeper", Value::dictionary());

    const auto parent = identityOf(self());
    ASSERT_TRUE(parent);
    EXPECT_EQ(parent->bundleIdentifier(), "com.orvex.tests");
    EXPECT_EQ(identityOf(self()), parent) << "a writer is identified once";

    // A child sharing the connection writes as itself, and an exec after
    // its first message gives it no other rights.
    Child forked;
    const auto child = identityOf(forked.sender());
    ASSERT_TRUE(child);
    EXPECT_EQ(child->posixPID(), forked.pid());
    forked.exec();
    EXPECT_EQ(identityOf(forked.sender()), child);

    // One that runs another program before it writes is that program.
    Child launcher;
    launcher.exec();
    const auto launched = identityOf(launcher.sender());
    ASSERT_TRUE(launched);
    EXPECT_EQ(launched->bundleIdentifier(), "com.orvex.sleeper");
    EXPECT_FALSE(launched->boolValueOfEntitlement("com.orvex.private.Quarn.allowed"));
    EXPECT_EQ(identityOf(self()), parent);
}

TEST_F(ClientIdentityCacheTest, ARegistryChangeIsSeenByTheNextMessage) {
    registerSelf(kAllowed);
    const auto before = identityOf(self());
    ASSERT_TRUE(before);
    EXPECT_TRUE(before->boolValueOfEntitlement("com.orvex.private.Quarn.allowed"));

    registerSelf(Value::dictionary());
    const auto after = identityOf(self());
    ASSERT_TRUE(after);
    EXPECT_FALSE(after->boolValueOfEntitlement("com.orvex.private.Quarn.allowed"));

    std::filesystem::remove(root_ / "/etc/quarnd/codesign.d/self.plist");
    EXPECT_FALSE(identityOf(self()));
}

TEST_F(ClientIdentityCacheTest, AGoneWriterOrOneWithOtherIdsIsIdentifiedAgainAndNoWriterIsThePeer) {
    registerSelf(kAllowed);
    Child forked;
    const IpcConnection::Sender gone = forked.sender();
    ASSERT_TRUE(identityOf(gone));
    forked.reap();
    EXPECT_FALSE(identityOf(gone)) << "an exited writer is not answered from the cache";

    const auto parent = identityOf(self());
    ASSERT_TRUE(parent);
    IpcConnection::Sender changed = self();
    changed.uid += 1000;
    const auto again = identityOf(changed);
    ASSERT_TRUE(again);
    EXPECT_NE(again, parent) << "other ids are another key";
    EXPECT_EQ(again->posixUID(), ::geteuid()) << "the ids are read again from the process";

    // Without a writer the connection's peer is the writer.
    connection_.sender.reset();
    EXPECT_EQ(cache_.identityFor(connection_), identityOf(self()));
    EXPECT_FALSE(identityOf({0, 0, 0})) << "a writer the kernel could not name has no identity";
}
