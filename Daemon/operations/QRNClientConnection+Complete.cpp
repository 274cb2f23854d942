// Running the commands a request queued, after its handler and before its
// reply.

#include "Daemon/operations/QRNClientConnection.h"

#include "Daemon/operations/QRNCommandQueue.h"

namespace quarn {

bool QRNClientConnection::completeWithError(std::uint64_t& error) {
    if (!commandQueue_) {
        return true;
    }
    // Only a failing command changes the request's code: draining an empty
    // queue must not turn the handler's failure into a success.
    std::uint64_t code = kQRNErrorNone;
    if (commandQueue_->executeAllUntilExhaustedOrError(code)) {
        return true;
    }
    error = code;
    return false;
}

} // namespace quarn
