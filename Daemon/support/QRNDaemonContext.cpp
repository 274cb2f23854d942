#include "Daemon/support/QRNDaemonContext.h"

namespace quarn {

namespace {
std::mutex gCurrentMutex; // guards gCurrent and the stores to gCurrentRaw
std::shared_ptr<QRNDaemonContext> gCurrent;
// gCurrent's object, for readers that take no lock (every shared-instance
// accessor on every request).
std::atomic<QRNDaemonContext*> gCurrentRaw{nullptr};
std::atomic<std::size_t> gNextSlot{0};
} // namespace

std::size_t QRNDaemonContext::nextSlot() {
    return gNextSlot.fetch_add(1);
}

QRNDaemonContext& QRNDaemonContext::current() {
    if (QRNDaemonContext* context = gCurrentRaw.load(std::memory_order_acquire)) {
        return *context;
    }
    std::lock_guard guard(gCurrentMutex);
    if (!gCurrent) {
        gCurrent = std::make_shared<QRNDaemonContext>("/");
        gCurrentRaw.store(gCurrent.get(), std::memory_order_release);
    }
    return *gCurrent;
}

bool QRNDaemonContext::hasCurrent() {
    std::lock_guard guard(gCurrentMutex);
    return gCurrent != nullptr;
}

void QRNDaemonContext::setCurrent(std::shared_ptr<QRNDaemonContext> context) {
    std::lock_guard guard(gCurrentMutex);
    gCurrent = std::move(context);
    gCurrentRaw.store(gCurrent.get(), std::memory_order_release);
}

} // namespace quarn
