// Who wrote each message (the credentials the kernel stamps on every write),
// and replies that do not fit the socket at once.

#include "platform/IpcListenerFixture.h"

#include "common/LogCapture.h"

#include <fmt/format.h>
#include <sys/wait.h>
#include <unistd.h>

#include <string>

using namespace quarn;
using namespace quarn::test;

namespace {

// Runs `write` in a forked child that shares this process's descriptors;
// answers the child's pid once it has exited.
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

class IpcWriterTest : public IpcListenerTest {
protected:
    // Echoes, noting the writer of each message.
    Handler recordingEcho() {
        return [this](const std::shared_ptr<IpcConnection>& connection, const Event& event) {
            {
                std::lock_guard lock(mutex_);
                writers_.push_back(connection->messageSender());
            }
            echo(connection, event);
        };
    }
    std::optional<IpcConnection::Sender> writer(std::size_t index) {
        std::lock_guard lock(mutex_);
        return index < writers_.size() ? writers_[index] : std::nullopt;
    }

    std::vector<std::optional<IpcConnection::Sender>> writers_; // guarded by mutex_
};

} // namespace

TEST_F(IpcWriterTest, EachMessageNamesTheProcessThatWroteIt) {
    ASSERT_TRUE(start(recordingEcho()));
    IpcTestClient client(socketPath());
    client.send(message(1));
    EXPECT_EQ(seqOf(client.receive()), 1u);
    const pid_t child = inChild([&] { client.send(message(2)); });
    EXPECT_EQ(seqOf(client.receive()), 2u);
    client.send(message(3));
    EXPECT_EQ(seqOf(client.receive()), 3u);

    const IpcConnection::Sender self{::getpid(), ::getuid(), ::getgid()};
    EXPECT_EQ(writer(0), self);
    EXPECT_EQ(writer(1), (IpcConnection::Sender{child, ::getuid(), ::getgid()}))
        << "the child that shares the connection, not the process that connected";
    EXPECT_EQ(writer(2), self);
    listener_->stop();
}

TEST_F(IpcWriterTest, AFrameWrittenByTwoProcessesClosesTheConnection) {
    ASSERT_TRUE(start(recordingEcho()));
    LogCapture log;
    IpcTestClient client(socketPath());
    const std::vector<std::uint8_t> frame = IpcFrame::encodeMessage(message(1), true);
    const std::size_t half = frame.size() / 2;
    client.write({frame.begin(), frame.begin() + static_cast<std::ptrdiff_t>(half)});
    const pid_t child = inChild([&] {
        client.write({frame.begin() + static_cast<std::ptrdiff_t>(half), frame.end()});
    });
    EXPECT_TRUE(client.closedByService());
    EXPECT_TRUE(log.contains(fmt::format("Closing the connection of pid {}: a frame holds bytes "
                                         "written by pid {} and by pid {}",
                                         ::getpid(), ::getpid(), child)))
        << log.all();
    listener_->stop();
    EXPECT_EQ(messages(0), 0);
    EXPECT_EQ(invalidations(0), 1);
}

TEST_F(IpcWriterTest, RepliesLargerThanTheSocketTakesArriveWholeAndInOrder) {
    // Three replies per request, each well over a socket buffer, so most
    // of them wait in the queue while the client is not reading.
    const std::string bulk(300 * 1024, 'q');
    ASSERT_TRUE(start([&](const std::shared_ptr<IpcConnection>& connection, const Event& event) {
        const std::uint64_t seq = seqOf(event.body);
        for (std::uint64_t i = 0; i < 3; ++i) {
            connection->sendReply(Value::Dictionary{{"Seq", Value(seq * 10 + i)}, {"Bulk", bulk}});
        }
    }));
    IpcTestClient client(socketPath());
    client.send(message(1));
    client.send(message(2));
    for (std::uint64_t expected : {10u, 11u, 12u, 20u, 21u, 22u}) {
        const auto reply = client.receive();
        ASSERT_EQ(seqOf(reply), expected);
        const Value* got = reply->get("Bulk");
        ASSERT_TRUE(got && got->asString());
        EXPECT_EQ(got->asString()->size(), bulk.size());
    }
    listener_->stop();
}
