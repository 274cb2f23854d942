#pragma once
// The commands one request queued, first in, first out. Handlers (and the
// code-signing mapping) insert from any thread; the connection's
// completeWithError drains the queue before the reply goes out.
//
// Execution is synchronous for the caller and serialised on the queue's own
// serial queue. Insertion takes only the array's mutex, never the execution
// queue, so a running command may insert more commands into its own queue;
// draining goes on until the queue is empty.

#include "Daemon/operations/QRNCommand.h"

#include <cstdint>
#include <deque>
#include <memory>
#include <mutex>

namespace quarn {

class Queue;

// The code of executeNextCommandWithError when no command is left. Not a
// failure to anyone but the queue itself, so not among the reply codes.
inline constexpr std::uint64_t kQRNErrorCommandQueueExhausted = 77;

class QRNCommandQueue : public std::enable_shared_from_this<QRNCommandQueue> {
public:
    QRNCommandQueue();
    ~QRNCommandQueue();
    QRNCommandQueue(const QRNCommandQueue&) = delete;
    QRNCommandQueue& operator=(const QRNCommandQueue&) = delete;

    void insertCommand(QRNCommandPtr command);

    // Runs the first command. None left: false with error 77. A failing
    // command: false with its code; the commands behind it stay queued.
    bool executeNextCommandWithError(std::uint64_t& error);
    // Runs commands until none is left (true, error 1) or one fails (false,
    // its code).
    bool executeAllUntilExhaustedOrError(std::uint64_t& error);

    std::size_t count() const;

private:
    QRNCommandPtr takeFirst();

    // Guards commands_ only; never held while a command runs.
    mutable std::mutex mutex_;
    std::deque<QRNCommandPtr> commands_;
    // "com.orvex.quarnd.QRNCommandQueue": where commands run, one at a time.
    std::unique_ptr<Queue> executionQueue_;
};

} // namespace quarn
