#include "Daemon/support/ProcessTransaction.h"

#include "Daemon/support/Log.h"

#include <condition_variable>
#include <mutex>

namespace quarn {

namespace {

struct Counter {
    std::mutex mutex;                // guards open
    std::condition_variable drained; // signalled when open reaches zero
    std::size_t open = 0;
};

Counter& counter() {
    static Counter* instance = new Counter(); // never destroyed: transactions may end during exit
    return *instance;
}

} // namespace

ProcessTransaction::ProcessTransaction(std::string name) : name_(std::move(name)) {
    auto& c = counter();
    std::size_t open;
    {
        std::lock_guard lock(c.mutex);
        open = ++c.open;
    }
    QRN_LOG_DEBUG(LogCategory::Unspecified, "Began transaction {} ({} open)", name_, open);
}

ProcessTransaction::ProcessTransaction(ProcessTransaction&& other) noexcept
    : name_(std::move(other.name_)), active_(other.active_) {
    other.active_ = false;
}

ProcessTransaction& ProcessTransaction::operator=(ProcessTransaction&& other) noexcept {
    if (this != &other) {
        end();
        name_ = std::move(other.name_);
        active_ = other.active_;
        other.active_ = false;
    }
    return *this;
}

void ProcessTransaction::end() {
    if (!active_) {
        return;
    }
    active_ = false;
    auto& c = counter();
    std::size_t open;
    {
        std::lock_guard lock(c.mutex);
        open = --c.open;
        if (open == 0) {
            c.drained.notify_all();
        }
    }
    QRN_LOG_DEBUG(LogCategory::Unspecified, "Ended transaction {} ({} open)", name_, open);
}

std::size_t ProcessTransaction::count() {
    auto& c = counter();
    std::lock_guard lock(c.mutex);
    return c.open;
}

bool ProcessTransaction::waitForDrain(std::chrono::milliseconds timeout) {
    auto& c = counter();
    std::unique_lock lock(c.mutex);
    return c.drained.wait_for(lock, timeout, [&] { return c.open == 0; });
}

} // namespace quarn
