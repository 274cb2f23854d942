#include "Daemon/support/QRNDaemonContext.h"

namespace quarn {

namespace {
std::mutex gCurrentMutex; // guards gCurrent
std::shared_ptr<QRNDaemonContext> gCurrent;
} // namespace

QRNDaemonContext& QRNDaemonContext::current() {
    std::lock_guard guard(gCurrentMutex);
    if (!gCurrent) {
        gCurrent = std::make_shared<QRNDaemonContext>("/");
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
}

} // namespace quarn
