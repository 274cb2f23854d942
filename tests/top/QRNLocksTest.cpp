#include "Daemon/QRNLocks.h"

#include "common/LogCapture.h"
#include "common/TempRoot.h"

#include <gtest/gtest.h>

#include <array>
#include <chrono>
#include <cstdio>
#include <functional>
#include <future>
#include <random>
#include <thread>

using namespace quarn;

namespace {

Value ids(std::initializer_list<const char*> list) {
    Value::Array array;
    for (const char* s : list) {
        array.emplace_back(s);
    }
    return Value(std::move(array));
}

// Waits for a state another thread reaches; a lock that never lets it happen
// ends the test process with the reason rather than hanging it.
void waitUntil(const char* what, const std::function<bool()>& reached) {
    auto giveUp = std::chrono::steady_clock::now() + std::chrono::seconds(60);
    while (!reached()) {
        if (std::chrono::steady_clock::now() > giveUp) {
            std::fprintf(stderr, "never reached: %s\n", what);
            std::abort();
        }
        std::this_thread::sleep_for(std::chrono::milliseconds(1));
    }
}

// Takes a lock on its own thread and keeps it until released; the lock is
// dropped on the thread that took it.
class Holder {
public:
    Holder(std::function<void()> take, std::function<void()> drop)
        : thread_([this, take, drop, go = release_.get_future()] {
              take();
              acquired_ = true;
              go.wait();
              drop();
          }) {}
    ~Holder() { release(); }
    bool acquired() const { return acquired_; }
    void release() {
        if (thread_.joinable()) {
            release_.set_value();
            thread_.join();
        }
    }

private:
    std::atomic<bool> acquired_{false};
    std::promise<void> release_;
    std::thread thread_;
};

void expectIdle(const QRNLocks& locks) {
    auto s = locks.snapshot();
    EXPECT_EQ(s.allReaderWriterState, 0);
    EXPECT_EQ(s.identifierReaderCount, 0u);
    EXPECT_EQ(s.identifierWriterCount, 0u);
    EXPECT_EQ(s.conditionWaiters, 0u);
    EXPECT_TRUE(s.records.empty());
}

} // namespace

TEST(QRNLocksIdentifiers, DuplicatesAreLockedAndReleasedOnce) {
    QRNLocks locks;
    // A second write lock on "a" by this thread would never return.
    locks.write_lock_identifier(ids({"b", "a", "b", "a"}));
    auto s = locks.snapshot();
    EXPECT_EQ(s.identifierWriterCount, 2u);
    ASSERT_EQ(s.records.size(), 2u);
    EXPECT_EQ(s.records["a"].users, 1u);
    EXPECT_EQ(s.records["a"].lockState, -1);
    locks.unlock_identifier(ids({"a", "b", "a"}));
    expectIdle(locks);

    locks.read_lock_identifier(ids({"x", "y", "x"}));
    s = locks.snapshot();
    EXPECT_EQ(s.identifierReaderCount, 2u);
    EXPECT_EQ(s.records["x"].lockState, 1);
    locks.unlock_identifier(ids({"y", "x", "x"}));
    locks.read_lock_identifier(Value::array());
    expectIdle(locks);
}

TEST(QRNLocksIdentifiers, ArraysAreLockedInAscendingOrder) {
    QRNLocks locks;
    locks.write_lock_identifier("b");
    Holder h(
        [&] {
            locks.write_lock_identifier(ids({"b", "a"}));
        },
        [&] {
            locks.unlock_identifier(ids({"b", "a"}));
        });
    waitUntil("array locker queues on b", [&] { return locks.snapshot().records["b"].users == 2; });
    // It got to "b" only after taking "a".
    EXPECT_EQ(locks.snapshot().records["a"].lockState, -1);
    EXPECT_FALSE(h.acquired());
    locks.unlock_identifier("b");
    waitUntil("array locker gets both", [&] { return h.acquired(); });
    h.release();
    expectIdle(locks);
}

TEST(QRNLocksIdentifiers, RecordLivesExactlyWhileUsed) {
    test::TempRoot root;
    QRNLocks& locks = QRNLocks::shared();
    EXPECT_EQ(&locks, &root.context().instance<QRNLocks>());
    read_lock_identifier("x");
    read_lock_identifier("x");
    EXPECT_EQ(locks.snapshot().records["x"].users, 2u);
    EXPECT_EQ(locks.snapshot().records["x"].lockState, 2);
    unlock_identifier("x");
    EXPECT_EQ(locks.lockRecordCount(), 1u);
    unlock_identifier("x");
    EXPECT_EQ(locks.lockRecordCount(), 0u);
    write_lock_identifier("x"); // a fresh record, not a stale one
    EXPECT_EQ(locks.snapshot().records["x"].users, 1u);
    unlock_identifier("x");
    expectIdle(locks);
}

TEST(QRNLocksIdentifiers, HoldsAreMarkedFromLockToUnlock) {
    QRNLocks locks;
    test::LogCapture log;
    auto marks = [&](std::string_view name, std::string_view phase) {
        std::size_t n = 0;
        for (const auto& line : log.messages()) {
            n += line.starts_with(std::string(name) + " [") && line.find(phase) != line.npos;
        }
        return n;
    };
    locks.read_lock_identifier("x");
    locks.read_lock_identifier(ids({"x", "y"}));
    locks.read_lock_all_identifiers();
    EXPECT_EQ(marks("ReadLockWithIdentifier", "] begin"), 3u) << log.all();
    EXPECT_EQ(marks("GlobalReadLock", "] begin"), 1u);
    EXPECT_EQ(marks("WaitingForReadLockWithIdentifier", "] end"), 2u);
    EXPECT_TRUE(log.contains("uuid=x")) << log.all();
    EXPECT_EQ(marks("ReadLockWithIdentifier", "] end"), 0u);
    locks.unlock_identifier("x");
    EXPECT_EQ(marks("ReadLockWithIdentifier", "] end"), 1u);
    locks.unlock_identifier(ids({"x", "y"}));
    locks.unlock_all_identifiers();
    EXPECT_EQ(marks("ReadLockWithIdentifier", "] end"), 3u);
    EXPECT_EQ(marks("GlobalReadLock", "] end"), 1u);
}

TEST(QRNLocksGlobal, WriterWaitsForIdentifierHoldersAndHoldsOffNewOnes) {
    QRNLocks locks;
    locks.read_lock_identifier("x");
    Holder global([&] { locks.write_lock_all_identifiers(); },
                  [&] { locks.unlock_all_identifiers(); });
    waitUntil("global writer waits", [&] { return locks.snapshot().conditionWaiters == 1; });
    EXPECT_FALSE(global.acquired());
    locks.unlock_identifier("x");
    waitUntil("global writer gets in", [&] { return global.acquired(); });

    Holder reader([&] { locks.read_lock_identifier("y"); }, [&] { locks.unlock_identifier("y"); });
    Holder writer([&] { locks.write_lock_identifier("z"); }, [&] { locks.unlock_identifier("z"); });
    waitUntil("both identifier lockers wait",
              [&] { return locks.snapshot().conditionWaiters == 2; });
    EXPECT_FALSE(reader.acquired() || writer.acquired());
    global.release();
    waitUntil("identifier lockers get in", [&] { return reader.acquired() && writer.acquired(); });
    reader.release();
    writer.release();
    expectIdle(locks);
}

TEST(QRNLocksGlobal, ReaderSharesWithIdentifierReadersOnly) {
    QRNLocks locks;
    locks.read_lock_identifier("x");
    Holder first([&] { locks.read_lock_all_identifiers(); },
                 [&] { locks.unlock_all_identifiers(); });
    waitUntil("global reader beside an identifier reader", [&] { return first.acquired(); });
    first.release();

    // An identifier writer queued behind the reader of "x" is pending, and
    // already keeps a new global reader out.
    Holder writer([&] { locks.write_lock_identifier("x"); }, [&] { locks.unlock_identifier("x"); });
    waitUntil("writer pending on x", [&] { return locks.snapshot().records["x"].users == 2; });
    EXPECT_EQ(locks.snapshot().identifierWriterCount, 1u);
    Holder second([&] { locks.read_lock_all_identifiers(); },
                  [&] { locks.unlock_all_identifiers(); });
    waitUntil("global reader waits", [&] { return locks.snapshot().conditionWaiters == 1; });
    locks.unlock_identifier("x");
    waitUntil("writer holds x", [&] { return writer.acquired(); });
    EXPECT_FALSE(second.acquired());
    writer.release();
    waitUntil("global reader gets in", [&] { return second.acquired(); });
    second.release();
    expectIdle(locks);
}

TEST(QRNLocksGlobal, IdentifierWriterWaitsForGlobalReaders) {
    QRNLocks locks;
    locks.read_lock_all_identifiers();
    Holder writer([&] { locks.write_lock_identifier("x"); }, [&] { locks.unlock_identifier("x"); });
    waitUntil("writer waits", [&] { return locks.snapshot().conditionWaiters == 1; });
    // Not counted until the global lock is free, so readers still get in.
    locks.read_lock_all_identifiers();
    EXPECT_EQ(locks.snapshot().allReaderWriterState, 2);
    locks.unlock_all_identifiers();
    EXPECT_FALSE(writer.acquired());
    locks.unlock_all_identifiers();
    waitUntil("writer gets in", [&] { return writer.acquired(); });
    writer.release();
    expectIdle(locks);
}

// Several threads mixing every kind of lock, identifier arrays in opposite
// orders included: no deadlock, and no two incompatible holders at once.
TEST(QRNLocksStress, MixedTrafficKeepsExclusionAndNeverDeadlocks) {
    QRNLocks locks;
    std::array<std::atomic<int>, 3> readers{}, writers{};
    std::atomic<int> globalReaders{0}, globalWriters{0}, violations{0};
    auto anyIdentifierHolder = [&](bool countReaders) {
        for (int i = 0; i < 3; ++i) {
            if (writers[i] != 0 || (countReaders && readers[i] != 0)) {
                return true;
            }
        }
        return false;
    };
    auto holdIds = [&](const std::vector<int>& which, bool writing) {
        for (int i : which) {
            int mine = ++(writing ? writers : readers)[i];
            bool bad =
                writing ? (mine != 1 || readers[i] != 0 || globalReaders != 0) : writers[i] != 0;
            violations += bad || globalWriters != 0;
        }
        std::this_thread::yield();
        for (int i : which) {
            --(writing ? writers : readers)[i];
        }
    };
    auto work = [&](unsigned seed) {
        std::mt19937 random(seed);
        for (int n = 0; n < 3000; ++n) {
            switch (random() % 6) {
            case 0:
                locks.write_lock_identifier(ids({"b", "a"}));
                holdIds({0, 1}, true);
                locks.unlock_identifier(ids({"b", "a"}));
                break;
            case 1:
                locks.write_lock_identifier(ids({"a", "c", "b"}));
                holdIds({0, 1, 2}, true);
                locks.unlock_identifier(ids({"a", "c", "b"}));
                break;
            case 2:
                locks.read_lock_identifier(ids({"c", "a"}));
                holdIds({0, 2}, false);
                locks.unlock_identifier(ids({"c", "a"}));
                break;
            case 3:
                locks.write_lock_identifier("c");
                holdIds({2}, true);
                locks.unlock_identifier("c");
                break;
            case 4:
                locks.read_lock_all_identifiers();
                ++globalReaders;
                violations += globalWriters != 0 || anyIdentifierHolder(false);
                std::this_thread::yield();
                --globalReaders;
                locks.unlock_all_identifiers();
                break;
            default:
                locks.write_lock_all_identifiers();
                violations +=
                    ++globalWriters != 1 || globalReaders != 0 || anyIdentifierHolder(true);
                std::this_thread::yield();
                --globalWriters;
                locks.unlock_all_identifiers();
            }
        }
    };
    std::vector<std::thread> threads;
    for (unsigned t = 0; t < 4; ++t) {
        threads.emplace_back(work, t + 1);
    }
    for (auto& t : threads) {
        t.join();
    }
    EXPECT_EQ(violations, 0);
    expectIdle(locks);
}

class QRNLocksDeathTest : public ::testing::Test {
protected:
    void SetUp() override { GTEST_FLAG_SET(death_test_style, "threadsafe"); }
    QRNLocks locks;
};

TEST_F(QRNLocksDeathTest, WrongArgumentTypesStopTheProcess) {
    EXPECT_DEATH(locks.read_lock_identifier(Value(std::uint64_t{5})), "Unknown parameter type!");
    EXPECT_DEATH(locks.write_lock_identifier(Value::dictionary()), "Unknown parameter type!");
    EXPECT_DEATH(locks.unlock_identifier(Value()), "Unknown parameter type!");
    EXPECT_DEATH(locks.write_lock_identifier(Value(Value::Array{"a", 7})),
                 "Unknown parameter type!");
}

TEST_F(QRNLocksDeathTest, BrokenBookkeepingStopsTheProcess) {
    EXPECT_DEATH(locks.unlock_identifier("x"),
                 "gQRNLocks\\.identifierToLockMap\\), function unlock_one_lock, file "
                 "Daemon/QRNLocks");
    locks.read_lock_identifier("a");
    locks.unlock_identifier("a");
    EXPECT_DEATH(locks.unlock_identifier("a"), "\\(lockPtr\\), function unlock_one_lock");
    EXPECT_DEATH(locks.unlock_all_identifiers(),
                 "allReaderWriterState > 0\\), function unlock_all_identifiers");
}
