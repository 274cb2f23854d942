#include "platform/IpcListenerFixture.h"

#include "common/LogCapture.h"

#include <atomic>
#include <fmt/format.h>
#include <fstream>
#include <sys/stat.h>
#include <thread>

using namespace quarn;
using namespace quarn::test;

namespace {

mode_t modeOf(const std::filesystem::path& path) {
    struct stat st {};
    ::lstat(path.c_str(), &st);
    return st.st_mode & 07777;
}

} // namespace

TEST(IpcFrameTest, HeaderIsALittleEndianLengthAndOneFlagBit) {
    const auto header = IpcFrame::encodeHeader(0x01020304, true);
    EXPECT_EQ(header, (std::array<std::uint8_t, 5>{0x04, 0x03, 0x02, 0x01, 0x01}));
    const auto decoded = IpcFrame::decodeHeader(header);
    ASSERT_TRUE(decoded);
    EXPECT_EQ(decoded->length, 0x01020304u);
    EXPECT_TRUE(decoded->expectsReply);
    EXPECT_FALSE(IpcFrame::decodeHeader(std::array<std::uint8_t, 5>{1, 0, 0, 0, 0x80}));
}

TEST_F(IpcListenerTest, SocketFileIsMadeOpenToAllReplacedWhenStaleAndKeptWhenLive) {
    const mode_t umask = ::umask(077); // modes hold whatever the daemon's umask
    const bool started = bool(start(echo));
    ::umask(umask);
    ASSERT_TRUE(started);
    EXPECT_EQ(modeOf(socketPath()), 0666u);
    EXPECT_EQ(modeOf(socketPath().parent_path()), 0755u);
    listener_->stop(); // leaves the socket file behind, as a crash would

    ASSERT_TRUE(start(echo)); // over the stale file
    IpcTestClient client(socketPath());
    client.send(message(7));
    EXPECT_EQ(seqOf(client.receive()), 7u);
    EXPECT_EQ(accepted(0)->peer().pid(), ::getpid());

    IpcListener second(options());
    EXPECT_FALSE(second.start([](auto) {}));
    client.send(message(8));
    EXPECT_EQ(seqOf(client.receive()), 8u);

    auto o = options();
    o.socketPath = root_ / "/not-a-socket";
    root_.writeFile("/not-a-socket", "keep");
    IpcListener third(o);
    EXPECT_FALSE(third.start([](auto) {}));
    std::ifstream kept(o.socketPath);
    EXPECT_EQ(std::string(std::istreambuf_iterator<char>(kept), {}), "keep");
}

TEST_F(IpcListenerTest, RequestsOfOneConnectionRunOneAtATimeInOrder) {
    constexpr std::uint64_t kCount = 64;
    std::atomic<int> active{0};
    std::atomic<bool> overlapped{false};
    ASSERT_TRUE(start([&](const auto& connection, const Event& event) {
        if (active.fetch_add(1) != 0) {
            overlapped = true;
        }
        for (int i = 0; i < 200; ++i) {
            std::this_thread::yield();
        }
        active.fetch_sub(1);
        connection->sendReply(event.body);
    }));

    IpcTestClient client(socketPath());
    std::vector<std::uint8_t> pipelined; // every request in one write
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
    // both finish only if the two run at the same time.
    std::mutex mutex;
    std::condition_variable started;
    std::set<std::string> running;
    ASSERT_TRUE(start([&](const auto& connection, const Event& event) {
        const std::string name = *event.body.get("Name")->asString();
        std::unique_lock lock(mutex);
        running.insert(name);
        started.notify_all();
        const bool sawOther = started.wait_for(lock, kGuard, [&] { return running.size() == 2; });
        connection->sendReply(Value(Value::Dictionary{{"SawOther", Value(sawOther)}}));
    }));

    IpcTestClient a(socketPath());
    IpcTestClient b(socketPath());
    a.send(Value(Value::Dictionary{{"Name", Value("a")}}));
    b.send(Value(Value::Dictionary{{"Name", Value("b")}}));
    const Value sawOther(Value::Dictionary{{"SawOther", Value(true)}});
    EXPECT_EQ(a.receive(), sawOther);
    EXPECT_EQ(b.receive(), sawOther);
    listener_->stop(); // the handlers may still be unlocking `mutex`
}

TEST_F(IpcListenerTest, MalformedFrameClosesOnlyItsConnectionWithOneLogLine) {
    struct Case {
        const char* name;
        std::vector<std::uint8_t> bytes;
        const char* reason;
    };
    auto header = [](std::uint32_t length, bool reply) {
        const auto h = IpcFrame::encodeHeader(length, reply);
        return std::vector<std::uint8_t>(h.begin(), h.end());
    };
    auto badFlag = IpcFrame::encodeMessage(message(1), true);
    badFlag[4] = 0x03;
    auto garbage = header(4, true);
    garbage.insert(garbage.end(), {0xff, 0xff, 0xff, 0xff});
    const Value deep(Value::Dictionary{
        {"a", Value(Value::Array{Value(Value::Array{Value(Value::Array{Value::array()})})})}});
    const Case cases[] = {
        {"oversize", header(1025, true), "a frame of 1025 bytes is over the limit of 1024"},
        {"flag", badFlag, "the flag byte 0x03 has reserved bits set"},
        {"array", IpcFrame::encodeMessage(Value::Array{Value(1u)}, true), "not a dictionary"},
        {"garbage", garbage, "does not decode"},
        {"empty", header(0, false), "does not decode"},
        {"deep", IpcFrame::encodeMessage(deep, true), "nest deeper than 4"},
    };
    auto o = options();
    o.maxFrameBytes = 1024;
    o.maxNesting = 4;
    ASSERT_TRUE(start(echo, o));
    LogCapture log;
    IpcTestClient bystander(socketPath());

    for (const auto& c : cases) {
        IpcTestClient bad(socketPath());
        bad.write(c.bytes);
        EXPECT_TRUE(bad.closedByService()) << c.name;
        EXPECT_EQ(log.count(fmt::format("Closing the connection of pid {}: ", ::getpid())), 1u)
            << c.name << "\n"
            << log.all();
        EXPECT_TRUE(log.contains(c.reason)) << c.name << "\n" << log.all();
        log.clear();
        bystander.send(message(1));
        EXPECT_TRUE(bystander.receive()) << c.name;
    }
    IpcTestClient after(socketPath());
    after.send(message(2));
    EXPECT_TRUE(after.receive());

    listener_->stop();
    for (std::size_t i = 1; i <= std::size(cases); ++i) {
        EXPECT_EQ(messages(i), 0) << cases[i - 1].name;
        EXPECT_EQ(invalidations(i), 1) << cases[i - 1].name;
    }
}

TEST_F(IpcListenerTest, ReplyMayBeSentLaterFromAnotherThread) {
    std::shared_ptr<IpcConnection> held;
    ASSERT_TRUE(start([&](const auto& connection, const Event&) {
        // The first request is answered only once the second arrived, which
        // is after the first handler returned; the test thread answers both.
        std::lock_guard lock(mutex_);
        if (!held) {
            held = connection;
        }
    }));
    IpcTestClient client(socketPath());
    client.send(message(1));
    client.send(message(2));
    ASSERT_TRUE(waitUntil([&] { return messages_[held.get()] == 2; }));
    held->sendReply(message(1));
    held->sendReply(message(2));
    EXPECT_EQ(seqOf(client.receive()), 1u);
    EXPECT_EQ(seqOf(client.receive()), 2u);
    listener_->stop(); // before `held` goes
}

TEST_F(IpcListenerTest, ConnectionNotResumedReadsNothing) {
    ASSERT_TRUE(start(echo, options(), {0}));
    IpcTestClient waiting(socketPath());
    waiting.send(message(1));
    auto connection = accepted(0);

    // The pool is running: another connection is served meanwhile.
    IpcTestClient other(socketPath());
    other.send(message(2));
    ASSERT_TRUE(other.receive());
    EXPECT_GT(waiting.unreadByService(), 0);
    EXPECT_EQ(messages(0), 0);

    resume(connection); // from this thread, not the pool
    EXPECT_EQ(seqOf(waiting.receive()), 1u);
    EXPECT_EQ(waiting.unreadByService(), 0);
}

TEST_F(IpcListenerTest, ConnectionsPastTheLimitAreClosedUntilOthersEnd) {
    LogCapture log;
    IpcListener::Options limited = options();
    limited.maxConnections = 2;
    ASSERT_TRUE(start(echo, limited));
    {
        IpcTestClient first(socketPath());
        IpcTestClient second(socketPath());
        first.send(message(1));
        second.send(message(2));
        EXPECT_EQ(seqOf(first.receive()), 1u);
        EXPECT_EQ(seqOf(second.receive()), 2u);
        IpcTestClient third(socketPath());
        EXPECT_TRUE(third.closedByService());
        EXPECT_TRUE(log.contains("Refusing a connection: 2 connections are open")) << log.all();
    }
    ASSERT_TRUE(waitUntil([&] { return invalidations_.size() == 2; }));
    IpcTestClient fourth(socketPath());
    fourth.send(message(4));
    EXPECT_EQ(seqOf(fourth.receive()), 4u);
}
