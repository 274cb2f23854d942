#include "Daemon/support/Queue.h"
#include "Daemon/support/Log.h"
#include "Daemon/support/ProcessTransaction.h"

#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <functional>
#include <future>
#include <latch>
#include <memory>
#include <stdexcept>
#include <thread>
#include <vector>

using namespace quarn;
using namespace std::chrono_literals;

namespace {

// A one-shot gate. Waits are bounded only so that a broken queue fails the
// test instead of hanging it; nothing is measured.
struct Gate {
    std::promise<void> promise;
    std::shared_future<void> future = promise.get_future().share();
    void open() { promise.set_value(); }
    bool wait() const { return future.wait_for(30s) == std::future_status::ready; }
};

} // namespace

TEST(Queue, SerialKeepsEachProducersOrderAndSyncReturnsOrThrowsFromQueuesAndThreads) {
    constexpr int kProducers = 8, kEach = 500;
    Queue q("serial");
    std::vector<int> next(kProducers, 0); // touched only on the queue
    std::atomic<int> reordered{0};
    std::vector<std::jthread> producers;
    for (int p = 0; p < kProducers; ++p)
        producers.emplace_back([&, p] {
            for (int i = 0; i < kEach; ++i)
                q.async([&, p, i] { reordered += next[p]++ != i; });
        });
    producers.clear(); // joins
    // sync sees all earlier work.
    EXPECT_EQ(q.sync([&] { return next; }), std::vector<int>(kProducers, kEach));
    EXPECT_EQ(reordered.load(), 0);

    Queue a("a"), b("b");
    // The caller's queue stays current inside a nested sync.
    auto both = [&] { return a.isCurrent() && b.isCurrent(); };
    EXPECT_TRUE(a.sync([&] { return b.sync(both) && !b.isCurrent(); }));
    EXPECT_FALSE(a.isCurrent());
    std::promise<bool> onWorker;
    a.async([&] { onWorker.set_value(a.isCurrent() && !b.isCurrent()); });
    EXPECT_TRUE(onWorker.get_future().get());
    // What a block throws comes out of sync; the queue goes on working.
    EXPECT_THROW(a.sync([]() -> int { throw std::runtime_error("boom"); }), std::runtime_error);

    std::atomic<int> sum{0};
    std::vector<std::jthread> threads;
    for (int t = 0; t < 4; ++t)
        threads.emplace_back([&] {
            for (int i = 0; i < 50; ++i)
                a.sync([&] { sum += b.sync([] { return 1; }); });
        });
    threads.clear(); // joins
    EXPECT_EQ(sum.load(), 200);
}

// Exactly: the first `width` blocks wait for each other, so they must really
// run at the same time.
TEST(Queue, RunsUpToItsWidthAtOnce) {
    EXPECT_GE(Queue("default", Queue::Kind::Concurrent).width(), 2u);
    for (auto [kind, width] : {std::pair{Queue::Kind::Serial, 1}, {Queue::Kind::Concurrent, 3}}) {
        Queue q("wide", kind, width);
        std::latch together(width);
        std::atomic<int> now{0}, over{0}, full{0};
        for (int i = 0; i < 10 * width; ++i)
            q.async([&, i] {
                int n = ++now;
                over += n > width;
                full += n == width;
                if (i < width)
                    together.arrive_and_wait();
                std::this_thread::yield();
                --now;
            });
        q.barrierSync([] {});
        EXPECT_EQ(over.load(), 0);
        EXPECT_GT(full.load(), 0);
    }
}

TEST(Queue, BarrierWaitsForEarlierRunsAloneAndHoldsLater) {
    Queue q("barrier", Queue::Kind::Concurrent, 4);
    Gate release;
    std::latch earlierRunning(3);
    std::atomic<int> earlierDone{0}, laterStarted{0}, violations{0};
    std::atomic<bool> barrierDone{false};
    for (int i = 0; i < 3; ++i)
        q.async([&] {
            earlierRunning.count_down();
            release.wait();
            ++earlierDone;
        });
    earlierRunning.wait();
    q.barrierAsync([&] {
        violations += earlierDone != 3 || laterStarted != 0;
        barrierDone = true;
    });
    for (int i = 0; i < 3; ++i)
        q.async([&] {
            ++laterStarted;
            violations += !barrierDone;
        });
    release.open();
    q.barrierSync([] {});
    EXPECT_EQ(violations.load(), 0);
    EXPECT_EQ(laterStarted.load(), 3);
}

// A manual queue holds its blocks while suspended (as often as suspended) and
// runs them on the thread that drives it.
TEST(Queue, ManualQueueRunsOnTheDrivingThreadAndSuspendedQueuesHoldTheirWork) {
    Queue main("main", Queue::Kind::Manual);
    std::vector<int> order;
    main.async([&] { order.push_back(1); });
    main.suspend();
    main.async([&] { order.push_back(2); });
    main.suspend();
    EXPECT_EQ(main.runPending(), 0u);
    main.resume();
    EXPECT_EQ(main.runPending(), 0u) << "one resume of two suspensions must not release";
    main.resume();
    EXPECT_EQ(main.runPending(), 2u);
    EXPECT_EQ(order, (std::vector<int>{1, 2}));

    auto driver = std::this_thread::get_id();
    bool stop = false;
    std::atomic<int> onDriver{0};
    std::jthread other([&] {
        for (int i = 0; i < 10; ++i)
            main.async([&] { onDriver += std::this_thread::get_id() == driver; });
        EXPECT_TRUE(main.sync([&] { return main.isCurrent(); }));
        main.async([&] { stop = true; });
    });
    main.runUntil([&] { return stop; });
    other.join();
    EXPECT_EQ(onDriver.load(), 10);

    // Suspending from inside lets the running block finish.
    Queue q("suspended");
    Gate suspended;
    std::atomic<bool> firstFinished{false}, secondRan{false};
    q.async([&] {
        q.suspend();
        q.async([&] { secondRan = true; });
        suspended.open();
        firstFinished = true;
    });
    ASSERT_TRUE(suspended.wait());
    // Blocks running on a worker while suspended would show up here.
    std::this_thread::yield();
    EXPECT_FALSE(secondRan);
    q.resume();
    q.sync([] {});
    EXPECT_TRUE(firstFinished && secondRan);
}

// Destruction waits for what is queued, even what is queued while draining,
// behind a block still running; a suspended queue discards (and frees) it.
TEST(Queue, DestructionRunsQueuedWorkUnlessSuspended) {
    for (auto kind : {Queue::Kind::Serial, Queue::Kind::Concurrent, Queue::Kind::Manual})
        for (bool suspended : {false, true}) {
            SCOPED_TRACE(testing::Message() << "kind " << int(kind) << " suspended " << suspended);
            auto owned = std::make_shared<int>(7);
            std::atomic<int> ran{0};
            Gate release;
            std::jthread releaser;
            {
                Queue q("drain", kind, 2);
                if (suspended)
                    q.suspend();
                q.async([&] { release.wait(); });
                for (int i = 0; i < 100; ++i)
                    q.async([&, i, owned] {
                        ++ran;
                        if (i == 0)
                            q.async([&] { ++ran; }); // queued while draining
                    });
                q.barrierAsync([&ran, owned] { ++ran; });
                releaser = std::jthread([&] { release.open(); });
            }
            EXPECT_EQ(ran.load(), suspended ? 0 : 102);
            EXPECT_EQ(owned.use_count(), 1);
        }
}

TEST(QueueDeathTest, MisuseStopsTheProcess) {
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    Queue a("a"), b("b");
    // The fault line is the last word before the abort.
    const std::pair<std::function<void()>, const char*> misuses[] = {
        {[&] { a.sync([&] { a.sync([] {}); }); },
         "sync onto a queue the caller is already running on"},
        {[&] { a.sync([&] { b.sync([&] { a.sync([] {}); }); }); }, "already running on"},
        {[&] { a.suspend(), a.resume(), a.resume(); }, "not suspended"},
        {[&] { QRN_ASSERT_ON_QUEUE(a); }, "must run on queue a"}};
    for (const auto& [misuse, fault] : misuses)
        EXPECT_DEATH((Log::addStderr(), misuse()), fault);
}

TEST(ProcessTransaction, CountsOpenTransactionsOnceAndDrainsWithTheWorkOwningThem) {
    ASSERT_TRUE(ProcessTransaction::waitForDrain(0ms));
    {
        ProcessTransaction a("a"), b("b");
        EXPECT_EQ(ProcessTransaction::count(), 2u);
        ProcessTransaction moved(std::move(a));
        EXPECT_EQ(ProcessTransaction::count(), 2u) << "moving must not open or end one";
        b = std::move(moved); // b's own transaction ends, moved's lives on in b
        EXPECT_EQ(ProcessTransaction::count(), 1u);
        b.end();
        b.end();
        EXPECT_EQ(ProcessTransaction::count(), 0u);
    }
    EXPECT_EQ(ProcessTransaction::count(), 0u);
    // A block owns its move-only captures until it finishes.
    Queue background("background");
    Gate finish;
    int seen = 0;
    background.async([&, box = std::make_unique<int>(41), t = ProcessTransaction("held")] {
        finish.wait();
        seen = *box + 1;
    });
    EXPECT_FALSE(ProcessTransaction::waitForDrain(0ms));
    finish.open();
    EXPECT_TRUE(ProcessTransaction::waitForDrain(30s));
    EXPECT_EQ(background.sync([&] { return seen; }), 42);
}
