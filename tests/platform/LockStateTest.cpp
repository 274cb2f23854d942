#include "Daemon/platform/LinuxLockState.h"

#include "common/TempRoot.h"

#include <gtest/gtest.h>

#include <chrono>
#include <condition_variable>
#include <fstream>
#include <mutex>
#include <vector>

using namespace quarn;

namespace {

using V = std::vector<std::int32_t>;

// Collects the states a watch reports, for tests to wait on.
class Reports {
public:
    LockState::Callback callback() {
        return [this](std::int32_t state) {
            std::lock_guard guard(mutex_);
            states_.push_back(state);
            changed_.notify_all();
        };
    }
    // Waits (generously) until `count` states arrived; 0 answers at once.
    V waitFor(std::size_t count = 0) {
        std::unique_lock lock(mutex_);
        changed_.wait_for(lock, std::chrono::seconds(20), [&] { return states_.size() >= count; });
        return states_;
    }

private:
    std::mutex mutex_; // guards states_
    std::condition_variable changed_;
    V states_;
};

class LockStateTest : public quarn::test::TempRootTest {
protected:
    std::filesystem::path runDirectory() const { return Paths(root_.path()).runDirectory(); }
    std::filesystem::path file() const { return runDirectory() / "lockstate"; }

    void writeInPlace(const std::string& text) const {
        std::filesystem::create_directories(runDirectory());
        std::ofstream(file(), std::ios::trunc) << text;
    }
    void writeByRename(const std::string& text) const {
        std::ofstream(runDirectory() / "lockstate.new", std::ios::trunc) << text;
        std::filesystem::rename(runDirectory() / "lockstate.new", file());
    }
    LinuxLockState lock_{Paths(root_.path())};
};

} // namespace

TEST(LockStateParsing, DecimalStatesOnly) {
    const std::pair<const char*, std::optional<std::int32_t>> cases[] = {
        {"0", 0},   {"1\n", 1}, {"  3 \r\n", 3}, {"-2", -2},  {"", {}},    {"\n", {}},
        {"1x", {}}, {"+1", {}}, {"locked", {}},  {"0x1", {}}, {"1 0", {}}, {"2147483648", {}},
    };
    for (const auto& [text, expected] : cases) {
        EXPECT_EQ(LinuxLockState::parseState(text), expected) << '"' << text << '"';
    }
}

TEST_F(LockStateTest, StateFollowsTheFile) {
    auto& lock = root_.context().instance<LockState>();
    EXPECT_EQ(lock.state(), LockState::kUnlocked); // no file, no run directory
    for (const auto& [text, state] : {std::pair<const char*, std::int32_t>{"1\n", 1},
                                      {"2", 2},
                                      {"garbage", LinuxLockState::kUnreadable}}) {
        writeInPlace(text);
        EXPECT_EQ(lock.state(), state) << text;
    }
    // A link planted in place of the file is not believed.
    std::filesystem::remove(file());
    root_.writeFile("/elsewhere", "1");
    std::filesystem::create_symlink(root_ / "/elsewhere", file());
    EXPECT_EQ(lock.state(), LinuxLockState::kUnreadable);
}

TEST_F(LockStateTest, WatchSeesWritesRenamesAndRemoval) {
    Reports reports;
    ASSERT_TRUE(lock_.startWatching(reports.callback())); // makes the run directory
    writeInPlace("1");
    EXPECT_EQ(reports.waitFor(1), V{1});
    writeInPlace("1"); // no change: not reported
    root_.writeFile("/private/var/run/quarnd/unrelated", "0");
    writeByRename("0");
    EXPECT_EQ(reports.waitFor(2), (V{1, 0}));
    writeByRename("2");
    EXPECT_EQ(reports.waitFor(3), (V{1, 0, 2}));
    writeInPlace("1");
    EXPECT_EQ(reports.waitFor(4), (V{1, 0, 2, 1}));
    std::filesystem::remove(file());
    EXPECT_EQ(reports.waitFor(5), (V{1, 0, 2, 1, 0}));
    writeInPlace("1");
    EXPECT_EQ(reports.waitFor(6), (V{1, 0, 2, 1, 0, 1}));
    std::filesystem::rename(file(), runDirectory() / "moved-away");
    EXPECT_EQ(reports.waitFor(7), (V{1, 0, 2, 1, 0, 1, 0}));
}

TEST_F(LockStateTest, StoppedWatchesAreSilentRestartsWorkAndALostRunDirectoryIsUnlocked) {
    writeInPlace("1");
    Reports first, second, third;
    ASSERT_TRUE(lock_.startWatching(first.callback()));
    writeInPlace("0"); // the state at the start (1) is not reported, the change is
    EXPECT_EQ(first.waitFor(1), V{0});
    ASSERT_TRUE(lock_.startWatching(second.callback())); // replaces the first watch
    writeInPlace("1");
    EXPECT_EQ(second.waitFor(1), V{1});
    lock_.stopWatching();
    lock_.stopWatching(); // twice is harmless
    ASSERT_TRUE(lock_.startWatching(third.callback()));
    std::filesystem::remove_all(runDirectory());
    EXPECT_EQ(third.waitFor(1), V{0});
    EXPECT_EQ(lock_.state(), LockState::kUnlocked);
    // The earlier watches were joined before their replacement started.
    EXPECT_EQ(first.waitFor(), V{0});
    EXPECT_EQ(second.waitFor(), V{1});
}

TEST_F(LockStateTest, CallbackMayStopItsOwnWatchAndDestructionJoins) {
    auto lock = std::make_unique<LinuxLockState>(Paths(root_.path()));
    Reports reports;
    ASSERT_TRUE(lock->startWatching([&, record = reports.callback()](std::int32_t state) {
        lock->stopWatching(); // must neither deadlock nor crash
        record(state);
    }));
    writeInPlace("1");
    EXPECT_EQ(reports.waitFor(1), V{1});

    ASSERT_TRUE(lock->startWatching(reports.callback()));
    lock.reset(); // with a live watch: the thread must be gone before the object
    writeInPlace("0");
    EXPECT_EQ(reports.waitFor(), V{1});
}
