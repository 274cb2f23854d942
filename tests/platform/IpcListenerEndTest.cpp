#include "platform/IpcListenerFixture.h"

#include <atomic>
#include <cstdlib>
#include <fcntl.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <thread>

using namespace quarn;
using namespace quarn::test;

namespace {

int listeningSocketAt(const std::filesystem::path& path) {
    const int fd = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    std::strncpy(address.sun_path, path.c_str(), sizeof address.sun_path - 1);
    EXPECT_EQ(::bind(fd, reinterpret_cast<const sockaddr*>(&address), sizeof address), 0);
    EXPECT_EQ(::listen(fd, 8), 0);
    return fd;
}

// Puts `fds` where systemd would (3 and up), named by LISTEN_* variables,
// and puts back what was there afterwards.
class SystemdHandOver {
public:
    SystemdHandOver(const std::vector<int>& fds, const char* names) {
        for (int fd : fds) { // copies first: a source may sit at a target
            sources_.push_back(::fcntl(fd, F_DUPFD_CLOEXEC, 200));
        }
        for (std::size_t i = 0; i < fds.size(); ++i) {
            saved_.push_back(::fcntl(kFirst + static_cast<int>(i), F_DUPFD_CLOEXEC, 200));
            ::dup2(sources_[i], kFirst + static_cast<int>(i));
        }
        ::setenv("LISTEN_PID", std::to_string(::getpid()).c_str(), 1);
        ::setenv("LISTEN_FDS", std::to_string(fds.size()).c_str(), 1);
        ::setenv("LISTEN_FDNAMES", names, 1);
    }
    ~SystemdHandOver() {
        for (const char* name : {"LISTEN_PID", "LISTEN_FDS", "LISTEN_FDNAMES"}) {
            ::unsetenv(name);
        }
        for (std::size_t i = 0; i < saved_.size(); ++i) {
            saved_[i] >= 0 ? ::dup2(saved_[i], kFirst + static_cast<int>(i))
                           : ::close(kFirst + static_cast<int>(i));
            ::close(saved_[i]);
            ::close(sources_[i]);
        }
    }

private:
    static constexpr int kFirst = 3;
    std::vector<int> sources_;
    std::vector<int> saved_; // what was at each target, or -1
};

} // namespace

TEST_F(IpcListenerTest, EveryEndIsHeardOnceAndAfterTheHandlerReturned) {
    std::atomic<bool> cancelling{false};
    std::atomic<bool> heardEndWhileCancelling{false};
    onEnd_ = [&] {
        if (cancelling) {
            heardEndWhileCancelling = true;
        }
    };
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

    IpcTestClient cancelled(socketPath());
    cancelled.send(Value(Value::Dictionary{{"Cancel", Value(true)}}));
    EXPECT_TRUE(cancelled.closedByService());
    {
        auto gone = std::make_unique<IpcTestClient>(socketPath());
        gone->send(Value::dictionary());
        EXPECT_TRUE(gone->receive());
    }
    IpcTestClient idle(socketPath());
    IpcTestClient neverResumed(socketPath());
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
    const int fd = listeningSocketAt(socketPath());
    int pipeFds[2];
    ASSERT_EQ(::pipe2(pipeFds, O_CLOEXEC), 0);
    {
        SystemdHandOver handOver({pipeFds[0], fd}, "com.orvex.quarnd.upcall:com.orvex.quarnd");
        EXPECT_EQ(IpcListener::socketFromSystemd("com.orvex.quarnd"), 4);
        EXPECT_EQ(IpcListener::socketFromSystemd("com.orvex.quarnd.upcall"), -1); // a pipe
        EXPECT_EQ(IpcListener::socketFromSystemd("other"), -1);
    }
    EXPECT_EQ(IpcListener::socketFromSystemd("com.orvex.quarnd"), -1);

    auto o = options();
    o.inheritedFd = pipeFds[1];
    IpcListener refused(o);
    EXPECT_FALSE(refused.start([](auto) {}));
    ::close(pipeFds[0]);
    ::close(pipeFds[1]);

    o.inheritedFd = fd;
    o.socketPath.clear();
    ASSERT_TRUE(start(echo, o));
    IpcTestClient client(socketPath());
    client.send(Value::dictionary());
    EXPECT_TRUE(client.receive());
}
