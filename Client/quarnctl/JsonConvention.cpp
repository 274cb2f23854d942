#include "Client/quarnctl/JsonConvention.h"

#include <sodium.h>

namespace quarn::ctl {

using nlohmann::json;

namespace {

// A first pass that sees the raw number tokens: the parser turns an integer
// too large for 64 bits into a real, which must be refused, not rounded.
class NumberAndDepthCheck {
public:
    std::string problem;

    bool null() { return true; }
    bool boolean(bool) { return true; }
    bool number_integer(json::number_integer_t) { return true; }
    bool number_unsigned(json::number_unsigned_t) { return true; }
    bool number_float(json::number_float_t, const std::string& token) {
        if (token.find_first_of(".eE") == std::string::npos) {
            problem = "integer " + token + " does not fit in 64 bits";
            return false;
        }
        return true;
    }
    bool string(std::string&) { return true; }
    bool binary(json::binary_t&) { return true; }
    bool key(std::string&) { return true; }
    bool start_object(std::size_t) { return enter(); }
    bool end_object() { return leave(); }
    bool start_array(std::size_t) { return enter(); }
    bool end_array() { return leave(); }
    bool parse_error(std::size_t, const std::string&, const json::exception& e) {
        problem = e.what();
        return false;
    }

private:
    bool enter() {
        if (++depth_ > JsonConvention::kMaxNesting) {
            problem = "nested deeper than " + std::to_string(JsonConvention::kMaxNesting);
            return false;
        }
        return true;
    }
    bool leave() {
        --depth_;
        return true;
    }
    std::size_t depth_ = 0;
};

std::string base64(const Value::Data& bytes) {
    std::string out(sodium_base64_ENCODED_LEN(bytes.size(), sodium_base64_VARIANT_ORIGINAL), '\0');
    sodium_bin2base64(out.data(), out.size(), bytes.data(), bytes.size(),
                      sodium_base64_VARIANT_ORIGINAL);
    out.resize(out.size() - 1); // the terminating NUL
    return out;
}

json dateJson(Date date) {
    if (date.microsecondsSince1970 % 1000000 == 0) {
        return date.microsecondsSince1970 / 1000000;
    }
    return static_cast<double>(date.microsecondsSince1970) / 1e6;
}

} // namespace

Result<Value> JsonConvention::parse(std::string_view text) {
    NumberAndDepthCheck check;
    if (!json::sax_parse(text, &check)) {
        return QRN_UNEXPECTED(QRN_ERROR(kQRNErrorInvalidArgument, "not JSON: {}", check.problem));
    }
    return toValue(json::parse(text, nullptr, false));
}

json JsonConvention::toJson(const Value& value) {
    switch (value.kind()) {
    case Value::Kind::None:
        return nullptr;
    case Value::Kind::UInt64:
        return *value.asUInt64();
    case Value::Kind::Int64:
        return json{{"$int", *value.asInt64()}};
    case Value::Kind::Real:
        return *value.asDouble();
    case Value::Kind::Bool:
        return *value.asBool();
    case Value::Kind::String:
        return *value.asString();
    case Value::Kind::Data:
        return json{{"$data", base64(*value.asData())}};
    case Value::Kind::Date:
        return json{{"$date", dateJson(*value.asDate())}};
    case Value::Kind::UUID:
        return json{{"$uuid", value.asUUID()->string()}};
    case Value::Kind::Array: {
        json out = json::array();
        for (const Value& item : *value.asArray()) {
            out.push_back(toJson(item));
        }
        return out;
    }
    case Value::Kind::Dictionary:
        break;
    }
    json out = json::object();
    for (const auto& [key, item] : *value.asDictionary()) {
        out[key.starts_with('$') ? "$" + key : key] = toJson(item);
    }
    return out;
}

namespace {

std::string compact(const json& node) {
    return node.dump(-1, ' ', false, json::error_handler_t::replace);
}

// Like dump(indent), but the one-key objects of the convention stay on one
// line: {"$uuid": "..."} reads as one value.
void printIndented(const json& node, int indent, int depth, std::string& out) {
    if (node.is_object() && node.size() == 1 && node.begin().key().starts_with('$') &&
        !node.begin().key().starts_with("$$")) {
        out += "{" + compact(node.begin().key()) + ": " + compact(node.begin().value()) + "}";
        return;
    }
    if (!node.is_structured() || node.empty()) {
        out += compact(node);
        return;
    }
    const std::string pad(static_cast<std::size_t>(indent * (depth + 1)), ' ');
    out += node.is_object() ? "{\n" : "[\n";
    std::size_t left = node.size();
    for (auto it = node.begin(); it != node.end(); ++it) {
        out += pad;
        if (node.is_object()) {
            out += compact(it.key()) + ": ";
        }
        printIndented(it.value(), indent, depth + 1, out);
        out += --left > 0 ? ",\n" : "\n";
    }
    out += std::string(static_cast<std::size_t>(indent * depth), ' ');
    out += node.is_object() ? "}" : "]";
}

} // namespace

std::string JsonConvention::print(const Value& value, int indent) {
    if (indent < 0) {
        return compact(toJson(value));
    }
    std::string out;
    printIndented(toJson(value), indent, 0, out);
    return out;
}

} // namespace quarn::ctl
