#pragma once
// The request protocol: one event of a client connection becomes one call of
// a command handler, and the reply carries "ReplyError" (also on success).

#include "Daemon/operations/QRNClientIdentity.h"
#include "Daemon/platform/IpcConnection.h"

#include <cstdint>
#include <memory>

namespace quarn {

class QRNClientConnection;
class QRNClientIdentityCache;
class QRNCommandQueue;
struct QRNCommandTableEntry;

// Called on the connection's thread for every event of a client connection.
// `identities` holds the identity of the connection's process.
void QRNProcessVellEvent(const std::shared_ptr<IpcConnection>& connection,
                         const IpcConnection::Event& event, QRNClientIdentityCache& identities);
// The same with the connection's process identified afresh.
void QRNProcessVellEvent(const std::shared_ptr<IpcConnection>& connection,
                         const IpcConnection::Event& event);

// Settles the client's rights for one command from its entitlements and
// makes the request's client connection, or nothing (error 55) when the
// client is not admitted. A null identity has no rights at all.
std::shared_ptr<QRNClientConnection> checkEntitlementsAndInitClientObject(
    const QRNClientIdentityPtr& identity, const QRNCommandTableEntry& entry,
    const std::shared_ptr<QRNCommandQueue>& commandQueue, std::uint64_t& error);

} // namespace quarn
