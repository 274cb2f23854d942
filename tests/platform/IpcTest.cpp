// The request service's socket: frames, peers, the listener, and who wrote
// each message (the credentials the kernel stamps on every write).

#include "Daemon/platform/IpcListener.h"
#include "Daemon/platform/IpcPeer.h"
#include "Daemon/platform/Paths.h"
#include "Daemon/platform/ProcessInfo.h"
#include "Daemon/support/Descriptor.h"

#include "common/LogCapture.h"
#include "common/TempRoot.h"
#include "common/shared/ChildProcess.h"
#include "common/shared/FrameSocket.h"

#include <gtest/gtest.h>

#include <csignal>
#include <fcntl.h>
#include <fmt/format.h>
#include <linux/sockios.h>
#include <sys/ioctl.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <condition_variable>
#include <fstream>
#include <map>
#include <mutex>
#include <set>
#include <thread>

using namespace quarn;
using namespace quarn::test;

namespace {

using Bytes = std::vector<std::uint8_t>;

// Fails a hung test; no test measures time.
constexpr auto kGuard = std::chrono::seconds(20);

Value message(std::uint64_t seq) {
    return Value(Value::Dictionary{{"Seq", Value(seq)}});
}
// The number a reply carries back, all ones for none.
std::uint64_t seqOf(const std::optional<Value>& reply) {
    const Value* seq = reply ? reply->get("Seq") : nullptr;
    return seq && seq->asUInt64() ? *seq->asUInt64() : ~std::uint64_t{0};
}

// A blocking client whose reads give up after kGuard.
struct Client {
    explicit Client(const std::filesystem::path& path) : fd(FrameSocket::connectTo(path)) {
        EXPECT_TRUE(fd.valid()) << path;
        const timeval guard{kGuard.count(), 0};
        ::setsockopt(fd.get(), SOL_SOCKET, SO_RCVTIMEO, &guard, sizeof guard);
    }
    void write(const Bytes& bytes) { EXPECT_TRUE(FrameSocket::writeAll(fd.get(), bytes)); }
    void send(const Value& m) { write(IpcFrame::encodeMessage(m, true)); }
    std::uint64_t roundTrip(std::uint64_t seq) {
        send(message(seq));
        return seqOf(receive());
    }
    // The next reply, or none when the connection ended.
    std::optional<Value> receive() {
        Bytes body;
        const auto frame = FrameSocket::readFrame(fd.get(), body);
        EXPECT_TRUE(!frame || (!frame->header.expectsReply && frame->message));
        return frame && frame->message ? std::optional<Value>(*frame->message) : std::nullopt;
    }
    // End of file from the service, not the guard running out.
    bool closedByService() {
        std::uint8_t byte;
        return ::recv(fd.get(), &byte, 1, 0) == 0;
    }
    int unreadByService() const {
        int queued = -1;
        ::ioctl(fd.get(), SIOCOUTQ, &queued);
        return queued;
    }
    Descriptor fd;
};

// Runs `write` in a forked child sharing this process's descriptors;
// answers its pid once it has exited.
template <class Write> pid_t inChild(Write write) {
    const pid_t pid = ::fork();
    if (pid == 0) {
        write();
        ::_exit(0);
    }
    int status = 0;
    ::waitpid(pid, &status, 0);
    EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0);
    return pid;
}

} // namespace

TEST(IpcPeerTest, SocketPeerIsThisProcessWithItsToken) {
    int fds[2];
    ASSERT_EQ(::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, fds), 0);
    auto peer = IpcPeer::fromSocket(fds[0]);
    ::close(fds[0]);
    ::close(fds[1]);
    ASSERT_TRUE(peer) << peer.error().message;
    EXPECT_EQ(std::make_tuple(peer->pid(), peer->uid(), peer->gid()),
              std::make_tuple(::getpid(), ::geteuid(), ::getegid()));
    EXPECT_GE(peer->pidfd(), 0); // pidfd_open exists since Linux 5.3

    const auto startTime = IpcPeer::processStartTime(::getpid());
    ASSERT_TRUE(startTime);
    EXPECT_EQ(peer->startTime(), *startTime);
    const auto u32 = [](auto v) { return static_cast<std::uint32_t>(v); };
    const IpcPeer::TokenFields expected{IpcPeer::fieldsOfAuditToken(peer->auditToken()).loginUID,
                                        ::geteuid(),
                                        ::getegid(),
                                        ::getuid(),
                                        ::getgid(),
                                        u32(::getpid()),
                                        u32(::getsid(0)),
                                        u32(*startTime)};
    EXPECT_EQ(peer->auditToken(), IpcPeer::makeAuditToken(expected));
    EXPECT_EQ(IpcPeer::fromPID(::getpid())->auditToken(), peer->auditToken());
}

TEST(IpcPeerTest, AnotherProcessHasItsOwnTokenAndNoneOnceGone) {
    auto sleeper = ChildProcess::spawn({"/bin/sleep", {"60"}, {}, {}, {}});
    ASSERT_TRUE(sleeper);
    const pid_t child = sleeper->pid();
    auto peer = IpcPeer::fromPID(child);
    sleeper->signal(SIGKILL);
    ASSERT_TRUE(sleeper->waitFor(kGuard));
    ASSERT_TRUE(peer);
    EXPECT_EQ(IpcPeer::fieldsOfAuditToken(peer->auditToken()).pid,
              static_cast<std::uint32_t>(child));
    EXPECT_FALSE(IpcPeer::processStartTime(child));
    EXPECT_FALSE(IpcPeer::fromPID(child));
    EXPECT_FALSE(IpcPeer::fromPID(0));
}

TEST(IpcPeerTest, WireFormsOfTokensAndFramesAreLittleEndian) {
    const IpcPeer::TokenFields fields{0x04030201, 11, 12, 13, 14, 0x00010000, 16, 0xA1B2C3D4};
    const auto token = IpcPeer::makeAuditToken(fields);
    const std::array<std::uint8_t, 8> ends{token[0],  token[3],  token[4],  token[16],
                                           token[22], token[24], token[28], token[31]};
    EXPECT_EQ(ends, (std::array<std::uint8_t, 8>{0x01, 0x04, 11, 14, 0x01, 16, 0xD4, 0xA1}));
    EXPECT_EQ(IpcPeer::makeAuditToken(IpcPeer::fieldsOfAuditToken(token)), token);

    const auto header = IpcFrame::encodeHeader(0x01020304, true);
    EXPECT_EQ(header, (std::array<std::uint8_t, 5>{0x04, 0x03, 0x02, 0x01, 0x01}));
    const auto decoded = IpcFrame::decodeHeader(header);
    ASSERT_TRUE(decoded);
    EXPECT_EQ(decoded->length, 0x01020304u);
    EXPECT_TRUE(decoded->expectsReply);
    EXPECT_FALSE(IpcFrame::decodeHeader(std::array<std::uint8_t, 5>{1, 0, 0, 0, 0x80}));
}

TEST(IpcPeerTest, ProcFilesAreParsedStrictly) {
    // The command name holds blanks and parentheses; start time 98765.
    EXPECT_EQ(ProcessInfo::parseStartTime("4242 (evil) name (x) ) S 1 4242 4242 0 -1 4194560 100 "
                                          "0 0 0 3 1 0 0 20 0 1 0 98765 4096 200 1 1 1 0 0 0\n"),
              98765u);
    for (const char* bad : {"4242 (name S 1 2 3", "4242 (x) S 1 2 3 4 5 6 7 8 9 10",
                            "1 (x) S 1 1 1 0 -1 0 0 0 0 0 0 0 0 0 20 0 1 0 -5 0 0"}) {
        EXPECT_FALSE(ProcessInfo::parseStartTime(bad)) << bad;
    }
    const auto ids = ProcessInfo::parseIds("Name:\tclient\nUid:\t501\t502\t503\t504\n"
                                           "Gid:\t20\t21\t22\t23\nGroups:\t20 12\n");
    ASSERT_TRUE(ids);
    EXPECT_EQ(std::tie(ids->realUID, ids->effectiveUID, ids->realGID, ids->effectiveGID),
              std::make_tuple(501u, 502u, 20u, 21u));
    for (const char* bad : {"Uid:\t1\t1\t1\t1\n", "Uid:\t1\t1\t1\nGid:\t1\t1\t1\t1\n",
                            "Uid:\t1\tx\t1\t1\nGid:\t1\t1\t1\t1\n",
                            "Uid:\t4294967296\t1\t1\t1\nGid:\t1\t1\t1\t1\n"}) {
        EXPECT_FALSE(ProcessInfo::parseIds(bad)) << bad;
    }
    EXPECT_EQ(ProcessInfo::parseLoginUID("4294967295"), ProcessInfo::kNoLoginUID);
    EXPECT_EQ(ProcessInfo::parseLoginUID("501\n"), 501u);
    EXPECT_FALSE(ProcessInfo::parseLoginUID("-1"));
    EXPECT_FALSE(ProcessInfo::parseLoginUID(""));
}

namespace {

// A request service on a socket in a temporary root, recording the
// connections it accepted, and the messages, writers and ends of each.
class IpcListenerTest : public TempRootTest {
protected:
    using Event = IpcConnection::Event;
    using Handler = std::function<void(const std::shared_ptr<IpcConnection>&, const Event&)>;

    static void echo(const std::shared_ptr<IpcConnection>& connection, const Event& event) {
        if (event.expectsReply) {
            connection->sendReply(event.body);
        }
    }
    std::filesystem::path socketPath() const {
        return Paths(root_.path()).runDirectory() / "com.orvex.quarnd.sock";
    }
    IpcListener::Options options() const {
        IpcListener::Options o;
        o.socketPath = socketPath();
        o.workerThreads = 4;
        return o;
    }

    // Connections are resumed unless their accept index is in `held`. A
    // test whose handler uses its locals stops the listener before it
    // returns: a handler may still run after the last reply.
    Status start(Handler onMessage, IpcListener::Options o, std::set<std::size_t> held = {}) {
        onMessage_ = std::move(onMessage);
        listener_ = std::make_unique<IpcListener>(std::move(o));
        return listener_->start([this, held](std::shared_ptr<IpcConnection> connection) {
            std::unique_lock lock(mutex_);
            const std::size_t index = accepted_.size();
            accepted_.push_back(connection);
            lock.unlock();
            changed_.notify_all();
            if (!held.contains(index)) {
                resume(connection);
            }
        });
    }
    Status start(Handler onMessage) { return start(std::move(onMessage), options()); }

    void resume(const std::shared_ptr<IpcConnection>& connection) {
        connection->setEventHandler([this](const auto& c, const Event& event) {
            if (event.kind == Event::Kind::Invalidated) {
                if (onEnd_) {
                    onEnd_();
                }
                std::lock_guard lock(mutex_);
                ++invalidations_[c.get()];
            } else {
                {
                    std::lock_guard lock(mutex_);
                    ++messages_[c.get()];
                    writers_.push_back(c->messageSender());
                }
                onMessage_(c, event);
            }
            changed_.notify_all();
        });
        connection->resume();
    }

    template <class Predicate> bool waitUntil(Predicate done) {
        std::unique_lock lock(mutex_);
        return changed_.wait_for(lock, kGuard, done);
    }
    std::shared_ptr<IpcConnection> accepted(std::size_t index) {
        EXPECT_TRUE(waitUntil([&] { return accepted_.size() > index; }));
        std::lock_guard lock(mutex_);
        return index < accepted_.size() ? accepted_[index] : nullptr;
    }
    int invalidations(std::size_t index) { return count(invalidations_, index); }
    int messages(std::size_t index) { return count(messages_, index); }
    int count(std::map<const IpcConnection*, int>& counts, std::size_t index) {
        auto connection = accepted(index);
        std::lock_guard lock(mutex_);
        return counts[connection.get()];
    }
    void TearDown() override {
        if (listener_) {
            listener_->stop();
        }
    }

    Handler onMessage_;
    std::function<void()> onEnd_; // also hears every Invalidated
    std::mutex mutex_;            // guards the four fields below
    std::condition_variable changed_;
    std::vector<std::shared_ptr<IpcConnection>> accepted_;
    std::map<const IpcConnection*, int> invalidations_;
    std::map<const IpcConnection*, int> messages_;
    std::vector<std::optional<IpcConnection::Sender>> writers_; // of every message
    std::unique_ptr<IpcListener> listener_; // last: stopped before the rest goes
};

mode_t modeOf(const std::filesystem::path& path) {
    struct stat st {};
    ::lstat(path.c_str(), &st);
    return st.st_mode & 07777;
}

} // namespace

TEST_F(IpcListenerTest, SocketFileIsMadeOpenToAllReplacedWhenStaleAndKeptWhenLive) {
    const mode_t umask = ::umask(077); // modes hold whatever the daemon's umask
    const bool started = bool(start(echo));
    ::umask(umask);
    ASSERT_TRUE(started);
    EXPECT_EQ(modeOf(socketPath()), 0666u);
    EXPECT_EQ(modeOf(socketPath().parent_path()), 0755u);
    listener_->stop(); // leaves the socket file behind, as a crash would

    ASSERT_TRUE(start(echo)); // over the stale file
    Client client(socketPath());
    EXPECT_EQ(client.roundTrip(7), 7u);
    EXPECT_EQ(accepted(0)->peer().pid(), ::getpid());

    IpcListener second(options());
    EXPECT_FALSE(second.start([](auto) {}));
    EXPECT_EQ(client.roundTrip(8), 8u);

    auto o = options();
    o.socketPath = root_ / "/not-a-socket";
    root_.writeFile("/not-a-socket", "keep");
    EXPECT_FALSE(IpcListener(o).start([](auto) {}));
    std::ifstream kept(o.socketPath);
    EXPECT_EQ(std::string(std::istreambuf_iterator<char>(kept), {}), "keep");
}

TEST_F(IpcListenerTest, RequestsOfOneConnectionRunOneAtATimeInOrder) {
    constexpr std::uint64_t kCount = 64;
    std::atomic<int> active{0};
    std::atomic<bool> overlapped{false};
    ASSERT_TRUE(start([&](const auto& connection, const Event& event) {
        overlapped = overlapped || active.fetch_add(1) != 0;
        for (int i = 0; i < 200; ++i) {
            std::this_thread::yield();
        }
        active.fetch_sub(1);
        connection->sendReply(event.body);
    }));
    Client client(socketPath());
    Bytes pipelined; // every request in one write
    for (std::uint64_t i = 0; i < kCount; ++i) {
        IpcFrame::appendMessage(message(i), true, pipelined);
    }
    client.write(pipelined);
    for (std::uint64_t i = 0; i < kCount; ++i) {
        ASSERT_EQ(seqOf(client.receive()), i);
    }
    EXPECT_FALSE(overlapped);
    listener_->stop(); // before the handler's locals go
}

TEST_F(IpcListenerTest, DifferentConnectionsRunConcurrently) {
    // Each handler waits until the other connection's handler has started:
    // both see the other only if the two run at the same time.
    std::mutex mutex;
    std::condition_variable started;
    std::set<std::uint64_t> running;
    ASSERT_TRUE(start([&](const auto& connection, const Event& event) {
        std::unique_lock lock(mutex);
        running.insert(seqOf(event.body));
        started.notify_all();
        const bool sawOther = started.wait_for(lock, kGuard, [&] { return running.size() == 2; });
        connection->sendReply(message(sawOther ? 1 : 0));
    }));
    Client a(socketPath());
    Client b(socketPath());
    a.send(message(10));
    b.send(message(20));
    EXPECT_EQ(seqOf(a.receive()), 1u);
    EXPECT_EQ(seqOf(b.receive()), 1u);
    listener_->stop(); // the handlers may still be unlocking `mutex`
}

TEST_F(IpcListenerTest, MalformedFrameClosesOnlyItsConnectionWithOneLogLine) {
    const Value deep(Value::Dictionary{
        {"a", Value(Value::Array{Value(Value::Array{Value(Value::Array{Value::array()})})})}});
    const struct {
        const char* name;
        Bytes bytes;
        const char* reason;
    } cases[] = {
        {"oversize", FrameSocket::rawFrame(1025, 1, {}),
         "a frame of 1025 bytes is over the limit of 1024"},
        {"flag", FrameSocket::frame(message(1), 0x03), "the flag byte 0x03 has reserved bits set"},
        {"array", FrameSocket::frame(Value::Array{Value(1u)}, 1), "not a dictionary"},
        {"garbage", FrameSocket::rawFrame(4, 1, Bytes{0xff, 0xff, 0xff, 0xff}), "does not decode"},
        {"empty", FrameSocket::rawFrame(0, 0, {}), "does not decode"},
        {"deep", FrameSocket::frame(deep, 1), "nest deeper than 4"},
    };
    auto o = options();
    o.maxFrameBytes = 1024;
    o.maxNesting = 4;
    ASSERT_TRUE(start(echo, o));
    LogCapture log;
    Client bystander(socketPath());
    for (const auto& c : cases) {
        SCOPED_TRACE(c.name);
        Client bad(socketPath());
        bad.write(c.bytes);
        EXPECT_TRUE(bad.closedByService());
        EXPECT_EQ(log.count(fmt::format("Closing the connection of pid {}: ", ::getpid())), 1u)
            << log.all();
        EXPECT_TRUE(log.contains(c.reason)) << log.all();
        log.clear();
        EXPECT_EQ(bystander.roundTrip(1), 1u);
    }
    listener_->stop();
    for (std::size_t i = 1; i <= std::size(cases); ++i) {
        EXPECT_EQ(messages(i), 0) << cases[i - 1].name;
        EXPECT_EQ(invalidations(i), 1) << cases[i - 1].name;
    }
}

TEST_F(IpcListenerTest, HeldConnectionReadsNothingAndRepliesMayComeLaterFromAnotherThread) {
    // No handler replies: the test thread answers, after the handlers returned.
    ASSERT_TRUE(start([](const auto&, const Event&) {}, options(), {0}));
    Client waiting(socketPath());
    waiting.send(message(1));
    auto held = accepted(0);

    // The pool is running: another connection is served meanwhile.
    Client other(socketPath());
    other.send(message(2));
    other.send(message(3));
    ASSERT_TRUE(waitUntil([&] { return writers_.size() == 2; }));
    accepted(1)->sendReply(message(2));
    accepted(1)->sendReply(message(3));
    EXPECT_EQ(seqOf(other.receive()), 2u);
    EXPECT_EQ(seqOf(other.receive()), 3u);
    EXPECT_GT(waiting.unreadByService(), 0);
    EXPECT_EQ(messages(0), 0);

    resume(held); // from this thread, not the pool
    ASSERT_TRUE(waitUntil([&] { return writers_.size() == 3; }));
    EXPECT_EQ(waiting.unreadByService(), 0);
}

TEST_F(IpcListenerTest, ConnectionsPastTheLimitAreClosedUntilOthersEnd) {
    LogCapture log;
    IpcListener::Options limited = options();
    limited.maxConnections = 2;
    ASSERT_TRUE(start(echo, limited));
    {
        Client first(socketPath());
        Client second(socketPath());
        first.send(message(1));
        second.send(message(2));
        EXPECT_EQ(seqOf(first.receive()), 1u);
        EXPECT_EQ(seqOf(second.receive()), 2u);
        Client third(socketPath());
        EXPECT_TRUE(third.closedByService());
        EXPECT_TRUE(log.contains("Refusing a connection: 2 connections are open")) << log.all();
    }
    ASSERT_TRUE(waitUntil([&] { return invalidations_.size() == 2; }));
    Client fourth(socketPath());
    EXPECT_EQ(fourth.roundTrip(4), 4u);
}

TEST_F(IpcListenerTest, EveryEndIsHeardOnceAndAfterTheHandlerReturned) {
    std::atomic<bool> cancelling{false};
    std::atomic<bool> heardEndWhileCancelling{false};
    onEnd_ = [&] { heardEndWhileCancelling = heardEndWhileCancelling || cancelling; };
    ASSERT_TRUE(start(
        [&](const auto& connection, const Event& event) {
            if (event.body.get("Cancel") == nullptr) {
                return echo(connection, event);
            }
            cancelling = true;
            connection->cancel();
            for (int i = 0; i < 1000; ++i) {
                std::this_thread::yield();
            }
            cancelling = false;
        },
        options(), {3}));

    Client cancelled(socketPath());
    cancelled.send(Value(Value::Dictionary{{"Cancel", Value(true)}}));
    EXPECT_TRUE(cancelled.closedByService());
    {
        Client gone(socketPath());
        EXPECT_EQ(gone.roundTrip(5), 5u);
    }
    Client idle(socketPath());
    Client neverResumed(socketPath());
    ASSERT_TRUE(waitUntil([&] {
        return accepted_.size() == 4 && invalidations_[accepted_[0].get()] == 1 &&
               invalidations_[accepted_[1].get()] == 1;
    }));

    listener_->stop();
    EXPECT_TRUE(idle.closedByService());
    EXPECT_FALSE(heardEndWhileCancelling);
    // After the stop, everything is refused quietly.
    accepted(0)->sendReply(Value::dictionary());
    accepted(2)->cancel();
    resume(accepted(3));
    const int expected[] = {1, 1, 1, 0};
    for (std::size_t i = 0; i < std::size(expected); ++i) {
        EXPECT_EQ(invalidations(i), expected[i]) << "connection " << i;
    }
}

TEST_F(IpcListenerTest, AdoptsAnInheritedListeningSocketAndFindsSystemdsByName) {
    std::filesystem::create_directories(socketPath().parent_path());
    const int fd = FrameSocket::listenAt(socketPath(), 8);
    int pipeFds[2];
    ASSERT_GE(fd, 0);
    ASSERT_EQ(::pipe2(pipeFds, O_CLOEXEC), 0);
    // The pipe and the socket where systemd puts them (3 and 4); what was
    // there is put back afterwards.
    int saved[2];
    for (int i = 0; i < 2; ++i) {
        const int source = ::fcntl(i ? fd : pipeFds[0], F_DUPFD_CLOEXEC, 200);
        saved[i] = ::fcntl(3 + i, F_DUPFD_CLOEXEC, 200);
        ::dup2(source, 3 + i);
        ::close(source);
    }
    ::setenv("LISTEN_PID", std::to_string(::getpid()).c_str(), 1);
    ::setenv("LISTEN_FDS", "2", 1);
    ::setenv("LISTEN_FDNAMES", "com.orvex.quarnd.upcall:com.orvex.quarnd", 1);
    EXPECT_EQ(IpcListener::socketFromSystemd("com.orvex.quarnd"), 4);
    EXPECT_EQ(IpcListener::socketFromSystemd("com.orvex.quarnd.upcall"), -1); // a pipe
    EXPECT_EQ(IpcListener::socketFromSystemd("other"), -1);
    for (const char* name : {"LISTEN_PID", "LISTEN_FDS", "LISTEN_FDNAMES"}) {
        ::unsetenv(name);
    }
    for (int i = 0; i < 2; ++i) {
        saved[i] >= 0 ? ::dup2(saved[i], 3 + i) : ::close(3 + i);
        ::close(saved[i]);
    }
    EXPECT_EQ(IpcListener::socketFromSystemd("com.orvex.quarnd"), -1);

    auto o = options();
    o.inheritedFd = pipeFds[1];
    EXPECT_FALSE(IpcListener(o).start([](auto) {}));
    ::close(pipeFds[0]);
    ::close(pipeFds[1]);

    o.inheritedFd = fd;
    o.socketPath.clear();
    ASSERT_TRUE(start(echo, o));
    Client client(socketPath());
    EXPECT_EQ(client.roundTrip(5), 5u);
}

TEST_F(IpcListenerTest, EachMessageNamesItsWriterAndAFrameOfTwoWritersClosesTheConnection) {
    ASSERT_TRUE(start(echo));
    LogCapture log;
    Client client(socketPath());
    EXPECT_EQ(client.roundTrip(1), 1u);
    const pid_t child = inChild([&] { client.send(message(2)); });
    EXPECT_EQ(seqOf(client.receive()), 2u);
    EXPECT_EQ(client.roundTrip(3), 3u);
    const IpcConnection::Sender self{::getpid(), ::getuid(), ::getgid()};
    {
        std::lock_guard lock(mutex_);
        // The child that shares the connection, not the process that connected.
        EXPECT_EQ(writers_, (std::vector<std::optional<IpcConnection::Sender>>{
                                self, IpcConnection::Sender{child, ::getuid(), ::getgid()}, self}));
    }

    const Bytes frame = IpcFrame::encodeMessage(message(4), true);
    const auto half = frame.begin() + static_cast<std::ptrdiff_t>(frame.size() / 2);
    client.write({frame.begin(), half});
    const pid_t second = inChild([&] { client.write({half, frame.end()}); });
    EXPECT_TRUE(client.closedByService());
    EXPECT_TRUE(log.contains(fmt::format("Closing the connection of pid {}: a frame holds bytes "
                                         "written by pid {} and by pid {}",
                                         ::getpid(), ::getpid(), second)))
        << log.all();
    listener_->stop();
    EXPECT_EQ(messages(0), 3);
    EXPECT_EQ(invalidations(0), 1);
}

TEST_F(IpcListenerTest, RepliesLargerThanTheSocketTakesArriveWholeAndInOrder) {
    // Three replies per request, each well over a socket buffer, so most
    // of them wait in the queue while the client is not reading.
    const std::string bulk(300 * 1024, 'q');
    ASSERT_TRUE(start([&](const std::shared_ptr<IpcConnection>& connection, const Event& event) {
        for (std::uint64_t i = 0; i < 3; ++i) {
            connection->sendReply(
                Value::Dictionary{{"Seq", Value(seqOf(event.body) * 10 + i)}, {"Bulk", bulk}});
        }
    }));
    Client client(socketPath());
    client.send(message(1));
    client.send(message(2));
    for (std::uint64_t expected : {10u, 11u, 12u, 20u, 21u, 22u}) {
        const auto reply = client.receive();
        ASSERT_EQ(seqOf(reply), expected);
        EXPECT_EQ(*reply->get("Bulk"), Value(bulk));
    }
    listener_->stop();
}
