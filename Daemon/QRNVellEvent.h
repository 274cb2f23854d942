#pragma once
// The request protocol: one event of a client connection becomes one call of
// a command handler, and the reply carries "ReplyError" (also on success).

#include "Daemon/platform/IpcConnection.h"

#include <memory>

namespace quarn {

// Called on the connection's strand for every event of a client connection.
void QRNProcessVellEvent(const std::shared_ptr<IpcConnection>& connection,
                         const IpcConnection::Event& event);

} // namespace quarn
