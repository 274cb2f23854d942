// JSON to Value: plain types map directly, one-key "$" objects carry the
// types JSON lacks.

#include "Client/quarnctl/JsonConvention.h"

#include <sodium.h>

#include <cmath>
#include <limits>

namespace quarn::ctl {

using nlohmann::json;

namespace {

Result<Value> refuse(std::string message) {
    return QRN_UNEXPECTED(QRN_ERROR(kQRNErrorInvalidArgument, "{}", message));
}

Result<Value> uuidValue(const json& text) {
    auto uuid = text.is_string() ? UUID::parse(text.get_ref<const std::string&>()) : std::nullopt;
    if (!uuid) {
        return refuse("\"$uuid\" needs UUID text such as \"E621E1F8-C36C-495A-93FC-0C247A3E6E5F\", "
                      "got " +
                      text.dump());
    }
    return Value(*uuid);
}

Result<Value> dataValue(const json& text) {
    if (!text.is_string()) {
        return refuse("\"$data\" needs a base64 string");
    }
    const auto& encoded = text.get_ref<const std::string&>();
    Value::Data bytes(encoded.size() / 4 * 3 + 3);
    std::size_t length = 0;
    const char* end = nullptr;
    if (sodium_base642bin(bytes.data(), bytes.size(), encoded.data(), encoded.size(), nullptr,
                          &length, &end, sodium_base64_VARIANT_ORIGINAL) != 0 ||
        end != encoded.data() + encoded.size()) {
        return refuse("\"$data\" is not base64: " + text.dump());
    }
    bytes.resize(length);
    return Value(std::move(bytes));
}

Result<Value> dateValue(const json& seconds) {
    // Microseconds must fit a signed 64-bit number.
    constexpr double kLimit = 9.2e12;
    if (!seconds.is_number() || !std::isfinite(seconds.get<double>()) ||
        std::fabs(seconds.get<double>()) > kLimit) {
        return refuse("\"$date\" needs seconds since 1970 within +-9.2e12, got " + seconds.dump());
    }
    if (seconds.is_number_float()) {
        return Value(Date{std::llround(seconds.get<double>() * 1e6)});
    }
    // Integers exactly, without a detour through a double.
    auto whole = seconds.is_number_unsigned()
                     ? static_cast<std::int64_t>(seconds.get<std::uint64_t>())
                     : seconds.get<std::int64_t>();
    return Value(Date{whole * 1000000});
}

Result<Value> intValue(const json& number) {
    if (number.is_number_integer() && !number.is_number_unsigned()) {
        return Value(number.get<std::int64_t>());
    }
    if (number.is_number_unsigned() &&
        number.get<std::uint64_t>() <=
            static_cast<std::uint64_t>(std::numeric_limits<std::int64_t>::max())) {
        return Value(static_cast<std::int64_t>(number.get<std::uint64_t>()));
    }
    return refuse("\"$int\" needs an integer within signed 64 bits, got " + number.dump());
}

Result<Value> specialValue(const std::string& key, const json& inner) {
    if (key == "$uuid") {
        return uuidValue(inner);
    }
    if (key == "$data") {
        return dataValue(inner);
    }
    if (key == "$date") {
        return dateValue(inner);
    }
    if (key == "$int") {
        return intValue(inner);
    }
    return refuse("unknown key \"" + key + "\" (a key starting with \"$\" is written \"$" + key +
                  "\")");
}

bool isSpecial(const std::string& key) {
    return key.starts_with('$') && !key.starts_with("$$");
}

Result<Value> convert(const json& node, std::size_t depth);

Result<Value> objectValue(const json& object, std::size_t depth) {
    if (object.size() == 1 && isSpecial(object.begin().key())) {
        return specialValue(object.begin().key(), object.begin().value());
    }
    Value::Dictionary dictionary;
    for (const auto& [key, item] : object.items()) {
        if (isSpecial(key)) {
            return refuse("\"" + key + "\" must be the only key of its object");
        }
        auto value = convert(item, depth + 1);
        if (!value) {
            return value;
        }
        dictionary.emplace(key.starts_with('$') ? key.substr(1) : key, std::move(*value));
    }
    return Value(std::move(dictionary));
}

Result<Value> convert(const json& node, std::size_t depth) {
    if (depth > JsonConvention::kMaxNesting) {
        return refuse("nested deeper than " + std::to_string(JsonConvention::kMaxNesting));
    }
    switch (node.type()) {
    case json::value_t::null:
        return Value();
    case json::value_t::boolean:
        return Value(node.get<bool>());
    case json::value_t::number_unsigned:
        return Value(node.get<std::uint64_t>());
    case json::value_t::number_integer: {
        auto number = node.get<std::int64_t>();
        return number < 0 ? Value(number) : Value(static_cast<std::uint64_t>(number));
    }
    case json::value_t::number_float:
        return Value(node.get<double>());
    case json::value_t::string:
        return Value(node.get<std::string>());
    case json::value_t::array: {
        Value::Array array;
        for (const auto& item : node) {
            auto value = convert(item, depth + 1);
            if (!value) {
                return value;
            }
            array.push_back(std::move(*value));
        }
        return Value(std::move(array));
    }
    case json::value_t::object:
        return objectValue(node, depth);
    default:
        return refuse("unsupported JSON value " + node.dump());
    }
}

} // namespace

Result<Value> JsonConvention::toValue(const nlohmann::json& json) {
    return convert(json, 0);
}

} // namespace quarn::ctl
