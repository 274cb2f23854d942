#include "Client/QRNClientReplies.h"

#include "Client/QRNReplyReader.h"

namespace quarn {

ClientResult<void> QRNClientReplies::status(const Value& reply) {
    const Value* code = reply.get("ReplyError");
    if (!code) {
        return Unexpected(ClientError::badReply("\"ReplyError\" is missing"));
    }
    auto number = code->asUInt64();
    if (!number) {
        return Unexpected(ClientError::badReply("\"ReplyError\" is not an unsigned number"));
    }
    if (*number != kQRNErrorNone) {
        return Unexpected(ClientError::fromCode(*number));
    }
    return {};
}

ClientResult<QRNContainerReply> QRNClientReplies::container(const Value& reply) {
    if (auto ok = status(reply); !ok) {
        return Unexpected(ok.error());
    }
    QRNReplyReader read(reply);
    QRNContainerReply result;
    result.uuid = read.uuid("ReplyUUID");
    result.existed = read.boolean("ReplyExisted");
    result.path = read.string("ReplyPath");
    result.identifier = read.optionalString("ReplyIdentifier").value_or("");
    result.personaUniqueString = read.optionalString("ReplyPersonaUniqueString");
    result.sandboxToken = read.optionalString("ReplySandboxToken");
    return read.finish(std::move(result));
}

ClientResult<QRNContainerList> QRNClientReplies::containerList(const Value& reply) {
    if (auto ok = status(reply); !ok) {
        return Unexpected(ok.error());
    }
    QRNReplyReader read(reply);
    QRNContainerList result;
    result.identifiers = read.strings("ReplyIdsArray");
    result.uuids = read.uuids("ReplyUUIDsArray");
    result.personaUniqueStrings = read.strings("ReplyPersonaUniqueStringsArray");
    if (result.identifiers.size() != result.uuids.size()) {
        return Unexpected(ClientError::badReply("\"ReplyIdsArray\" and \"ReplyUUIDsArray\" "
                                                "differ in length"));
    }
    return read.finish(std::move(result));
}

ClientResult<QRNMetadataReply> QRNClientReplies::metadata(const Value& reply) {
    if (auto ok = status(reply); !ok) {
        return Unexpected(ok.error());
    }
    QRNReplyReader read(reply);
    QRNMetadataReply result;
    result.path = read.string("ReplyPath");
    result.transient = read.optionalBoolean("ReplyTransient").value_or(false);
    if (const Value* info = reply.get("ReplyInfoDictionary")) {
        result.infoDictionary = *info;
    }
    result.sandboxToken = read.optionalString("ReplySandboxToken");
    result.personaUniqueString = read.optionalString("ReplyPersonaUniqueString");
    return read.finish(std::move(result));
}

ClientResult<Value> QRNClientReplies::infoValue(const Value& reply) {
    if (auto ok = status(reply); !ok) {
        return Unexpected(ok.error());
    }
    const Value* value = reply.get("ReplyInfoValue");
    if (!value) {
        return Unexpected(ClientError::badReply("\"ReplyInfoValue\" is missing"));
    }
    return *value;
}

ClientResult<QRNGroupContainers> QRNClientReplies::groupContainers(const Value& reply) {
    if (auto ok = status(reply); !ok) {
        return Unexpected(ok.error());
    }
    QRNReplyReader read(reply);
    QRNGroupContainers result;
    result.paths = read.stringMap("ReplyGroupContainerDict");
    result.sandboxTokens = read.stringMap("ReplySandboxTokenDict");
    result.personaUniqueStrings = read.stringMap("ReplyPersonaUniqueStringDict");
    return read.finish(std::move(result));
}

ClientResult<std::string> QRNClientReplies::path(const Value& reply) {
    if (auto ok = status(reply); !ok) {
        return Unexpected(ok.error());
    }
    QRNReplyReader read(reply);
    auto path = read.string("ReplyPath");
    return read.finish(std::move(path));
}

ClientResult<std::uint64_t> QRNClientReplies::diskUsage(const Value& reply) {
    if (auto ok = status(reply); !ok) {
        return Unexpected(ok.error());
    }
    QRNReplyReader read(reply);
    auto bytes = read.unsignedNumber("ReplyDiskUsage");
    return read.finish(bytes);
}

ClientResult<std::vector<std::string>> QRNClientReplies::strings(const Value& reply,
                                                                 std::string_view key) {
    if (auto ok = status(reply); !ok) {
        return Unexpected(ok.error());
    }
    QRNReplyReader read(reply);
    auto strings = read.strings(key);
    return read.finish(std::move(strings));
}

} // namespace quarn
