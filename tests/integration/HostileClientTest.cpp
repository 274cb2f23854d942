// The request socket against the unprivileged local user: an identity that
// cannot be borrowed by exec or fork, connection slots one uid cannot take
// all of, and messages that cannot blow up the daemon's memory.

#include "Attacker.h"
#include "DaemonHarness.h"

#include "Daemon/platform/IpcFrame.h"

#include <fcntl.h>
#include <sys/socket.h>

#include <csignal>
#include <fstream>
#include <thread>

namespace quarn::test {

namespace {

constexpr std::uint64_t kListAll = 1; // a command that needs "allowed"

class HostileClient : public SharedDaemonTest {
protected:
    static void SetUpTestSuite() {
        SharedDaemonTest::SetUpTestSuite();
        // The attacker must reach its socket below the scratch root.
        std::filesystem::permissions(daemon().root(), std::filesystem::perms(0755));
        // The test binary is an unregistered program from now on, as the
        // attacker's own program would be.
        std::filesystem::remove(Paths(daemon().root()).configDirectory() / "codesign.d" /
                                "integration.plist");
        EXPECT_TRUE(waitUntil([] { return replyError(daemon().request(listAll())) == 55; }));
    }

    static Value listAll() {
        return Value(Value::Dictionary{{"Command", kListAll}, {"ContainerClass", 2u}});
    }
    static std::filesystem::path program(std::string_view name) {
        return daemon().root() / "clients" / std::string(name);
    }
    // A connection the daemon has greeted, its reads bounded; -1 when refused.
    static int greeted() {
        const int fd = FrameSocket::connectGreeted(daemon().socketPath());
        const timeval limit{.tv_sec = kWaitLimit.count(), .tv_usec = 0};
        if (fd >= 0) {
            ::setsockopt(fd, SOL_SOCKET, SO_RCVTIMEO, &limit, sizeof limit);
        }
        return fd;
    }
    // The daemon closed `fd` without sending anything more.
    static bool closedWithoutReply(int fd) {
        std::uint8_t byte = 0;
        const ssize_t n = ::recv(fd, &byte, 1, 0);
        return n == 0 || (n < 0 && errno == ECONNRESET);
    }
    static bool sendFrame(int fd, const Value& request) {
        return FrameSocket::writeAll(fd, FrameSocket::frame(request, IpcFrame::kExpectsReply));
    }
    static std::size_t peakKiB() {
        std::ifstream status("/proc/" + std::to_string(daemon().pid()) + "/status");
        for (std::string line; std::getline(status, line);) {
            if (line.starts_with("VmHWM:")) {
                return std::stoul(line.substr(6));
            }
        }
        return 0;
    }
};

// A pipe whose ends the steps of both sides read and write one byte at a time.
struct Pipe {
    Pipe() { EXPECT_EQ(::pipe2(fds, O_CLOEXEC), 0); }
    ~Pipe() {
        ::close(fds[0]);
        ::close(fds[1]);
    }
    bool put(char c) const { return ::write(fds[1], &c, 1) == 1; }
    char get() const {
        char c = 0;
        return ::read(fds[0], &c, 1) == 1 ? c : '\0';
    }
    int fds[2] = {-1, -1};
};

// Stops the daemon, every thread of it, and resumes it however the test ends.
struct Stopped {
    explicit Stopped(pid_t pid) : pid(pid) {
        ::kill(pid, SIGSTOP);
        const auto task = std::filesystem::path("/proc") / std::to_string(pid) / "task";
        EXPECT_TRUE(waitUntil([&] {
            std::error_code error;
            for (const auto& thread : std::filesystem::directory_iterator(task, error)) {
                std::ifstream stat(thread.path() / "stat");
                const std::string text(std::istreambuf_iterator<char>(stat), {});
                const std::size_t state = text.rfind(") ");
                if (state == std::string::npos || text.substr(state + 2, 1) != "T") {
                    return false;
                }
            }
            return !error;
        }));
    }
    ~Stopped() { ::kill(pid, SIGCONT); }
    pid_t pid;
};

} // namespace

// The request is written by an unregistered program which then execs a
// registered one; the daemon, stopped meanwhile, reads it only after the
// exec, and must not answer it as the registered program's.
TEST_F(HostileClient, ARequestWrittenBeforeAnExecGetsNothing) {
    Pipe toTest, toAttacker, fromReader;
    std::atomic<bool> execdServed{false};
    const auto allowed = program(program::kAllowed);
    std::thread attacker([&] {
        execdServed = asAttacker([&] {
            const int fd = greeted();
            if (fd < 0 || !toTest.put('g') || toAttacker.get() != 's') {
                return false;
            }
            if (!sendFrame(fd, listAll())) {
                return false;
            }
            if (::fork() == 0) { // keeps the connection and reports what comes back
                fromReader.put(closedWithoutReply(fd) ? 'c' : 'r');
                ::_exit(0);
            }
            const std::string socket = daemon().socketPath().string();
            const std::string request = HexCbor::encode(listAll());
            ::execl(allowed.c_str(), allowed.c_str(), "--socket", socket.c_str(), request.c_str(),
                    nullptr);
            return false;
        });
    });
    ASSERT_EQ(toTest.get(), 'g');
    {
        Stopped stopped(daemon().pid());
        toAttacker.put('s');
        // The attacker's process runs the registered program once exe says so.
        EXPECT_TRUE(waitUntil([&] {
            std::error_code error;
            for (const auto& entry : std::filesystem::directory_iterator("/proc", error)) {
                std::error_code ignored;
                if (std::filesystem::read_symlink(entry.path() / "exe", ignored) == allowed) {
                    return true;
                }
            }
            return false;
        }));
    }
    EXPECT_EQ(fromReader.get(), 'c');
    attacker.join();
    EXPECT_TRUE(execdServed) << "the registered program on a connection of its own is served";
}

TEST_F(HostileClient, AForkedChildWritingOnItsParentsConnectionClosesIt) {
    EXPECT_TRUE(asAttacker([&] {
        const int fd = greeted();
        const pid_t child = ::fork();
        if (child == 0) {
            ::_exit(sendFrame(fd, listAll()) ? 0 : 1);
        }
        int status = 0;
        ::waitpid(child, &status, 0);
        return fd >= 0 && closedWithoutReply(fd);
    }));
}

TEST_F(HostileClient, OneUidGetsAQuarterOfTheSlotsAndRootIsStillServed) {
    Pipe toTest, toAttacker;
    std::thread attacker([&] {
        asAttacker([&] {
            std::vector<int> held; // closed as the process exits
            for (int i = 0; i < 300; ++i) {
                if (const int fd = greeted(); fd >= 0) {
                    held.push_back(fd);
                }
            }
            return toTest.put(static_cast<char>(std::min<std::size_t>(held.size(), 127))) &&
                   toAttacker.get() == 'x';
        });
    });
    const int held = toTest.get();
    EXPECT_GT(held, 0);
    EXPECT_LE(held, 256 / 4);
    const auto replies = daemon().replies(program::kAllowed, {listAll()});
    EXPECT_EQ(replyError(replies[0]), kQRNErrorNone);
    toAttacker.put('x');
    attacker.join();
}

TEST_F(HostileClient, MegabyteFramesOfEmptyMapsDoNotGrowTheDaemon) {
    // {"Pad": [{}, {}, ...]} filling 1 MiB: one byte per map.
    const std::uint32_t count = (1u << 20) - 16;
    std::vector<std::uint8_t> body{0xa1, 0x63, 'P', 'a', 'd', 0x9a};
    for (int shift = 24; shift >= 0; shift -= 8) {
        body.push_back(static_cast<std::uint8_t>(count >> shift));
    }
    body.resize(body.size() + count, 0xa0);
    const auto frame = FrameSocket::rawFrame(static_cast<std::uint32_t>(body.size()),
                                             IpcFrame::kExpectsReply, body);
    const std::size_t before = peakKiB();
    ASSERT_GT(before, 0u);
    EXPECT_TRUE(asAttacker([&] {
        bool refused = true;
        for (int i = 0; i < 16; ++i) {
            const int fd = greeted();
            refused =
                refused && fd >= 0 && FrameSocket::writeAll(fd, frame) && closedWithoutReply(fd);
            ::close(fd);
        }
        return refused;
    }));
    // Decoded without a budget, each frame costs hundreds of megabytes.
    EXPECT_LT(peakKiB() - before, 128u * 1024);
    const auto replies = daemon().replies(program::kAllowed, {listAll()});
    EXPECT_EQ(replyError(replies[0]), kQRNErrorNone);
}

} // namespace quarn::test
