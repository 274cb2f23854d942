// The identities of a connection's writers: each writer is identified by
// its own process, once, until its process, its ids or the code-signing
// registry change. Who an identity says the writer is is tested in
// tests/operations.

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

// A connection of this process whose current message was written by `sender`.
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

// A fork of this process that execs `sleep` when told, and is killed when reaped.
class Child {
public:
    Child() {
        EXPECT_EQ(::pipe(pipe_), 0);
        if ((pid_ = ::fork()) == 0) {
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
    IpcConnection::Sender sender() const { return {pid_, ::getuid(), ::getgid()}; }
    void exec() {
        ASSERT_EQ(::write(pipe_[1], "x", 1), 1);
        const auto exe = "/proc/" + std::to_string(pid_) + "/exe";
        std::error_code error;
        for (int i = 0; i < 2000 && std::filesystem::read_symlink(exe, error) != kSleep; ++i) {
            std::this_thread::sleep_for(std::chrono::milliseconds(5));
        }
        ASSERT_EQ(std::filesystem::read_symlink(exe, error), kSleep);
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
    void registerSelf(bool allowed) {
        Value plist = Value::dictionary();
        plist.set("Program", std::filesystem::read_symlink("/proc/self/exe").string());
        plist.set("Identifier", "com.orvex.tests");
        plist.set("Entitlements", Value::Dictionary{{"com.orvex.private.Quarn.allowed", allowed}});
        std::filesystem::create_directories(root_ / "/etc/quarnd/codesign.d");
        ASSERT_TRUE(
            QRN_writeToURL(plist, root_ / "/etc/quarnd/codesign.d/self.plist", {.atomic = true}));
    }
    QRNClientIdentityPtr identityOf(std::optional<IpcConnection::Sender> sender) {
        connection_.sender = sender;
        return cache_.identityFor(connection_);
    }
    static IpcConnection::Sender self() { return {::getpid(), ::getuid(), ::getgid()}; }

    WrittenConnection connection_{*IpcPeer::fromPID(::getpid())};
    QRNClientIdentityCache cache_;
};

} // namespace

TEST_F(ClientIdentityCacheTest, AWriterKeepsItsIdentityUntilItsProcessIdsOrTheRegistryChange) {
    registerSelf(true);
    const auto parent = identityOf(self());
    ASSERT_TRUE(parent);
    EXPECT_EQ(identityOf(self()), parent) << "a writer is identified once";
    EXPECT_EQ(identityOf(std::nullopt), parent) << "without a writer the peer is the writer";

    // A child sharing the connection writes as itself, and an exec after its
    // first message (to a program the registry does not know) changes nothing.
    Child forked;
    const auto child = identityOf(forked.sender());
    ASSERT_TRUE(child);
    EXPECT_NE(child, parent);
    EXPECT_EQ(child->posixPID(), forked.sender().pid);
    forked.exec();
    EXPECT_EQ(identityOf(forked.sender()), child);
    const IpcConnection::Sender gone = forked.sender();
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

    registerSelf(false);
    const auto after = identityOf(self());
    ASSERT_TRUE(after);
    EXPECT_FALSE(after->boolValueOfEntitlement("com.orvex.private.Quarn.allowed"))
        << "a registry change is seen by the next message";
}
