#include "Daemon/operations/QRNLocks.h"

#include "common/LogCapture.h"

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
    return Value(Value::Array(list.begin(), list.end()));
}

enum class Kind { Read, Write, GlobalRead, GlobalWrite };

void take(QRNLocks& locks, Kind kind, const Value& identifier) {
    kind == Kind::Read         ? locks.read_lock_identifier(identifier)
    : kind == Kind::Write      ? locks.write_lock_identifier(identifier)
    : kind == Kind::GlobalRead ? locks.read_lock_all_identifiers()
                               : locks.write_lock_all_identifiers();
}

void drop(QRNLocks& locks, Kind kind, const Value& identifier) {
    kind == Kind::Read || kind == Kind::Write ? locks.unlock_identifier(identifier)
                                              : locks.unlock_all_identifiers();
}

// Waits for a state another thread reaches; a lock that never lets it happen
// ends the test process with the reason rather than hanging it.
void waitUntil(const char* what, const std::function<bool()>& reached) {
    for (int waited = 0; !reached(); ++waited) {
        if (waited > 60000) {
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
    Holder(QRNLocks& locks, Kind kind, Value identifier = {})
        : thread_([this, &locks, kind, identifier, go = release_.get_future()] {
              take(locks, kind, identifier);
              acquired_ = true;
              go.wait();
              drop(locks, kind, identifier);
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
    EXPECT_EQ(s.identifierReaderCount + s.identifierWriterCount, 0u);
    EXPECT_EQ(s.conditionWaiters, 0u);
    EXPECT_TRUE(s.records.empty());
}

std::uint64_t waiters(const QRNLocks& locks) {
    return locks.snapshot().conditionWaiters;
}

// Every test ends with nothing held, nothing waiting and no record left.
class QRNLocksTest : public ::testing::Test {
protected:
    void TearDown() override { expectIdle(locks); }
    QRNLocks locks;
};

} // namespace

TEST_F(QRNLocksTest, ArraysAreLockedInAscendingOrderAndDuplicatesOnce) {
    // A second write lock on "a" by this thread would never be granted.
    locks.write_lock_identifier(ids({"b", "a", "b", "a"}));
    auto s = locks.snapshot();
    EXPECT_EQ(s.identifierWriterCount, 2u);
    ASSERT_EQ(s.records.size(), 2u);
    EXPECT_EQ(s.records["a"].users, 1u);
    EXPECT_EQ(s.records["a"].lockState, -1);
    locks.unlock_identifier(ids({"a", "b", "a"}));
    expectIdle(locks);

    locks.read_lock_identifier(ids({"x", "y", "x"}));
    EXPECT_EQ(locks.snapshot().records["x"].lockState, 1);
    locks.read_lock_identifier("x");
    EXPECT_EQ(locks.snapshot().records["x"].lockState, 2);
    locks.unlock_identifier(ids({"y", "x", "x"}));
    EXPECT_EQ(locks.lockRecordCount(), 1u) << "x is still held once";
    locks.unlock_identifier("x");
    EXPECT_EQ(locks.lockRecordCount(), 0u);
    locks.write_lock_identifier("x"); // a fresh record, not a stale one
    EXPECT_EQ(locks.snapshot().records["x"].users, 1u);
    locks.unlock_identifier("x");
    locks.read_lock_identifier(Value::array());

    // Arrays are locked in ascending order.
    locks.write_lock_identifier("b");
    Holder h(locks, Kind::Write, ids({"b", "a"}));
    waitUntil("array locker queues on b", [&] { return locks.snapshot().records["b"].users == 2; });
    // It got to "b" only after taking "a".
    EXPECT_EQ(locks.snapshot().records["a"].lockState, -1);
    EXPECT_FALSE(h.acquired());
    locks.unlock_identifier("b");
    waitUntil("array locker gets both", [&] { return h.acquired(); });
    h.release();

    // Holds are marked in the log from lock to unlock.
    test::LogCapture log;
    auto ends = [&](std::string_view name) {
        auto lines = log.messages();
        return std::count_if(lines.begin(), lines.end(), [&](const std::string& line) {
            return line.starts_with(std::string(name) + " [") && line.find("] end") != line.npos;
        });
    };
    locks.read_lock_identifier(ids({"x", "y"}));
    locks.read_lock_all_identifiers();
    EXPECT_EQ(ends("WaitingForReadLockWithIdentifier"), 1);
    EXPECT_TRUE(log.contains("uuid=")) << log.all();
    EXPECT_EQ(ends("ReadLockWithIdentifier") + ends("GlobalReadLock"), 0);
    locks.unlock_identifier("x");
    EXPECT_EQ(ends("ReadLockWithIdentifier"), 1);
    locks.unlock_identifier("y");
    locks.unlock_all_identifiers();
    EXPECT_EQ(ends("ReadLockWithIdentifier") + ends("GlobalReadLock"), 3);
}

TEST_F(QRNLocksTest, GlobalAndIdentifierLocksWaitForEachOther) {
    // A global writer waits for identifier holders and holds off new ones.
    locks.read_lock_identifier("x");
    {
        Holder global(locks, Kind::GlobalWrite);
        waitUntil("global writer waits", [&] { return waiters(locks) == 1; });
        EXPECT_FALSE(global.acquired());
        locks.unlock_identifier("x");
        waitUntil("global writer gets in", [&] { return global.acquired(); });
        Holder reader(locks, Kind::Read, "y");
        Holder writer(locks, Kind::Write, "z");
        waitUntil("both identifier lockers wait", [&] { return waiters(locks) == 2; });
        EXPECT_FALSE(reader.acquired() || writer.acquired());
        global.release();
        waitUntil("identifier lockers get in",
                  [&] { return reader.acquired() && writer.acquired(); });
    }

    // A global reader shares with identifier readers only; a writer queued
    // behind the reader of "x" already keeps new global readers out.
    locks.read_lock_identifier("x");
    {
        Holder first(locks, Kind::GlobalRead);
        waitUntil("global reader beside an identifier reader", [&] { return first.acquired(); });
    }
    {
        Holder writer(locks, Kind::Write, "x");
        waitUntil("writer pending on x", [&] { return locks.snapshot().records["x"].users == 2; });
        Holder second(locks, Kind::GlobalRead);
        waitUntil("global reader waits", [&] { return waiters(locks) == 1; });
        locks.unlock_identifier("x");
        waitUntil("writer holds x", [&] { return writer.acquired(); });
        EXPECT_FALSE(second.acquired());
        writer.release();
        waitUntil("global reader gets in", [&] { return second.acquired(); });
    }

    // An identifier writer waits for global readers, and is not counted
    // until the global lock is free, so readers still get in.
    locks.read_lock_all_identifiers();
    Holder writer(locks, Kind::Write, "x");
    waitUntil("writer waits", [&] { return waiters(locks) == 1; });
    locks.read_lock_all_identifiers();
    locks.unlock_all_identifiers();
    EXPECT_FALSE(writer.acquired());
    locks.unlock_all_identifiers();
    waitUntil("writer gets in", [&] { return writer.acquired(); });
}

// Threads mixing every kind of lock, identifier arrays in opposite orders
// included: no deadlock, and never two incompatible holders at once.
TEST_F(QRNLocksTest, MixedTrafficKeepsExclusionAndNeverDeadlocks) {
    // Slots 0..2 stand for "a", "b", "c", slot 3 for the global lock. An
    // identifier lock also reads slot 3; a global lock takes every slot in
    // its mode. Reader/writer exclusion per slot is then the table above.
    struct Op {
        Kind kind;
        Value identifiers;
        std::vector<int> slots;
    };
    const std::vector<Op> ops = {{Kind::Write, ids({"b", "a"}), {0, 1, 3}},
                                 {Kind::Write, ids({"a", "c", "b"}), {0, 1, 2, 3}},
                                 {Kind::Read, ids({"c", "a"}), {0, 2, 3}},
                                 {Kind::Write, "c", {2, 3}},
                                 {Kind::GlobalRead, {}, {0, 1, 2, 3}},
                                 {Kind::GlobalWrite, {}, {0, 1, 2, 3}}};
    std::array<std::atomic<int>, 4> readers{}, writers{};
    std::atomic<int> violations{0};
    auto work = [&](unsigned seed) {
        std::mt19937 random(seed);
        for (int n = 0; n < 3000; ++n) {
            const Op& op = ops[random() % ops.size()];
            auto writes = [&op](int slot) {
                return op.kind == Kind::GlobalWrite || (op.kind == Kind::Write && slot != 3);
            };
            take(locks, op.kind, op.identifiers);
            for (int slot : op.slots) {
                int mine = ++(writes(slot) ? writers : readers)[slot];
                violations += writes(slot) ? mine != 1 || readers[slot] != 0 : writers[slot] != 0;
            }
            std::this_thread::yield();
            for (int slot : op.slots) {
                --(writes(slot) ? writers : readers)[slot];
            }
            drop(locks, op.kind, op.identifiers);
        }
    };
    {
        std::vector<std::jthread> threads;
        for (unsigned t = 1; t <= 4; ++t) {
            threads.emplace_back(work, t);
        }
    }
    EXPECT_EQ(violations, 0);
}

class QRNLocksDeathTest : public QRNLocksTest {
protected:
    void SetUp() override { GTEST_FLAG_SET(death_test_style, "threadsafe"); }
};

TEST_F(QRNLocksDeathTest, WrongArgumentTypesAndBrokenBookkeepingStopTheProcess) {
    EXPECT_DEATH(locks.read_lock_identifier(Value(std::uint64_t{5})), "Unknown parameter type!");
    EXPECT_DEATH(locks.unlock_identifier(Value()), "Unknown parameter type!");
    EXPECT_DEATH(locks.write_lock_identifier(Value(Value::Array{"a", 7})),
                 "Unknown parameter type!");
    EXPECT_DEATH(locks.unlock_identifier("x"),
                 "gQRNLocks\\.identifierToLockMap\\), function unlock_one_lock, file "
                 "Daemon/QRNLocks");
    locks.read_lock_identifier("a");
    locks.unlock_identifier("a");
    EXPECT_DEATH(locks.unlock_identifier("a"), "\\(lockPtr\\), function unlock_one_lock");
    EXPECT_DEATH(locks.unlock_all_identifiers(),
                 "allReaderWriterState > 0\\), function unlock_all_identifiers");
}
