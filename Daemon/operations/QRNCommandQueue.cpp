#include "Daemon/operations/QRNCommandQueue.h"

#include "Daemon/support/Log.h"
#include "Daemon/support/QRNError.h"
#include "Daemon/support/Queue.h"

#include <utility>

namespace quarn {

QRNCommandQueue::QRNCommandQueue()
    : executionQueue_(std::make_unique<Queue>(Queue::ownerLabel("QRNCommandQueue"))) {}

QRNCommandQueue::~QRNCommandQueue() = default;

void QRNCommandQueue::insertCommand(QRNCommandPtr command) {
    if (!command) {
        return;
    }
    QRN_LOG_INFO(LogCategory::Unspecified, "Added command <{}; {}> to queue",
                 static_cast<const void*>(command.get()), command->command());
    std::lock_guard guard(mutex_);
    commands_.push_back(std::move(command));
}

std::size_t QRNCommandQueue::count() const {
    std::lock_guard guard(mutex_);
    return commands_.size();
}

QRNCommandPtr QRNCommandQueue::takeFirst() {
    std::lock_guard guard(mutex_);
    if (commands_.empty()) {
        return nullptr;
    }
    QRNCommandPtr first = std::move(commands_.front());
    commands_.pop_front();
    return first;
}

bool QRNCommandQueue::executeNextCommandWithError(std::uint64_t& error) {
    QRNCommandPtr command = takeFirst();
    if (!command) {
        error = kQRNErrorCommandQueueExhausted;
        return false;
    }
    const void* address = command.get();
    const std::uint64_t kind = command->command();
    // Empty when the queue is not owned by a shared_ptr; commands then have
    // no queue to insert into.
    std::weak_ptr<QRNCommandQueue> self = weak_from_this();
    std::uint64_t code = kQRNErrorNone;
    const bool succeeded = executionQueue_->sync([&] {
        QRN_LOG_INFO(LogCategory::Unspecified, "Executing command <{}; {}>...", address, kind);
        const bool ok = command->fromQueue(self, code);
        QRN_LOG_INFO(LogCategory::Unspecified,
                     "Completed command <{}; {}>: success = {}, error = {}", address, kind,
                     ok ? 1 : 0, code);
        return ok;
    });
    if (!succeeded) {
        error = code;
    }
    return succeeded;
}

bool QRNCommandQueue::executeAllUntilExhaustedOrError(std::uint64_t& error) {
    std::uint64_t code = kQRNErrorNone;
    while (executeNextCommandWithError(code)) {
    }
    if (code == kQRNErrorCommandQueueExhausted) {
        error = kQRNErrorNone;
        return true;
    }
    error = code;
    return false;
}

} // namespace quarn
