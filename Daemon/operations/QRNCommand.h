#pragma once
// Work a request queues to run after its handler and before its reply:
// staged deletes and code-signing bookkeeping. Commands run one at a time on
// their queue's execution queue; see QRNCommandQueue.

#include <cstdint>
#include <memory>

namespace quarn {

class QRNCommandQueue;

// Kind numbers, shown in the queue's log lines.
enum QRNCommandKind : std::uint64_t {
    kQRNCommandStageForDelete = 1,
};

class QRNCommand {
public:
    virtual ~QRNCommand() = default;

    // The kind of the command's class.
    virtual std::uint64_t command() const = 0;

    // Runs the command. `queue` is the queue running it (held weakly: the
    // queue owns its commands); a command may insert further commands into
    // it. `error` starts at 1; on failure the command sets it and answers
    // false.
    virtual bool fromQueue(const std::weak_ptr<QRNCommandQueue>& queue, std::uint64_t& error) = 0;
};

using QRNCommandPtr = std::shared_ptr<QRNCommand>;

} // namespace quarn
