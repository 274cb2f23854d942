#pragma once
// Work queues: serial and concurrent queues of blocks, with barriers,
// suspension and synchronous submission.
//
// A serial queue runs one block at a time in submission order. A concurrent
// queue starts its blocks in submission order but runs up to `width` of them
// at once; a barrier block waits for everything before it, runs alone, and
// holds everything after it until it is done. Threads are made on demand: a
// serial queue uses at most one, a concurrent queue at most `width`. They stay
// until the queue is destroyed.
//
// A manual queue is a serial queue without threads of its own: an external
// thread (the daemon's main thread) runs its blocks through `runUntil` or
// `runPending`.
//
// Destruction waits until every queued block has run (a manual queue runs them
// on the destroying thread). A suspended queue that is destroyed discards the
// blocks it holds without running them.

#include <concepts>
#include <condition_variable>
#include <cstddef>
#include <deque>
#include <exception>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <thread>
#include <type_traits>
#include <utility>
#include <vector>

namespace quarn {

class Queue {
public:
    enum class Kind { Serial, Concurrent, Manual };

    // A move-only callable, so blocks may own what they capture (a
    // ProcessTransaction, a Signpost).
    class Block {
    public:
        Block() = default;
        template <class F>
        requires(!std::same_as<std::decay_t<F>, Block> && std::invocable<std::decay_t<F>&>)
            Block(F&& fn)
            : impl_(std::make_unique<Impl<std::decay_t<F>>>(std::forward<F>(fn))) {}
        void operator()() { impl_->call(); }
        explicit operator bool() const { return impl_ != nullptr; }

    private:
        struct Base {
            virtual ~Base() = default;
            virtual void call() = 0;
        };
        template <class F> struct Impl final : Base {
            explicit Impl(F&& f) : fn(std::move(f)) {}
            explicit Impl(const F& f) : fn(f) {}
            void call() override { fn(); }
            F fn;
        };
        std::unique_ptr<Base> impl_;
    };

    // "com.orvex.quarnd." + owner.
    static std::string ownerLabel(std::string_view owner);

    // `width` is used by concurrent queues only; 0 chooses the hardware
    // concurrency (at least 2).
    explicit Queue(std::string label, Kind kind = Kind::Serial, std::size_t width = 0);
    ~Queue();
    Queue(const Queue&) = delete;
    Queue& operator=(const Queue&) = delete;

    const std::string& label() const { return label_; }
    Kind kind() const { return kind_; }
    std::size_t width() const { return width_; }

    void async(Block block) { submit(std::move(block), false); }
    // On a serial queue the same as async.
    void barrierAsync(Block block) { submit(std::move(block), true); }

    // Runs `fn` on the queue and waits for it; returns its result and
    // rethrows what it throws. Calling it from a block of this queue (or from
    // a block that a block of this queue is waiting for) would deadlock: that
    // is a programming error and stops the process.
    template <class F> auto sync(F&& fn) -> std::invoke_result_t<F&> {
        return syncWith(std::forward<F>(fn), false);
    }
    template <class F> auto barrierSync(F&& fn) -> std::invoke_result_t<F&> {
        return syncWith(std::forward<F>(fn), true);
    }

    // Balanced: while the count is above zero no block starts (blocks
    // already running finish). Resuming more often than suspending stops the
    // process.
    void suspend();
    void resume();

    // Whether the calling thread is running a block of this queue, directly
    // or through a chain of sync calls.
    bool isCurrent() const;
    // Stops the process with a fault naming `function` unless isCurrent().
    void assertCurrent(const char* function) const;

    // Manual queues only. Runs blocks on the calling thread as they become
    // runnable until `done` answers true; `done` is asked before waiting and
    // after each block, so whatever makes it true should be a block on this
    // queue (or be followed by one).
    void runUntil(const std::function<bool()>& done);
    // Manual queues only. Runs every block that can start now (and those
    // they queue), then returns how many ran.
    std::size_t runPending();

private:
    struct Frame;
    struct Item {
        Block block;
        bool barrier = false;
        bool* done = nullptr;          // set when finished (sync)
        const Frame* caller = nullptr; // the sync caller's chain
    };

    template <class F> auto syncWith(F&& fn, bool barrier) -> std::invoke_result_t<F&> {
        using R = std::invoke_result_t<F&>;
        std::exception_ptr thrown;
        if constexpr (std::is_void_v<R>) {
            runSync([&] { capture(thrown, fn); }, barrier);
            rethrowIf(thrown);
        } else {
            std::optional<R> result;
            runSync([&] { capture(thrown, [&] { result.emplace(fn()); }); }, barrier);
            rethrowIf(thrown);
            return std::move(*result);
        }
    }
    template <class G> static void capture(std::exception_ptr& thrown, G&& g) {
        try {
            g();
        } catch (...) {
            thrown = std::current_exception();
        }
    }
    static void rethrowIf(const std::exception_ptr& thrown) {
        if (thrown) {
            std::rethrow_exception(thrown);
        }
    }

    void submit(Block block, bool barrier);
    void runSync(Block block, bool barrier);
    bool canStartLocked() const;
    void runHeadLocked(std::unique_lock<std::mutex>& lock);
    void startWorkersLocked();
    void workerLoop();
    [[noreturn]] void fault(const char* what) const;

    static thread_local const Frame* tCurrentFrame;

    const std::string label_;
    const Kind kind_;
    const std::size_t width_;

    // Guards every member below.
    mutable std::mutex mutex_;
    std::condition_variable workCV_; // a block may be able to start, or stopping
    std::condition_variable doneCV_; // a block finished, or the queue was resumed
    std::deque<Item> pending_;
    std::size_t running_ = 0; // blocks started and not finished
    std::size_t workers_ = 0; // live worker threads
    bool barrierRunning_ = false;
    int suspendCount_ = 0;
    bool stopping_ = false;
    std::vector<std::thread> threads_;
};

} // namespace quarn

// For `_onQueue_` methods: stops the process unless running on `queue`.
#define QRN_ASSERT_ON_QUEUE(queue) (queue).assertCurrent(__PRETTY_FUNCTION__)
