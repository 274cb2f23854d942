// The request service's socket: frames and their CBOR, peers, the listener,
// and who wrote each message (the credentials the kernel stamps on every write).

#include "Daemon/platform/CborCodec.h"
#include "Daemon/platform/IpcConnectionSlots.h"
#include "Daemon/platform/IpcExecFingerprint.h"
#include "Daemon/platform/IpcListener.h"
#include "Daemon/platform/IpcPeer.h"
#include "Daemon/platform/Paths.h"
#include "Daemon/platform/ProcessInfo.h"
#include "Daemon/support/Descriptor.h"
#include "Daemon/support/UUID.h"

#include "common/TempRoot.h"
#include "common/shared/ChildProcess.h"
#include "common/shared/FrameSocket.h"

#include <gtest/gtest.h>

#include <fcntl.h>
#include <linux/sockios.h>
#include <sys/ioctl.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <condition_variable>
#include <csignal>
#include <fstream>
#include <future>
#include <limits>
#include <mutex>
#include <set>
#include <string>
#include <thread>
#include <vector>

using namespace quarn;
using namespace quarn::test;

namespace {

using Bytes = std::vector<std::uint8_t>;

// Fails a hung test; no test measures time.
constexpr auto kGuard = std::chrono::seconds(20);

// `key`, when given, asks the test's service for something else than an echo.
Value message(std::uint64_t seq, const char* key = "Seq") {
    return Value(Value::Dictionary{{"Seq", Value(seq)}, {key, Value(seq)}});
}
// The number a reply carries back, all ones for none.
std::uint64_t seqOf(const std::optional<Value>& reply) {
    const Value* seq = reply ? reply->get("Seq") : nullptr;
    return seq && seq->asUInt64() ? *seq->asUInt64() : ~std::uint64_t{0};
}

// A blocking client whose reads give up after kGuard; it reads the
// greeting unless told the service will not send one.
struct Client {
    explicit Client(const std::filesystem::path& path, bool greeted = true)
        : fd(FrameSocket::connectTo(path)) {
        EXPECT_TRUE(fd.valid()) << path;
        const timeval guard{kGuard.count(), 0};
        ::setsockopt(fd.get(), SOL_SOCKET, SO_RCVTIMEO, &guard, sizeof guard);
        if (greeted) {
            EXPECT_TRUE(FrameSocket::readGreeting(fd.get()));
        }
    }
    void write(const Bytes& bytes) { EXPECT_TRUE(FrameSocket::writeAll(fd.get(), bytes)); }
    void send(const Value& m, bool expectsReply = true) {
        write(IpcFrame::encodeMessage(m, expectsReply));
    }
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
    bool hasInput() {
        std::uint8_t byte;
        return ::recv(fd.get(), &byte, 1, MSG_PEEK | MSG_DONTWAIT) > 0;
    }
    // End of file from the service (a reset when it left bytes unread),
    // not the guard running out.
    bool closedByService() {
        std::uint8_t byte;
        const ssize_t n = ::recv(fd.get(), &byte, 1, 0);
        return n == 0 || (n < 0 && errno == ECONNRESET);
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

Bytes concat(Bytes a, const Bytes& b) {
    a.insert(a.end(), b.begin(), b.end());
    return a;
}

// `depth` arrays inside each other around a 0.
Bytes nestedArrays(std::size_t depth) {
    return concat(Bytes(depth, 0x81), Bytes{0x00});
}

Value everyKind() {
    return Value(Value::Dictionary{
        {"uints", Value::Array{0u, 23u, 24u, 255u, 256u, 65536u, std::uint64_t{1} << 32,
                               std::numeric_limits<std::uint64_t>::max()}},
        {"ints", Value::Array{-1, -24, -25, -257, std::numeric_limits<std::int64_t>::min()}},
        {"reals", Value::Array{1.5, -0.25, 1e300}},
        {"bools", Value::Array{true, false}},
        {"texts", Value::Array{Value(""), Value("Identifier"), Value("h\xC3\xA9llo \xE2\x9C\x93")}},
        {"data", Value::Array{Value(Value::Data{}), Value(Value::Data{0, 0xff, 0x10})}},
        {"dates", Value::Array{Value(Date{1700000000123456}), Value(Date{-86400000001})}},
        {"uuid", Value(UUID::random())},
        {"none", Value()},
        {"nested", Value::Array{Value::array(), Value::dictionary(),
                                Value::Array{Value(Value::Dictionary{{"k", Value::Array{1u}}})}}}});
}

} // namespace

TEST(IpcPeerTest, PeersHaveTheTokenOfTheirProcessProcIsParsedStrictlyAndWireFormsAreLittleEndian) {
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
    const auto f = IpcPeer::fieldsOfAuditToken(peer->auditToken());
    EXPECT_EQ(std::tie(f.euid, f.egid, f.ruid, f.rgid, f.pid, f.sessionID, f.startTime),
              std::make_tuple(::geteuid(), ::getegid(), ::getuid(), ::getgid(),
                              std::uint32_t(::getpid()), std::uint32_t(::getsid(0)),
                              std::uint32_t(*startTime)));
    EXPECT_EQ(IpcPeer::fromPID(::getpid())->auditToken(), peer->auditToken());

    // Another process has its own token, and none once gone.
    auto sleeper = ChildProcess::spawn({"/bin/sleep", {"60"}, {}, {}, {}});
    ASSERT_TRUE(sleeper);
    const pid_t child = sleeper->pid();
    auto other = IpcPeer::fromPID(child);
    sleeper->signal(SIGKILL);
    ASSERT_TRUE(sleeper->waitFor(kGuard));
    ASSERT_TRUE(other);
    EXPECT_EQ(IpcPeer::fieldsOfAuditToken(other->auditToken()).pid,
              static_cast<std::uint32_t>(child));
    EXPECT_FALSE(IpcPeer::processStartTime(child));
    EXPECT_FALSE(IpcPeer::fromPID(child));
    EXPECT_FALSE(IpcPeer::fromPID(0));

    // What the peer reads from /proc, parsed strictly.
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
    EXPECT_FALSE(ProcessInfo::parseLoginUID("-1") || ProcessInfo::parseLoginUID(""));

    // Wire forms of tokens and frames are little-endian.
    const IpcPeer::TokenFields fields{0x04030201, 11, 12, 13, 14, 0x00010000, 16, 0xA1B2C3D4};
    const auto token = IpcPeer::makeAuditToken(fields);
    const std::array<std::uint8_t, 8> ends{token[0],  token[3],  token[4],  token[16],
                                           token[22], token[24], token[28], token[31]};
    EXPECT_EQ(ends, (std::array<std::uint8_t, 8>{0x01, 0x04, 11, 14, 0x01, 16, 0xD4, 0xA1}));
    EXPECT_EQ(IpcPeer::makeAuditToken(IpcPeer::fieldsOfAuditToken(token)), token);

    const auto header = IpcFrame::encodeHeader(0x01020304, true);
    EXPECT_EQ(header, (std::array<std::uint8_t, 5>{0x04, 0x03, 0x02, 0x01, 0x01}));
    const auto decoded = IpcFrame::decodeHeader(header);
    EXPECT_TRUE(decoded && decoded->length == 0x01020304u && decoded->expectsReply);
    EXPECT_FALSE(IpcFrame::decodeHeader(std::array<std::uint8_t, 5>{1, 0, 0, 0, 0x80}));
}

namespace {

// A request service on a socket in a temporary root, recording for each
// accepted connection the writer of each message and the ends heard.
class IpcListenerTest : public TempRootTest {
protected:
    using Event = IpcConnection::Event;
    using Writers = std::vector<std::optional<IpcConnection::Sender>>;
    struct Record {
        std::shared_ptr<IpcConnection> connection;
        Writers writers{};
        int ends = 0;
    };

    std::filesystem::path socketPath() const {
        return Paths(root_.path()).runDirectory() / "com.orvex.quarnd.sock";
    }
    // Connections are resumed unless their accept index is in `held`.
    Status start(IpcListener::Options o, std::set<std::size_t> held = {}) {
        listener_ = std::make_unique<IpcListener>(std::move(o));
        return listener_->start([this, held](std::shared_ptr<IpcConnection> connection) {
            std::unique_lock lock(mutex_);
            records_.push_back({.connection = connection});
            const std::size_t index = records_.size() - 1;
            lock.unlock();
            changed_.notify_all();
            if (!held.contains(index)) {
                resume(index);
            }
        });
    }
    void resume(std::size_t index) {
        const auto connection = record(index).connection;
        connection->setEventHandler([this, index](const auto& c, const Event& event) {
            const bool end = event.kind == Event::Kind::Invalidated;
            heardEndWhileCancelling_ = heardEndWhileCancelling_ || (end && cancelling_);
            {
                std::lock_guard lock(mutex_);
                if (end) {
                    ++records_[index].ends;
                } else {
                    records_[index].writers.push_back(c->messageSender());
                }
            }
            if (!end) {
                serve(c, event);
            }
            changed_.notify_all();
        });
        connection->resume();
    }
    // Echoes what expects a reply; a few keys ask for something else.
    void serve(const std::shared_ptr<IpcConnection>& c, const Event& event) {
        const auto has = [&](const char* key) { return event.body.get(key) != nullptr; };
        if (has("Cancel")) {
            cancelling_ = true;
            c->cancel();
            std::this_thread::sleep_for(std::chrono::milliseconds(5)); // room for a wrong end
            cancelling_ = false;
        } else if (has("Meet")) {
            // Both see the other only if the two handlers run at the same time.
            std::unique_lock lock(meetMutex_);
            meeting_.insert(seqOf(event.body));
            met_.notify_all();
            const bool sawOther = met_.wait_for(lock, kGuard, [&] { return meeting_.size() == 2; });
            c->sendReply(message(sawOther ? 1 : 0));
        } else if (has("Hold")) {
            // Left unanswered: a request in flight.
        } else if (has("Block")) {
            // Keeps its thread busy until the test lets it go.
            changed_.notify_all();
            EXPECT_EQ(unblocked_.wait_for(kGuard), std::future_status::ready);
            c->sendReply(event.body);
        } else if (has("Big")) {
            c->sendReply(Value::Dictionary{{"Big", Value::Data(2 * bulk_.size())}});
        } else if (has("Bulk")) {
            // Each reply well over a socket buffer: most wait in the queue.
            for (std::uint64_t i = 0; i < 3; ++i) {
                c->sendReply(
                    Value::Dictionary{{"Seq", Value(seqOf(event.body) * 10 + i)}, {"Bulk", bulk_}});
            }
        } else {
            if (has("Slow")) {
                overlapped_ = overlapped_ || active_.fetch_add(1) != 0;
                std::this_thread::sleep_for(std::chrono::milliseconds(1));
                active_.fetch_sub(1);
            }
            if (event.expectsReply) {
                c->sendReply(event.body);
            }
        }
    }

    template <class Predicate> bool waitUntil(Predicate done) {
        std::unique_lock lock(mutex_);
        return changed_.wait_for(lock, kGuard, done);
    }
    bool waitForEnds(std::initializer_list<std::size_t> indices) {
        return waitUntil([&] {
            return std::ranges::all_of(indices, [&](std::size_t i) {
                return records_.size() > i && records_[i].ends == 1;
            });
        });
    }
    // What is known of the connection accepted `index`th, once it is.
    Record record(std::size_t index) {
        EXPECT_TRUE(waitUntil([&] { return records_.size() > index; }));
        std::lock_guard lock(mutex_);
        return index < records_.size() ? records_[index] : Record{};
    }

    std::atomic<bool> cancelling_{false}, heardEndWhileCancelling_{false}, overlapped_{false};
    std::atomic<int> active_{0};
    std::mutex meetMutex_; // guards meeting_
    std::condition_variable met_;
    std::set<std::uint64_t> meeting_;
    std::promise<void> unblock_;
    std::shared_future<void> unblocked_ = unblock_.get_future().share();
    const std::string bulk_ = std::string(300 * 1024, 'q');
    std::mutex mutex_; // guards records_
    std::condition_variable changed_;
    std::vector<Record> records_;
    std::unique_ptr<IpcListener> listener_; // last: stopped before the rest goes
};

} // namespace

// One listener serves connections 0..5 in turn, each a step of its own.
TEST_F(IpcListenerTest, ServesInOrderConcurrentlyHeldOnesLaterAndHearsEachEndOnce) {
    const mode_t umask = ::umask(077); // modes hold whatever the daemon's umask
    const bool started = bool(start({.socketPath = socketPath()}));
    ::umask(umask);
    ASSERT_TRUE(started);
    EXPECT_EQ(std::filesystem::status(socketPath()).permissions(), std::filesystem::perms(0666));
    EXPECT_EQ(std::filesystem::status(socketPath().parent_path()).permissions(),
              std::filesystem::perms(0755));
    listener_->stop(); // leaves the socket file behind, as a crash would
    ASSERT_TRUE(start({.socketPath = socketPath()}, {1, 5})); // over the stale file

    // 0: pipelined requests run one at a time, in order.
    Client client(socketPath());
    Bytes pipelined;
    for (std::uint64_t i = 0; i < 64; ++i) {
        IpcFrame::appendMessage(message(i, "Slow"), true, pipelined);
    }
    client.write(pipelined);
    for (std::uint64_t i = 0; i < 64; ++i) {
        ASSERT_EQ(seqOf(client.receive()), i);
    }
    EXPECT_FALSE(overlapped_);

    // 1 is held and not even greeted while 2 is served; replies may come
    // from this thread after the handlers returned.
    Client waiting(socketPath(), false);
    Client other(socketPath());
    other.send(message(2), false);
    other.send(message(3), false);
    ASSERT_TRUE(waitUntil([&] { return records_.size() > 2 && records_[2].writers.size() == 2; }));
    record(2).connection->sendReply(message(2));
    record(2).connection->sendReply(message(3));
    EXPECT_EQ(seqOf(other.receive()), 2u);
    EXPECT_EQ(seqOf(other.receive()), 3u);
    EXPECT_FALSE(waiting.hasInput());
    resume(1); // from this thread, not the pool
    EXPECT_TRUE(FrameSocket::readGreeting(waiting.fd.get()));
    EXPECT_EQ(waiting.roundTrip(1), 1u);

    // 2 and 3 run concurrently; 3 then goes away.
    {
        Client partner(socketPath());
        other.send(message(10, "Meet"));
        partner.send(message(20, "Meet"));
        EXPECT_EQ(seqOf(other.receive()), 1u);
        EXPECT_EQ(seqOf(partner.receive()), 1u);
    }
    // Replies larger than the socket takes arrive whole and in order.
    other.send(message(1, "Bulk"));
    other.send(message(2, "Bulk"));
    for (std::uint64_t expected : {10u, 11u, 12u, 20u, 21u, 22u}) {
        const auto reply = other.receive();
        ASSERT_EQ(seqOf(reply), expected);
        EXPECT_EQ(*reply->get("Bulk"), Value(bulk_));
    }

    // 4 is cancelled by its handler; 5 is never resumed.
    Client cancelled(socketPath());
    cancelled.send(message(0, "Cancel"));
    EXPECT_TRUE(cancelled.closedByService());
    Client neverResumed(socketPath(), false);

    // Only the process that connected may write: a child sharing the
    // connection closes it, also when it completes a frame begun.
    EXPECT_EQ(client.roundTrip(65), 65u);
    const Bytes frame = IpcFrame::encodeMessage(message(66), true);
    const auto half = frame.begin() + static_cast<std::ptrdiff_t>(frame.size() / 2);
    client.write({frame.begin(), half});
    inChild([&] { client.write({half, frame.end()}); });
    EXPECT_TRUE(client.closedByService()); // instead of answering 66

    ASSERT_TRUE(waitForEnds({0, 3, 4}));
    ASSERT_TRUE(record(5).connection);
    listener_->stop();
    EXPECT_TRUE(other.closedByService());
    EXPECT_FALSE(heardEndWhileCancelling_);
    const IpcConnection::Sender self{::getpid(), ::getuid(), ::getgid()};
    EXPECT_EQ(record(0).writers, Writers(65, self));
    // After the stop, everything is refused quietly.
    record(0).connection->sendReply(Value::dictionary());
    record(2).connection->cancel();
    resume(5);
    EXPECT_EQ((std::vector{record(0).ends, record(1).ends, record(2).ends, record(3).ends,
                           record(4).ends, record(5).ends}),
              (std::vector{1, 1, 1, 1, 1, 0}));
}

// A request that keeps its thread busy holds up neither accepting nor the
// connections pinned to other threads (a connection is greeted on its own).
TEST_F(IpcListenerTest, ABusyRequestHoldsUpNeitherAcceptingNorOtherThreads) {
    for (std::size_t threads : {2u, 4u}) {
        SCOPED_TRACE(threads);
        unblock_ = {};
        unblocked_ = unblock_.get_future().share();
        ASSERT_TRUE(start({.socketPath = socketPath(), .workerThreads = threads}));
        Client busy(socketPath());
        busy.send(message(7, "Block"));
        ASSERT_TRUE(
            waitUntil([&] { return !records_.empty() && !records_.back().writers.empty(); }));
        Client next(socketPath());
        EXPECT_EQ(next.roundTrip(8), 8u);
        unblock_.set_value();
        EXPECT_EQ(seqOf(busy.receive()), 7u);
        EXPECT_EQ(next.roundTrip(9), 9u);
        listener_->stop();
        listener_.reset();
        records_.clear();
    }
}

// Also the ways start() fails without harm.
TEST_F(IpcListenerTest, AdoptsSystemdsSocketAndClosesOnlyHostileConnectionsAndThosePastTheLimit) {
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

    // Neither a pipe nor a file in the socket's place is taken (or replaced).
    EXPECT_FALSE(IpcListener({.socketPath = {}, .inheritedFd = pipeFds[1]}).start([](auto) {}));
    ::close(pipeFds[0]);
    ::close(pipeFds[1]);
    root_.writeFile("/not-a-socket", "keep");
    EXPECT_FALSE(IpcListener({.socketPath = root_ / "/not-a-socket"}).start([](auto) {}));
    EXPECT_TRUE(std::filesystem::is_regular_file(root_ / "/not-a-socket"));

    // The inherited socket is served, with limits for hostile frames: too
    // long, not CBOR, empty, a map around three arrays around an empty one.
    const Bytes hostile[] = {
        FrameSocket::rawFrame(1025, 1, {}),
        FrameSocket::rawFrame(4, 1, Bytes{0xff, 0xff, 0xff, 0xff}),
        FrameSocket::rawFrame(0, 0, {}),
        FrameSocket::rawFrame(7, 1, Bytes{0xa1, 0x61, 'a', 0x81, 0x81, 0x81, 0x80}),
    };
    ASSERT_TRUE(start({.socketPath = {},
                       .inheritedFd = fd,
                       .maxFrameBytes = 1024,
                       .maxNesting = 4,
                       .maxConnections = 2,
                       .rootReservedConnections = 0}));
    Client bystander(socketPath());
    // A frame of exactly the limit is served (a text over 255 bytes has two
    // more bytes of length).
    const auto padded = [](std::size_t n) {
        return Value(Value::Dictionary{{"Seq", Value(1u)}, {"Pad", std::string(n, 'p')}});
    };
    const Value exact = padded(1024 - CborCodec::encode(padded(0)).size() - 2);
    ASSERT_EQ(IpcFrame::encodeMessage(exact, true).size(), 5 + 1024u);
    bystander.send(exact);
    EXPECT_EQ(bystander.receive(), exact);
    // A reply over it is replaced by an error the client can read.
    bystander.send(message(1, "Big"));
    EXPECT_EQ(bystander.receive(), IpcFrame::oversizedReply());
    {
        Client second(socketPath());
        EXPECT_EQ(second.roundTrip(2), 2u);
        Client third(socketPath(), false);
        EXPECT_TRUE(third.closedByService());
    }
    // Once the second has ended, there is room again.
    ASSERT_TRUE(waitForEnds({1}));
    for (std::size_t i = 0; i < std::size(hostile); ++i) {
        SCOPED_TRACE(i);
        Client bad(socketPath());
        bad.write(hostile[i]);
        EXPECT_TRUE(bad.closedByService());
        EXPECT_EQ(bystander.roundTrip(1), 1u);
        ASSERT_TRUE(waitForEnds({i + 2}));
        EXPECT_TRUE(record(i + 2).writers.empty());
    }
    EXPECT_FALSE(
        IpcListener({.socketPath = socketPath()}).start([](auto) {})); // the live one is kept
    EXPECT_EQ(bystander.roundTrip(1), 1u);
}

TEST(CborCodecTest, EveryKindRoundTripsKeepsItsSignAndIsPlainCborRefusedWhenCutOrFollowed) {
    const Value original = everyKind();
    const Bytes valid = CborCodec::encode(original);
    const auto decoded = CborCodec::decode(valid);
    ASSERT_TRUE(decoded) << decoded.error().message;
    EXPECT_EQ(*decoded, original) << decoded->description();
    EXPECT_EQ(decoded->get("ints")->asArray()->front().kind(), Value::Kind::Int64);
    EXPECT_EQ(decoded->get("uints")->asArray()->back().kind(), Value::Kind::UInt64);

    // The wire form is plain CBOR other clients can read.
    UUID::Bytes raw{};
    for (std::size_t i = 0; i < raw.size(); ++i) {
        raw[i] = static_cast<std::uint8_t>(i);
    }
    EXPECT_EQ(CborCodec::encode(Value(UUID(raw))),
              concat(Bytes({0xd8, 0x25, 0x50}), Bytes(raw.begin(), raw.end())));
    EXPECT_EQ(CborCodec::encode(Value(Date{1500000})),
              Bytes({0xc1, 0xfb, 0x3f, 0xf8, 0, 0, 0, 0, 0, 0}));
    EXPECT_EQ(CborCodec::encode(Value(Value::Dictionary{{"a", Value(1u)}, {"b", Value(-1)}})),
              Bytes({0xa2, 0x61, 'a', 0x01, 0x61, 'b', 0x20}));
    EXPECT_EQ(CborCodec::encode(Value()), Bytes({0xf6}));
    EXPECT_EQ(CborCodec::encode(Value(Value::Data{7})), Bytes({0x41, 0x07}));

    // What other encoders may send: short floats, a date in whole seconds.
    EXPECT_EQ(*CborCodec::decode(Bytes({0xf9, 0x3e, 0x00})), Value(1.5));
    EXPECT_EQ(*CborCodec::decode(Bytes({0xfa, 0x3f, 0xc0, 0, 0})), Value(1.5));
    EXPECT_EQ(*CborCodec::decode(Bytes({0xc1, 0x1a, 0x65, 0x53, 0xf1, 0x00})),
              Value(Date{1700000000LL * 1000000}));

    // Every truncation is refused.
    for (std::size_t length = 0; length < valid.size(); ++length) {
        EXPECT_FALSE(CborCodec::decode(std::span(valid.data(), length))) << length << " bytes";
    }
}

TEST(CborCodecTest, MalformedOrTooDeepOrLargeInputIsRefusedForItsReason) {
    EXPECT_TRUE(CborCodec::decode(nestedArrays(32)));
    EXPECT_FALSE(CborCodec::decode(nestedArrays(33)));
    // Maps count as nesting too.
    EXPECT_FALSE(CborCodec::decode(Bytes({0xa1, 0x61, 'k', 0x81, 0x81, 0x00}),
                                   {.maxBytes = 64, .maxNesting = 2}));

    const Bytes text = CborCodec::encode(Value(std::string(20, 'x')));
    EXPECT_TRUE(CborCodec::decode(text, {.maxBytes = text.size(), .maxNesting = 1}));
    EXPECT_FALSE(CborCodec::decode(text, {.maxBytes = text.size() - 1, .maxNesting = 1}));

    struct Case {
        const char* name;
        Bytes input;
        const char* reason;
    };
    const Case cases[] = {
        {"empty", {}, "ends after 0 bytes"},
        {"trailing byte", {0xf6, 0x00}, "follow the value"},
        {"2^64-6 items", {0x9b, 0xff, 0xff, 0xff, 0xff, 0xff, 0xff, 0xff, 0xfa}, "declares"},
        {"map of 2^32 pairs", {0xbb, 0, 0, 0, 1, 0, 0, 0, 0, 0x00}, "declares"},
        {"array of 9 in 8 bytes", {0x89, 1, 2, 3, 4, 5, 6, 7}, "declares"},
        {"inner array too long",
         {0x82, 0x83, 0x01, 0x02, 0x03, 0x84, 0x01, 0x02, 0x03},
         "declares"},
        {"array and its siblings longer than the rest", {0x85, 0x84, 0, 0, 0, 0}, "declares"},
        {"byte string of 2^40", {0x5b, 0, 0, 1, 0, 0, 0, 0, 0, 0x00}, "ends inside"},
        {"text of 2^32-1", {0x7a, 0xff, 0xff, 0xff, 0xff, 'a'}, "ends inside"},
        {"integer key", {0xa1, 0x01, 0x02}, "not text"},
        {"tagged key", {0xa1, 0xc1, 0x00, 0x02}, "tagged"},
        {"duplicate key", {0xa2, 0x61, 'a', 0x01, 0x61, 'a', 0x02}, "twice"},
        {"unknown tag", {0xc2, 0x41, 0x00}, "tag 2"},
        {"UUID of 15 bytes", concat(Bytes({0xd8, 0x25, 0x4f}), Bytes(15, 0)), "16 bytes"},
        {"UUID as text", concat(Bytes({0xd8, 0x25, 0x70}), Bytes(16, 'a')), "16 bytes"},
        {"date over text", {0xc1, 0x61, '1'}, "no time"},
        {"date over NaN", {0xc1, 0xf9, 0x7e, 0x00}, "no time"},
        {"date beyond range", {0xc1, 0x1b, 0x7f, 0, 0, 0, 0, 0, 0, 0}, "no time"},
        {"tag over tag", {0xc1, 0xc1, 0x00}, "another tag"},
        {"tag over array", {0xd8, 0x25, 0x80}, "over an array"},
        {"indefinite array", {0x9f, 0xff}, "indefinite"},
        {"lone break", {0xff}, "indefinite"},
        {"undefined", {0xf7}, "undefined"},
        {"simple value", {0xf8, 0x20}, "malformed"},
        {"reserved head", {0x1c}, "malformed"},
        {"integer below int64", {0x3b, 0x80, 0, 0, 0, 0, 0, 0, 0}, "below"},
        {"bad UTF-8", {0x62, 0xc3, 0x28}, "UTF-8"},
        {"overlong UTF-8", {0x62, 0xc0, 0x80}, "UTF-8"},
        {"UTF-8 surrogate", {0x63, 0xed, 0xa0, 0x80}, "UTF-8"},
    };
    for (const auto& c : cases) {
        const auto decoded = CborCodec::decode(c.input);
        ASSERT_FALSE(decoded) << c.name;
        EXPECT_EQ(decoded.error().code, kQRNErrorBadRequestArgument) << c.name;
        EXPECT_NE(decoded.error().message.find(c.reason), std::string::npos)
            << c.name << ": " << decoded.error().message;
    }
}

TEST(CborCodecTest, ItemsOverTheBudgetAreRefusedBeforeTheyAreBuilt) {
    struct Case {
        const char* name;
        Bytes input;
        std::size_t maxItems;
        bool decodes;
    };
    constexpr std::size_t kContainer = CborCodec::kContainerCost;
    const Case cases[] = {
        {"array and its 3 items", {0x83, 1, 2, 3}, kContainer + 3, true},
        {"array of 3 one short", {0x83, 1, 2, 3}, kContainer + 2, false},
        {"map, key and value", {0xa1, 0x61, 'a', 1}, kContainer + 2, true},
        {"map of 1 one short", {0xa1, 0x61, 'a', 1}, kContainer + 1, false},
        {"empty maps cost their allocation", {0x82, 0xa0, 0xa0}, 3 * kContainer - 1, false},
        {"siblings past the budget", {0x82, 0x81, 0x00, 0x81, 0x00}, 3 * kContainer + 1, false},
        {"tagged UUID counts tag and bytes", concat(Bytes({0xd8, 0x25, 0x50}), Bytes(16, 0)), 2,
         true},
    };
    for (const auto& c : cases) {
        const auto decoded = CborCodec::decode(c.input, {.maxItems = c.maxItems});
        EXPECT_EQ(bool(decoded), c.decodes) << c.name;
    }
    // A megabyte of empty maps under the daemon's budget.
    const std::size_t count = (1u << 20) - 16;
    Bytes maps{0x9a, 0, 0x0f, 0xff, 0xf0};
    maps.resize(maps.size() + count, 0xa0);
    const auto refused = CborCodec::decode(
        maps, {.maxBytes = maps.size(), .maxItems = IpcListener::Options{}.maxDecodedItems});
    ASSERT_FALSE(refused);
    EXPECT_NE(refused.error().message.find("budget"), std::string::npos) << refused.error().message;
    // The largest request a frame carries still decodes: command 3 with its
    // four parallel arrays as long as 1 MiB allows.
    Value::Array classes, uuids, identifiers, personas;
    for (int i = 0; i < 25000; ++i) {
        classes.emplace_back(2u);
        uuids.emplace_back(UUID::random());
        identifiers.emplace_back("com.example.x" + std::to_string(i));
        personas.emplace_back("");
    }
    const auto largest =
        CborCodec::encode(Value(Value::Dictionary{{"Command", 3u},
                                                  {"ContainerClassesArray", classes},
                                                  {"UUIDsArray", uuids},
                                                  {"IdentifiersArray", identifiers},
                                                  {"PersonaUniqueStringsArray", personas}}));
    ASSERT_LE(largest.size(), IpcListener::Options{}.maxFrameBytes);
    EXPECT_TRUE(CborCodec::decode(largest, {.maxItems = IpcListener::Options{}.maxDecodedItems}));
}

TEST(IpcConnectionSlotsTest, EachUidHasItsShareAndRootItsReserve) {
    struct Case {
        const char* name;
        std::vector<uid_t> held; // taken in this order, each must succeed
        uid_t next;
        bool granted;
    };
    const IpcConnectionSlots::Quota quota{.total = 8, .perUID = 2, .rootReserved = 2};
    const Case cases[] = {
        {"a first slot", {}, 501, true},
        {"a second slot", {501}, 501, true},
        {"past the uid's share", {501, 501}, 501, false},
        {"another uid's share", {501, 501}, 502, true},
        {"into root's reserve", {501, 501, 502, 502, 503, 503}, 504, false},
        {"root in its reserve", {501, 501, 502, 502, 503, 503}, 0, true},
        {"root past its share", {0, 0, 0, 0, 0, 0, 0}, 0, true},
        {"nobody past the total", {0, 0, 0, 0, 0, 0, 0, 0}, 0, false},
    };
    for (const auto& c : cases) {
        IpcConnectionSlots slots(quota);
        for (const uid_t uid : c.held) {
            ASSERT_TRUE(slots.take(uid)) << c.name;
        }
        EXPECT_EQ(slots.take(c.next), c.granted) << c.name;
    }
    IpcConnectionSlots slots(quota);
    for (const uid_t uid : {501u, 502u, 502u}) {
        slots.take(uid);
    }
    EXPECT_EQ(slots.uidsByUse(), (std::vector<uid_t>{502, 501}));
    slots.release(502);
    slots.release(502);
    slots.release(502); // not held any more: nothing changes
    EXPECT_EQ(std::make_tuple(slots.used(), slots.heldBy(502)), std::make_tuple(1u, 0u));
    EXPECT_TRUE(slots.take(502));
}

TEST(IpcExecFingerprintTest, AProcessMatchesUntilItExecsOrExits) {
    // startcode .. env_end are fields 26-28 and 48-51, counted after "(comm)".
    std::string stat = "42 (a) b) c) S";
    for (int field = 4; field <= 52; ++field) {
        stat += " " + std::to_string(field);
    }
    const auto layout = IpcExecFingerprint::parseLayout(stat + "\n");
    ASSERT_TRUE(layout);
    EXPECT_EQ(*layout, (IpcExecFingerprint::Layout{26, 27, 28, 48, 49, 50, 51}));
    std::string notANumber = stat;
    notANumber.replace(notANumber.find(" 27 "), 4, " x7 ");
    for (const std::string& bad :
         {std::string("42 (a S 1 2"), stat.substr(0, stat.find(" 50 ")), notANumber}) {
        EXPECT_FALSE(IpcExecFingerprint::parseLayout(bad)) << bad;
    }

    int go[2];
    ASSERT_EQ(::pipe(go), 0);
    const pid_t child = ::fork();
    if (child == 0) {
        char c;
        if (::read(go[0], &c, 1) == 1) {
            ::execl("/bin/sleep", "sleep", "60", nullptr);
        }
        ::_exit(1);
    }
    ::close(go[0]);
    Descriptor pidfd(static_cast<int>(::syscall(SYS_pidfd_open, child, 0)));
    auto program = IpcExecFingerprint::of(child, pidfd.get());
    ASSERT_TRUE(program) << program.error().message;
    EXPECT_TRUE(program->matches());
    ASSERT_EQ(::write(go[1], "x", 1), 1);
    const auto deadline = std::chrono::steady_clock::now() + kGuard;
    while (program->matches() && std::chrono::steady_clock::now() < deadline) {
        std::this_thread::sleep_for(std::chrono::milliseconds(1));
    }
    EXPECT_FALSE(program->matches()) << "the exec is seen";
    auto execd = IpcExecFingerprint::of(child, pidfd.get());
    ASSERT_TRUE(execd);
    EXPECT_TRUE(execd->matches());
    ::kill(child, SIGKILL);
    ::waitpid(child, nullptr, 0);
    ::close(go[1]);
    EXPECT_FALSE(execd->matches()) << "an exited process matches nothing";
    EXPECT_FALSE(IpcExecFingerprint::of(child, pidfd.get()));
}

namespace {

// The resident size of this process, in KiB.
std::size_t residentKiB() {
    std::ifstream status("/proc/self/status");
    for (std::string line; std::getline(status, line);) {
        if (line.starts_with("VmRSS:")) {
            return std::stoul(line.substr(6));
        }
    }
    return 0;
}

} // namespace

TEST_F(IpcListenerTest, EarlyBytesAndHalfFramesCloseTheirConnectionBuffersFollowTheBytes) {
    ASSERT_TRUE(start(
        {.socketPath = socketPath(), .partialFrameTimeout = std::chrono::milliseconds(50)}, {0}));
    // 0 writes before it was greeted: maybe another program's bytes.
    Client early(socketPath(), false);
    early.send(message(1));
    resume(0);
    EXPECT_TRUE(early.closedByService());
    EXPECT_TRUE(record(0).writers.empty());
    // 1 begins a frame and stops; 2 sends whole ones.
    Client half(socketPath());
    half.write(FrameSocket::rawFrame(100, 1, Bytes{0xa1, 0x61}));
    EXPECT_TRUE(half.closedByService());
    Client whole(socketPath());
    EXPECT_EQ(whole.roundTrip(2), 2u);
    listener_->stop();

    // Announcing large frames costs a client a few bytes: the buffers
    // follow what arrives. One thread serves all, so the bystander's
    // answer comes after the announcements were read.
    constexpr std::size_t kLarge = 64u << 20;
    ASSERT_TRUE(start({.socketPath = socketPath(), .workerThreads = 1, .maxFrameBytes = kLarge}));
    const std::size_t resident = residentKiB();
    std::vector<std::unique_ptr<Client>> announcers;
    for (int i = 0; i < 8; ++i) {
        announcers.push_back(std::make_unique<Client>(socketPath()));
        announcers.back()->write(FrameSocket::rawFrame(kLarge, 1, Bytes{0xa1, 0x61}));
    }
    Client bystander(socketPath());
    EXPECT_EQ(bystander.roundTrip(3), 3u);
    EXPECT_LT(residentKiB() - resident, kLarge / 1024) << "buffers sized by the announced length";
}

TEST_F(IpcListenerTest, WhenSlotsRunShortAnIdleConnectionMakesRoomNotABusyOne) {
    ASSERT_TRUE(start({.socketPath = socketPath(),
                       .reapIdleAbove = 1,
                       .idleTimeout = std::chrono::milliseconds(0)}));
    Client waiting(socketPath());
    waiting.send(message(1, "Hold"));
    ASSERT_TRUE(waitUntil([&] { return !records_.empty() && records_[0].writers.size() == 1; }));
    Client idle(socketPath()); // the second: nothing is closed yet
    Client newcomer(socketPath());
    EXPECT_TRUE(idle.closedByService());
    record(0).connection->sendReply(message(1));
    EXPECT_EQ(seqOf(waiting.receive()), 1u);
    EXPECT_EQ(newcomer.roundTrip(3), 3u);
}
