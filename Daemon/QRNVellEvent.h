#pragma once
// The request protocol: one event of a client connection becomes one call of
// a command handler, and the reply carries "ReplyError" (also on success).

#include "Daemon/QRNClientIdentity.h"
#include "Daemon/platform/IpcConnection.h"

#include <cstdint>
#include <memory>

namespace quarn {

class QRNClientConnection;
class QRNCommandQueue;
struct QRNCommandTableEntry;

// Called on the connection's strand for every event of a client connection.
void QRNProcessVellEvent(const std::shared_ptr<IpcConnection>& connection,
                         const IpcConnection::Event& event);

// Settles the client's rights for one command from its entitlements and
// makes the request's client connection, or nothing (error 55) when the
// client is not admitted. A null identity has no rights at all.
std::shared_ptr<QRNClientConnection> checkEntitlementsAndInitClientObject(
    const QRNClientIdentityPtr& identity, const QRNCommandTableEntry& entry,
    const std::shared_ptr<QRNCommandQueue>& commandQueue, std::uint64_t& error);

} // namespace quarn
