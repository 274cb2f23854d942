#pragma once
// The fixed table of the 33 request commands: for each number its handler,
// the entitlement that admits a client, and three flags.

#include "Daemon/support/Value.h"

#include <array>
#include <cstdint>
#include <string_view>

namespace quarn {

class QRNClientConnection;
class QRNVellReply;

// A handler reads its arguments from the request, writes its keys into the
// reply and overwrites `error` (1 on entry) only when it fails.
using QRNCommandHandler = void (*)(const Value& request, QRNVellReply& reply,
                                   QRNClientConnection& client, std::uint64_t& error);

struct QRNCommandTableEntry {
    std::uint64_t command;
    QRNCommandHandler handler;
    std::string_view entitlement;
    // The dispatcher sends the reply; clear for handlers that reply from
    // their own completion.
    bool replyBySender;
    // May run without the command's entitlement, on the client's own identity.
    bool allowsUnentitled;
    // A client without "allowed" brings its "lookup" dictionary.
    bool honoursLookupEntitlement;
};

class QRNCommandTable {
public:
    static constexpr std::size_t kCount = 33;

    static constexpr std::string_view kAllowed = "com.orvex.private.Quarn.allowed";
    static constexpr std::string_view kLookup = "com.orvex.private.Quarn.lookup";
    static constexpr std::string_view kOtherIdLookup = "com.orvex.private.Quarn.otherIdLookup";
    static constexpr std::string_view kWipeContainer = "com.orvex.private.Quarn.wipeContainer";
    static constexpr std::string_view kDeleteContainerContent =
        "com.orvex.private.Quarn.deleteContainerContent";
    static constexpr std::string_view kDataMigration = "com.orvex.private.Quarn.dataMigration";
    static constexpr std::string_view kTestability = "com.orvex.private.Quarn.testability";
    static constexpr std::string_view kStageSharedContent =
        "com.orvex.private.Quarn.stageSharedContent";
    static constexpr std::string_view kUserManagedAssets =
        "com.orvex.private.Quarn.userManagedAssets";

    static const std::array<QRNCommandTableEntry, kCount>& entries();
};

} // namespace quarn
