#pragma once
// Typed results of the commands, read out of reply dictionaries. Every
// reader first checks "ReplyError": any code but 1 is the result. A reply
// that lacks a key the command promises, or holds it with another type, is
// a BadReply, never a crash.

#include "Client/ClientError.h"
#include "Daemon/support/UUID.h"
#include "Daemon/support/Value.h"

#include <cstdint>
#include <map>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace quarn {

// Command 0.
struct QRNContainerReply {
    UUID uuid;
    bool existed = false;
    std::string path;
    std::string identifier;
    std::optional<std::string> personaUniqueString;
    std::optional<std::string> sandboxToken;
};

// Command 1: parallel arrays; the persona strings may be fewer, as
// containers without one add nothing.
struct QRNContainerList {
    std::vector<std::string> identifiers;
    std::vector<UUID> uuids;
    std::vector<std::string> personaUniqueStrings;
};

// Command 7.
struct QRNMetadataReply {
    std::string path;
    bool transient = false;
    std::optional<Value> infoDictionary;
    std::optional<std::string> sandboxToken;
    std::optional<std::string> personaUniqueString;
};

// Commands 13 and 16, keyed by group identifier.
struct QRNGroupContainers {
    std::map<std::string, std::string> paths;
    std::map<std::string, std::string> sandboxTokens;
    std::map<std::string, std::string> personaUniqueStrings;
};

class QRNClientReplies {
public:
    static ClientResult<void> status(const Value& reply);

    static ClientResult<QRNContainerReply> container(const Value& reply);
    static ClientResult<QRNContainerList> containerList(const Value& reply);
    static ClientResult<QRNMetadataReply> metadata(const Value& reply);
    static ClientResult<Value> infoValue(const Value& reply);
    static ClientResult<QRNGroupContainers> groupContainers(const Value& reply);
    // "ReplyPath" of commands 15 and 17.
    static ClientResult<std::string> path(const Value& reply);
    static ClientResult<std::uint64_t> diskUsage(const Value& reply);
    // "ReplyGroupIdentifiersArray" (14), "ReplyPersonaUniqueStringsArray" (32).
    static ClientResult<std::vector<std::string>> strings(const Value& reply, std::string_view key);
};

} // namespace quarn
