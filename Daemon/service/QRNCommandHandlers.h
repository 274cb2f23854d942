#pragma once
// The handlers of the command table, one per command number, and the
// readers of request arguments they share. Every handler has the signature
// of QRNCommandHandler: it writes its reply keys only on success and sets
// `error` only on failure.
//
// Spread over files by concern: +Arguments (request readers and reply
// helpers), +Containers (create or look up, listing, deletion, system
// containers), +Info (one existing container; personas), +Groups (group
// containers of an owner, system groups), QRNCommandHandlers.cpp (numbers
// that do nothing here).

#include "Daemon/model/QRNContainerIdentity.h"
#include "Daemon/model/QRNMetadata.h"
#include "Daemon/support/QRNError.h"
#include "Daemon/support/Value.h"

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

namespace quarn {

class QRNClientConnection;
class QRNVellReply;

class QRNCommandHandlers {
public:
    // --- Containers ---------------------------------------------------------
    static void createOrLookupContainer(const Value& request, QRNVellReply& reply,
                                        QRNClientConnection& client, std::uint64_t& error); // 0
    static void containersWithClass(const Value& request, QRNVellReply& reply,
                                    QRNClientConnection& client, std::uint64_t& error); // 1
    static void stageContainersForDelete(const Value& request, QRNVellReply& reply,
                                         QRNClientConnection& client, std::uint64_t& error); // 3
    // Replies from the deletion pass's completion, exactly once.
    static void deleteContainersOnDeathRow(const Value& request, QRNVellReply& reply,
                                           QRNClientConnection& client, std::uint64_t& error); // 4
    static void deleteContainer(const Value& request, QRNVellReply& reply,
                                QRNClientConnection& client, std::uint64_t& error); // 10
    static void systemContainerPath(const Value& request, QRNVellReply& reply,
                                    QRNClientConnection& client, std::uint64_t& error); // 15

    // --- One existing container; personas --------------------------------
    static void setInfoValue(const Value& request, QRNVellReply& reply, QRNClientConnection& client,
                             std::uint64_t& error); // 5
    static void infoValue(const Value& request, QRNVellReply& reply, QRNClientConnection& client,
                          std::uint64_t& error); // 6
    static void containerMetadata(const Value& request, QRNVellReply& reply,
                                  QRNClientConnection& client, std::uint64_t& error); // 7
    static void recreateDefaultStructure(const Value& request, QRNVellReply& reply,
                                         QRNClientConnection& client,
                                         std::uint64_t& error); // 8, 22
    static void regenerateDirectoryUUID(const Value& request, QRNVellReply& reply,
                                        QRNClientConnection& client, std::uint64_t& error); // 9
    static void diskUsage(const Value& request, QRNVellReply& reply, QRNClientConnection& client,
                          std::uint64_t& error); // 23
    static void personaUniqueStrings(const Value& request, QRNVellReply& reply,
                                     QRNClientConnection& client, std::uint64_t& error); // 32

    // --- Groups -------------------------------------------------------------
    static void groupContainersForOwner(const Value& request, QRNVellReply& reply,
                                        QRNClientConnection& client, std::uint64_t& error); // 13
    static void groupIdentifiersForOwner(const Value& request, QRNVellReply& reply,
                                         QRNClientConnection& client, std::uint64_t& error); // 14
    static void systemGroupContainersForOwner(const Value& request, QRNVellReply& reply,
                                              QRNClientConnection& client,
                                              std::uint64_t& error); // 16
    static void systemGroupContainerPath(const Value& request, QRNVellReply& reply,
                                         QRNClientConnection& client, std::uint64_t& error); // 17

    // --- Numbers without work here ---------------------------------------
    // Always 49: the number is kept so that the numbering stays stable.
    static void retired(const Value& request, QRNVellReply& reply, QRNClientConnection& client,
                        std::uint64_t& error); // 27
    // 49 with "Command <n> is not available in this build".
    static void notAvailable(const Value& request, QRNVellReply& reply, QRNClientConnection& client,
                             std::uint64_t& error);

    // --- Request readers ------------------------------------------------------
    // Typed reads: a value of another type counts as absent. Numbers are
    // read only from unsigned values, booleans only from booleans.
    static const std::string* stringValue(const Value& request, std::string_view key);
    static std::uint64_t unsignedValue(const Value& request, std::string_view key);
    static bool boolValue(const Value& request, std::string_view key);
    // A UUID value or 16 bytes of data; none for anything else.
    static std::optional<UUID> uuidValue(const Value* value);

    // The string under `key`; when the key is absent, the client's bundle
    // identifier. No identifier (or one that is no string): 18.
    static CodeResult<std::string> identifierFromRequest(const Value& request,
                                                         const QRNClientConnection& client,
                                                         std::string_view key = "Identifier");
    // Identifier (18), a class in 1..13 (20), and the persona the container
    // lives in.
    static CodeResult<QRNContainerIdentityPtr>
    identityFromRequest(const Value& request, QRNClientConnection& client,
                        std::string_view identifierKey = "Identifier",
                        std::string_view classKey = "ContainerClass");
    // Identifier (18), class and, when "UUID" is given, the UUID that names
    // one directory; always in the client's own user identity.
    static CodeResult<QRNContainerIdentityPtr>
    concreteIdentityFromRequest(const Value& request, const QRNClientConnection& client);

    // --- Reply helpers --------------------------------------------------------
    // "ReplyPersonaUniqueString" when the container's user identity has one,
    // and a sandbox token under `tokenKey` when the client gets one.
    static void addPersonaAndToken(QRNVellReply& reply, const QRNClientConnection& client,
                                   const QRNMetadata& metadata, std::string_view tokenKey);
    // Copies a failed operation's code into the request's error.
    static void setError(std::uint64_t& error, std::uint64_t code) {
        if (code != kQRNErrorNone) {
            error = code;
        }
    }
};

} // namespace quarn
