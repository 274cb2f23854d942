#include "Client/QRNReplyReader.h"

#include <fmt/format.h>

namespace quarn {

namespace {

std::optional<UUID> uuidOf(const Value& value) {
    if (auto uuid = value.asUUID()) {
        return uuid;
    }
    if (const auto* data = value.asData(); data && data->size() == 16) {
        UUID::Bytes bytes{};
        std::copy(data->begin(), data->end(), bytes.begin());
        return UUID(bytes);
    }
    return std::nullopt;
}

const Value::Array& itemsOf(const Value* array) {
    static const Value::Array kEmpty;
    return array ? *array->asArray() : kEmpty;
}

} // namespace

void QRNReplyReader::fail(std::string_view key, std::string_view what) {
    if (!error_) {
        error_ = ClientError::badReply(fmt::format("\"{}\" {}", key, what));
    }
}

const Value* QRNReplyReader::find(std::string_view key, Value::Kind kind, bool required) {
    const Value* value = reply_.get(key);
    if (!value) {
        if (required) {
            fail(key, "is missing");
        }
        return nullptr;
    }
    if (value->kind() != kind) {
        fail(key, fmt::format("is a {}, not a {}", value->kindName(), Value::kindName(kind)));
        return nullptr;
    }
    return value;
}

std::string QRNReplyReader::string(std::string_view key) {
    const Value* value = find(key, Value::Kind::String, true);
    return value ? *value->asString() : std::string();
}

bool QRNReplyReader::boolean(std::string_view key) {
    const Value* value = find(key, Value::Kind::Bool, true);
    return value && *value->asBool();
}

std::uint64_t QRNReplyReader::unsignedNumber(std::string_view key) {
    const Value* value = reply_.get(key);
    if (!value) {
        fail(key, "is missing");
        return 0;
    }
    auto number = value->asUInt64();
    if (!number) {
        fail(key, fmt::format("is a {}, not an unsigned number", value->kindName()));
    }
    return number.value_or(0);
}

UUID QRNReplyReader::uuid(std::string_view key) {
    const Value* value = reply_.get(key);
    if (!value) {
        fail(key, "is missing");
        return UUID();
    }
    auto uuid = uuidOf(*value);
    if (!uuid) {
        fail(key, fmt::format("is a {}, not a UUID", value->kindName()));
    }
    return uuid.value_or(UUID());
}

std::optional<std::string> QRNReplyReader::optionalString(std::string_view key) {
    const Value* value = find(key, Value::Kind::String, false);
    return value ? std::optional(*value->asString()) : std::nullopt;
}

std::optional<bool> QRNReplyReader::optionalBoolean(std::string_view key) {
    const Value* value = find(key, Value::Kind::Bool, false);
    return value ? value->asBool() : std::nullopt;
}

std::vector<std::string> QRNReplyReader::strings(std::string_view key) {
    std::vector<std::string> out;
    const Value* array = find(key, Value::Kind::Array, false);
    for (const Value& item : itemsOf(array)) {
        if (!item.isString()) {
            fail(key, fmt::format("holds a {} among its strings", item.kindName()));
            return {};
        }
        out.push_back(*item.asString());
    }
    return out;
}

std::vector<UUID> QRNReplyReader::uuids(std::string_view key) {
    std::vector<UUID> out;
    const Value* array = find(key, Value::Kind::Array, false);
    for (const Value& item : itemsOf(array)) {
        auto uuid = uuidOf(item);
        if (!uuid) {
            fail(key, fmt::format("holds a {} among its UUIDs", item.kindName()));
            return {};
        }
        out.push_back(*uuid);
    }
    return out;
}

std::map<std::string, std::string> QRNReplyReader::stringMap(std::string_view key) {
    std::map<std::string, std::string> out;
    const Value* dictionary = find(key, Value::Kind::Dictionary, false);
    if (!dictionary) {
        return out;
    }
    for (const auto& [name, item] : *dictionary->asDictionary()) {
        if (!item.isString()) {
            fail(key, fmt::format("maps \"{}\" to a {}, not a string", name, item.kindName()));
            return {};
        }
        out.emplace(name, *item.asString());
    }
    return out;
}

} // namespace quarn
