// Command numbers that do no work in this build.

#include "Daemon/service/QRNCommandHandlers.h"

#include "Daemon/support/Log.h"

namespace quarn {

void QRNCommandHandlers::retired(const Value&, QRNVellReply&, QRNClientConnection&,
                                 std::uint64_t& error) {
    error = kQRNErrorInvalidCommand;
}

void QRNCommandHandlers::notAvailable(const Value& request, QRNVellReply&, QRNClientConnection&,
                                      std::uint64_t& error) {
    QRN_LOG_ERROR(LogCategory::Vell, "Command {} is not available in this build",
                  unsignedValue(request, "Command"));
    error = kQRNErrorInvalidCommand;
}

} // namespace quarn
