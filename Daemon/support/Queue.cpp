#include "Daemon/support/Queue.h"

#include "Daemon/support/Log.h"

#include <pthread.h>

#include <algorithm>
#include <cstdlib>

namespace quarn {

// The queues the calling thread is running blocks of, innermost first. A
// block run for a sync call links to its caller's chain, so the caller's
// queues still count as current inside it.
struct Queue::Frame {
    const Queue* queue;
    const Frame* outer;
};

namespace {

std::size_t defaultWidth() {
    return std::max<std::size_t>(2, std::thread::hardware_concurrency());
}

} // namespace

thread_local const Queue::Frame* Queue::tCurrentFrame = nullptr;

std::string Queue::ownerLabel(std::string_view owner) {
    return "com.orvex.quarnd." + std::string(owner);
}

Queue::Queue(std::string label, Kind kind, std::size_t width)
    : label_(std::move(label)), kind_(kind),
      width_(kind == Kind::Concurrent ? (width ? width : defaultWidth()) : 1) {}

Queue::~Queue() {
    std::deque<Item> discarded;
    std::vector<std::thread> threads;
    {
        std::unique_lock lock(mutex_);
        if (isCurrent()) {
            fault("queue destroyed by one of its own blocks");
        }
        stopping_ = true;
        workCV_.notify_all();
        if (kind_ == Kind::Manual) {
            while (canStartLocked()) {
                runHeadLocked(lock);
            }
        } else {
            doneCV_.wait(lock,
                         [&] { return running_ == 0 && (pending_.empty() || suspendCount_ > 0); });
        }
        discarded.swap(pending_); // what a suspension still holds
        workCV_.notify_all();
        threads.swap(threads_);
    }
    for (auto& t : threads) {
        t.join();
    }
}

void Queue::submit(Block block, bool barrier) {
    std::lock_guard lock(mutex_);
    pending_.push_back(Item{std::move(block), barrier, nullptr, nullptr});
    startWorkersLocked();
}

void Queue::runSync(Block block, bool barrier) {
    if (isCurrent()) {
        fault("sync onto a queue the caller is already running on");
    }
    bool done = false;
    std::unique_lock lock(mutex_);
    pending_.push_back(Item{std::move(block), barrier, &done, tCurrentFrame});
    startWorkersLocked();
    doneCV_.wait(lock, [&] { return done; });
}

void Queue::suspend() {
    std::lock_guard lock(mutex_);
    ++suspendCount_;
}

void Queue::resume() {
    std::lock_guard lock(mutex_);
    if (suspendCount_ == 0) {
        fault("resume of a queue that is not suspended");
    }
    if (--suspendCount_ == 0) {
        startWorkersLocked();
        workCV_.notify_all();
        doneCV_.notify_all();
    }
}

bool Queue::isCurrent() const {
    for (const Frame* f = tCurrentFrame; f; f = f->outer) {
        if (f->queue == this) {
            return true;
        }
    }
    return false;
}

void Queue::assertCurrent(const char* function) const {
    if (!isCurrent()) {
        QRN_LOG_FAULT(LogCategory::Unspecified, "{} must run on queue {}", function, label_);
        std::abort();
    }
}

void Queue::runUntil(const std::function<bool()>& done) {
    if (kind_ != Kind::Manual || isCurrent()) {
        fault("runUntil needs a manual queue that the caller is not running");
    }
    std::unique_lock lock(mutex_);
    while (true) {
        lock.unlock();
        bool finished = done();
        lock.lock();
        if (finished) {
            return;
        }
        if (canStartLocked()) {
            runHeadLocked(lock);
        } else {
            workCV_.wait(lock);
        }
    }
}

std::size_t Queue::runPending() {
    if (kind_ != Kind::Manual || isCurrent()) {
        fault("runPending needs a manual queue that the caller is not running");
    }
    std::unique_lock lock(mutex_);
    std::size_t count = 0;
    while (canStartLocked()) {
        runHeadLocked(lock);
        ++count;
    }
    return count;
}

bool Queue::canStartLocked() const {
    if (pending_.empty() || suspendCount_ > 0 || barrierRunning_) {
        return false;
    }
    return pending_.front().barrier ? running_ == 0 : running_ < width_;
}

void Queue::runHeadLocked(std::unique_lock<std::mutex>& lock) {
    Item item = std::move(pending_.front());
    pending_.pop_front();
    ++running_;
    barrierRunning_ = item.barrier;
    if (canStartLocked()) {
        workCV_.notify_one(); // a concurrent queue can start the next one too
    }
    lock.unlock();

    Frame frame{this, item.done ? item.caller : tCurrentFrame};
    const Frame* saved = tCurrentFrame;
    tCurrentFrame = &frame;
    try {
        item.block();
    } catch (const std::exception& e) {
        fault(e.what());
    } catch (...) {
        fault("unknown exception");
    }
    tCurrentFrame = saved;
    item.block = Block(); // what the block owns ends before it counts as done

    lock.lock();
    --running_;
    barrierRunning_ = false;
    if (item.done) {
        *item.done = true;
    }
    doneCV_.notify_all();
    if (canStartLocked()) {
        workCV_.notify_one();
    }
}

void Queue::startWorkersLocked() {
    if (kind_ == Kind::Manual || suspendCount_ > 0) {
        workCV_.notify_one();
        return;
    }
    std::size_t idle = workers_ - running_;
    std::size_t wanted = pending_.size() > idle ? pending_.size() - idle : 0;
    std::size_t spawn = std::min(wanted, width_ - workers_);
    for (std::size_t i = 0; i < spawn; ++i) {
        ++workers_;
        threads_.emplace_back([this] { workerLoop(); });
    }
    workCV_.notify_one();
}

void Queue::workerLoop() {
    // Thread names hold 15 characters: keep the distinctive end of the label.
    std::string name = label_.size() > 15 ? label_.substr(label_.size() - 15) : label_;
    pthread_setname_np(pthread_self(), name.c_str());

    std::unique_lock lock(mutex_);
    while (true) {
        if (canStartLocked()) {
            runHeadLocked(lock);
        } else if (stopping_ && (pending_.empty() || suspendCount_ > 0)) {
            --workers_;
            return;
        } else {
            workCV_.wait(lock);
        }
    }
}

void Queue::fault(const char* what) const {
    QRN_LOG_FAULT(LogCategory::Unspecified, "Queue {}: {}", label_, what);
    std::abort();
}

} // namespace quarn
