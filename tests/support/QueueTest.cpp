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
#include <mutex>
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

// Counts concurrently running blocks and remembers the peak.
struct Occupancy {
    std::atomic<int> now{0};
    std::atomic<int> peak{0};
    void enter() {
        int n = ++now;
        int p = peak.load();
        while (n > p && !peak.compare_exchange_weak(p, n)) {
        }
    }
    void leave() { --now; }
};

} // namespace

TEST(Queue, SerialKeepsEachProducersOrderAndRunsOneAtATime) {
    constexpr int kProducers = 8, kEach = 500;
    Queue q("serial");
    Occupancy occupancy;
    std::vector<std::pair<int, int>> seen; // touched only on the queue
    std::vector<std::thread> producers;
    for (int p = 0; p < kProducers; ++p) {
        producers.emplace_back([&, p] {
            for (int i = 0; i < kEach; ++i) {
                q.async([&, p, i] {
                    occupancy.enter();
                    seen.emplace_back(p, i);
                    occupancy.leave();
                });
            }
        });
    }
    for (auto& t : producers) {
        t.join();
    }
    auto copy = q.sync([&] { return seen; });
    ASSERT_EQ(copy.size(), std::size_t(kProducers * kEach));
    std::vector<int> next(kProducers, 0);
    for (auto [p, i] : copy) {
        ASSERT_EQ(i, next[p]) << "producer " << p << " reordered";
        ++next[p];
    }
    EXPECT_EQ(occupancy.peak.load(), 1);
}

TEST(Queue, SyncSeesEarlierAsyncWorkAndReturnsOrThrows) {
    Queue q("sync");
    int value = 0;
    for (int i = 0; i < 100; ++i) {
        q.async([&] { ++value; });
    }
    EXPECT_EQ(q.sync([&] { return value; }), 100);
    EXPECT_THROW(q.sync([]() -> int { throw std::runtime_error("boom"); }), std::runtime_error);
    // The queue still works after a block threw through sync.
    EXPECT_EQ(q.sync([&] { return value + 1; }), 101);
}

TEST(Queue, SyncFromAnotherQueueAndFromPlainThreads) {
    Queue a(Queue::ownerLabel("a")), b(Queue::ownerLabel("b"));
    EXPECT_EQ(a.label(), "com.orvex.quarnd.a");
    EXPECT_FALSE(a.isCurrent());
    std::atomic<int> sum{0};
    bool aCurrentInside = false, bCurrentInside = false, bCurrentAfter = true;
    a.sync([&] {
        b.sync([&] {
            aCurrentInside = a.isCurrent(); // the caller's queue stays current
            bCurrentInside = b.isCurrent();
        });
        bCurrentAfter = b.isCurrent();
    });
    EXPECT_TRUE(aCurrentInside);
    EXPECT_TRUE(bCurrentInside);
    EXPECT_FALSE(bCurrentAfter);
    EXPECT_FALSE(a.isCurrent());
    Gate done;
    std::atomic<bool> onWorker{false};
    a.async([&] {
        onWorker = a.isCurrent() && !b.isCurrent();
        done.open();
    });
    ASSERT_TRUE(done.wait());
    EXPECT_TRUE(onWorker);

    std::vector<std::thread> threads;
    for (int t = 0; t < 4; ++t) {
        threads.emplace_back([&] {
            for (int i = 0; i < 50; ++i) {
                a.sync([&] { sum += b.sync([] { return 1; }); });
            }
        });
    }
    for (auto& t : threads) {
        t.join();
    }
    EXPECT_EQ(sum.load(), 200);
}

TEST(Queue, ConcurrentRunsUpToWidthAtOnce) {
    EXPECT_GE(Queue("default", Queue::Kind::Concurrent).width(), 2u);
    constexpr int kWidth = 3;
    Queue q("wide", Queue::Kind::Concurrent, kWidth);
    // Each of the first kWidth blocks waits for all of them: this only
    // finishes when they really run at the same time.
    std::latch together(kWidth);
    for (int i = 0; i < kWidth; ++i) {
        q.async([&] { together.arrive_and_wait(); });
    }
    Occupancy occupancy;
    for (int i = 0; i < 10 * kWidth; ++i) {
        q.async([&] {
            occupancy.enter();
            std::this_thread::yield();
            occupancy.leave();
        });
    }
    q.barrierSync([] {});
    EXPECT_LE(occupancy.peak.load(), kWidth);
}

TEST(Queue, BarrierWaitsForEarlierRunsAloneAndHoldsLater) {
    constexpr int kEarlier = 3, kLater = 3;
    Queue q("barrier", Queue::Kind::Concurrent, 4);
    Gate release;
    std::latch earlierRunning(kEarlier);
    std::atomic<int> earlierDone{0}, laterStarted{0};
    std::atomic<bool> barrierDone{false}, violation{false};
    for (int i = 0; i < kEarlier; ++i) {
        q.async([&] {
            earlierRunning.count_down();
            release.wait();
            ++earlierDone;
        });
    }
    earlierRunning.wait();
    q.barrierAsync([&] {
        if (earlierDone != kEarlier || laterStarted != 0) {
            violation = true;
        }
        barrierDone = true;
    });
    for (int i = 0; i < kLater; ++i) {
        q.async([&] {
            ++laterStarted;
            if (!barrierDone) {
                violation = true;
            }
        });
    }
    release.open();
    q.barrierSync([] {});
    EXPECT_FALSE(violation);
    EXPECT_EQ(laterStarted.load(), kLater);
}

TEST(Queue, SuspendHoldsWorkQueuedBeforeAndAfterAndNests) {
    Queue q("main", Queue::Kind::Manual);
    std::vector<int> order;
    q.async([&] { order.push_back(1); });
    q.suspend();
    q.async([&] { order.push_back(2); });
    q.suspend();
    EXPECT_EQ(q.runPending(), 0u);
    q.resume();
    EXPECT_EQ(q.runPending(), 0u) << "one resume of two suspensions must not release";
    EXPECT_TRUE(order.empty());
    q.resume();
    EXPECT_EQ(q.runPending(), 2u);
    EXPECT_EQ(order, (std::vector<int>{1, 2}));
}

TEST(Queue, SuspendFromInsideLetsTheRunningBlockFinish) {
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
    EXPECT_TRUE(firstFinished);
    EXPECT_TRUE(secondRan);
}

TEST(Queue, DestructionRunsPendingWork) {
    auto owner = std::make_unique<Queue>("drain");
    Queue* q = owner.get(); // blocks use it while the destructor drains
    Gate release;
    std::atomic<int> ran{0};
    q->async([&] { release.wait(); });
    for (int i = 0; i < 100; ++i) {
        q->async([&, i] {
            ++ran;
            if (i == 0) {
                q->async([&] { ++ran; }); // queued while draining
            }
        });
    }
    std::thread releaser([&] { release.open(); });
    owner.reset();
    releaser.join();
    EXPECT_EQ(ran.load(), 101);
}

TEST(Queue, DestroyingASuspendedQueueDiscardsAndFreesHeldBlocks) {
    auto owned = std::make_shared<int>(7);
    bool ran = false;
    {
        Queue q("held", Queue::Kind::Concurrent, 2);
        q.suspend();
        q.async([&ran, owned] { ran = true; });
        q.barrierAsync([owned] {});
        EXPECT_EQ(owned.use_count(), 3);
    }
    EXPECT_FALSE(ran);
    EXPECT_EQ(owned.use_count(), 1);
}

TEST(Queue, ManualQueueRunsOnTheDrivingThread) {
    Queue main("main", Queue::Kind::Manual);
    auto driver = std::this_thread::get_id();
    bool stop = false;
    std::atomic<int> onDriver{0};
    std::thread other([&] {
        for (int i = 0; i < 10; ++i) {
            main.async([&] { onDriver += std::this_thread::get_id() == driver; });
        }
        EXPECT_EQ(main.sync([&] { return main.isCurrent(); }), true);
        main.async([&] { stop = true; });
    });
    main.runUntil([&] { return stop; });
    other.join();
    EXPECT_EQ(onDriver.load(), 10);

    int late = 0;
    {
        Queue lastly("lastly", Queue::Kind::Manual);
        lastly.async([&] { ++late; });
    }
    EXPECT_EQ(late, 1) << "destroying a manual queue runs what it holds";
}

TEST(Queue, BlocksOwnMoveOnlyCapturesUntilTheyFinish) {
    Queue q("owner");
    auto box = std::make_unique<int>(41);
    int seen = 0;
    q.async(
        [&seen, box = std::move(box), t = ProcessTransaction("queued work")] { seen = *box + 1; });
    q.sync([] {});
    EXPECT_EQ(seen, 42);
    // The block's transaction ended before the next block started.
    EXPECT_EQ(ProcessTransaction::count(), 0u);
}

TEST(QueueDeathTest, MisuseStopsTheProcess) {
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    const std::pair<std::function<void()>, const char*> misuses[] = {
        {[] {
             Queue q("self");
             q.sync([&] { q.sync([] {}); });
         },
         "sync onto a queue the caller is already running on"},
        {[] {
             Queue a("a"), b("b");
             a.sync([&] { b.sync([&] { a.sync([] {}); }); });
         },
         "already running on"},
        {[] {
             Queue q("unbalanced");
             q.suspend();
             q.resume();
             q.resume();
         },
         "not suspended"},
        {[] {
             Queue q("elsewhere");
             QRN_ASSERT_ON_QUEUE(q);
         },
         "must run on queue elsewhere"},
    };
    // The fault line is the last word before the abort: show it on stderr.
    for (const auto& [misuse, message] : misuses)
        EXPECT_DEATH(
            {
                Log::addStderr();
                misuse();
            },
            message);
}

TEST(ProcessTransaction, CountsOpenTransactionsOnce) {
    ASSERT_EQ(ProcessTransaction::count(), 0u);
    {
        ProcessTransaction a("a");
        ProcessTransaction b("b");
        EXPECT_EQ(ProcessTransaction::count(), 2u);
        ProcessTransaction moved(std::move(a));
        EXPECT_EQ(ProcessTransaction::count(), 2u) << "moving must not open or end one";
        EXPECT_FALSE(a.isActive());
        b = std::move(moved); // b's own transaction ends, moved's lives on in b
        EXPECT_EQ(ProcessTransaction::count(), 1u);
        b.end();
        b.end();
        EXPECT_EQ(ProcessTransaction::count(), 0u);
    }
    EXPECT_EQ(ProcessTransaction::count(), 0u);
}

TEST(ProcessTransaction, WaitForDrainAnswersWhetherWorkFinished) {
    EXPECT_TRUE(ProcessTransaction::waitForDrain(0ms));
    auto held = std::make_unique<ProcessTransaction>("held");
    EXPECT_FALSE(ProcessTransaction::waitForDrain(0ms));
    Queue background("background");
    Gate finish;
    background.async([&finish, t = std::move(*held)] { finish.wait(); });
    held.reset();
    EXPECT_EQ(ProcessTransaction::count(), 1u);
    finish.open();
    EXPECT_TRUE(ProcessTransaction::waitForDrain(30s));
}
