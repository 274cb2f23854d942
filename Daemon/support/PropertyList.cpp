#include "Daemon/support/PropertyList.h"

#include "Daemon/support/PropertyListBytes.h"

#include <cmath>
#include <cstdlib>
#include <limits>

#define QRN_GENERAL_ERROR(code, ...)                                                               \
    ::quarn::Error::make(::quarn::Error::Domain::General, code, fmt::format(__VA_ARGS__),          \
                         __PRETTY_FUNCTION__, __LINE__)

namespace quarn {

namespace {

constexpr std::int64_t kMicroseconds = 1000000;
// Property-list dates count from 2001-01-01 00:00:00 UTC.
constexpr std::int64_t kEpoch2001 = 978307200 * kMicroseconds;
const PropertyListLimits kLimits;

struct FreeDeleter {
    void operator()(void* p) const { std::free(p); }
};
template <class T> using MallocPtr = std::unique_ptr<T, FreeDeleter>;

// One node encoded alone, for the details libplist's accessors lose.
std::vector<std::uint8_t> encodeAlone(plist_t node) {
    PropertyListPtr copy(plist_copy(node));
    char* bin = nullptr;
    std::uint32_t length = 0;
    plist_to_bin(copy.get(), &bin, &length);
    std::vector<std::uint8_t> bytes(bin, bin + (bin ? length : 0));
    plist_to_bin_free(bin);
    return bytes;
}

// libplist 2.2 keeps integers in one 64-bit field: a signed 8-byte integer
// and an unsigned 16-byte one look the same through its accessor.
Value integerValue(plist_t node) {
    std::uint64_t v = 0;
    plist_get_uint_val(node, &v);
    if (v <= static_cast<std::uint64_t>(std::numeric_limits<std::int64_t>::max()) ||
        binaryTopObjectIsWideInteger(encodeAlone(node))) {
        return Value(v);
    }
    return Value(static_cast<std::int64_t>(v));
}

// plist_new_uint makes every value a signed 64-bit integer; only libplist's
// XML reader makes the 128-bit form that keeps values above INT64_MAX positive.
PropertyListPtr wideUnsignedNode(std::uint64_t v) {
    std::string xml = fmt::format("<plist><integer>{}</integer></plist>", v);
    plist_t node = nullptr;
    plist_from_xml(xml.data(), static_cast<std::uint32_t>(xml.size()), &node);
    return PropertyListPtr(node);
}

// libplist's date accessor truncates microseconds and loses the sign of
// dates less than a second before 2001; the encoding holds the exact value.
Result<Value> dateValue(plist_t node) {
    auto seconds = binaryTopObjectDate(encodeAlone(node));
    constexpr double kLimit = 9.0e12; // seconds: far beyond any real date, safely in range
    if (!seconds || !std::isfinite(*seconds) || std::fabs(*seconds) > kLimit) {
        return QRN_UNEXPECTED(QRN_GENERAL_ERROR(kGeneralErrorPropertyListReadCorrupt,
                                                "Property list date out of range"));
    }
    return Value(Date{std::llround(*seconds * 1e6) + kEpoch2001});
}

Result<PropertyListPtr> dateNode(Date date) {
    std::int64_t micros = date.microsecondsSince1970;
    std::int64_t relative = 0;
    if (!__builtin_sub_overflow(micros, kEpoch2001, &relative)) {
        std::int64_t seconds = relative / kMicroseconds; // both parts share the sign
        std::int64_t fraction = relative % kMicroseconds;
        if (seconds >= std::numeric_limits<std::int32_t>::min() &&
            seconds <= std::numeric_limits<std::int32_t>::max()) {
            return PropertyListPtr(plist_new_date(static_cast<std::int32_t>(seconds),
                                                  static_cast<std::int32_t>(fraction)));
        }
    }
    return QRN_UNEXPECTED(QRN_GENERAL_ERROR(kGeneralErrorPropertyListWriteInvalid,
                                            "Date {} us is out of the writable range", micros));
}

Result<PropertyListPtr> stringNode(const std::string& s) {
    if (s.find('\0') != std::string::npos) {
        return QRN_UNEXPECTED(QRN_GENERAL_ERROR(kGeneralErrorPropertyListWriteInvalid,
                                                "A property-list string cannot hold NUL"));
    }
    return PropertyListPtr(plist_new_string(s.c_str()));
}

Result<PropertyListPtr> toNode(const Value& value, std::size_t depth);

Result<PropertyListPtr> arrayNode(const Value::Array& array, std::size_t depth) {
    PropertyListPtr node(plist_new_array());
    for (const auto& element : array) {
        auto child = toNode(element, depth + 1);
        if (!child) {
            return QRN_UNEXPECTED(child.error());
        }
        plist_array_append_item(node.get(), child->release());
    }
    return node;
}

Result<PropertyListPtr> dictionaryNode(const Value::Dictionary& dictionary, std::size_t depth) {
    PropertyListPtr node(plist_new_dict());
    for (const auto& [key, element] : dictionary) {
        if (key.find('\0') != std::string::npos) {
            return QRN_UNEXPECTED(QRN_GENERAL_ERROR(kGeneralErrorPropertyListWriteInvalid,
                                                    "A property-list key cannot hold NUL"));
        }
        auto child = toNode(element, depth + 1);
        if (!child) {
            return QRN_UNEXPECTED(child.error());
        }
        plist_dict_set_item(node.get(), key.c_str(), child->release());
    }
    return node;
}

Result<PropertyListPtr> toNode(const Value& value, std::size_t depth) {
    if (depth > kLimits.maxDepth) {
        return QRN_UNEXPECTED(QRN_GENERAL_ERROR(kGeneralErrorPropertyListWriteInvalid,
                                                "Value nested too deeply for a property list"));
    }
    switch (value.kind()) {
    case Value::Kind::UInt64: {
        std::uint64_t u = *value.asUInt64();
        if (u > static_cast<std::uint64_t>(std::numeric_limits<std::int64_t>::max())) {
            return wideUnsignedNode(u);
        }
        return PropertyListPtr(plist_new_uint(u));
    }
    case Value::Kind::Int64: // two's complement: the binary form reads it back as signed
        return PropertyListPtr(plist_new_uint(static_cast<std::uint64_t>(*value.asInt64())));
    case Value::Kind::Real:
        return PropertyListPtr(plist_new_real(*value.asDouble()));
    case Value::Kind::Bool:
        return PropertyListPtr(plist_new_bool(*value.asBool() ? 1 : 0));
    case Value::Kind::String:
        return stringNode(*value.asString());
    case Value::Kind::Data: {
        const auto& data = *value.asData();
        return PropertyListPtr(
            plist_new_data(reinterpret_cast<const char*>(data.data()), data.size()));
    }
    case Value::Kind::Date:
        return dateNode(*value.asDate());
    case Value::Kind::UUID:
        return PropertyListPtr(plist_new_string(value.asUUID()->string().c_str()));
    case Value::Kind::Array:
        return arrayNode(*value.asArray(), depth);
    case Value::Kind::Dictionary:
        return dictionaryNode(*value.asDictionary(), depth);
    case Value::Kind::None:
        break;
    }
    return QRN_UNEXPECTED(QRN_GENERAL_ERROR(kGeneralErrorPropertyListWriteInvalid,
                                            "A {} value has no property-list form",
                                            value.kindName()));
}

Result<Value> fromNode(plist_t node, std::size_t depth);

Result<Value> arrayValue(plist_t node, std::size_t depth) {
    Value::Array array;
    plist_array_iter raw = nullptr;
    plist_array_new_iter(node, &raw);
    MallocPtr<void> iter(raw);
    while (true) {
        plist_t item = nullptr;
        plist_array_next_item(node, iter.get(), &item);
        if (!item) {
            return Value(std::move(array));
        }
        auto element = fromNode(item, depth + 1);
        if (!element) {
            return element;
        }
        array.push_back(std::move(*element));
    }
}

Result<Value> dictionaryValue(plist_t node, std::size_t depth) {
    Value::Dictionary dictionary;
    plist_dict_iter raw = nullptr;
    plist_dict_new_iter(node, &raw);
    MallocPtr<void> iter(raw);
    while (true) {
        char* rawKey = nullptr;
        plist_t item = nullptr;
        plist_dict_next_item(node, iter.get(), &rawKey, &item);
        MallocPtr<char> key(rawKey);
        if (!item) {
            return Value(std::move(dictionary));
        }
        auto element = fromNode(item, depth + 1);
        if (!element) {
            return element;
        }
        dictionary.insert_or_assign(key ? std::string(key.get()) : std::string(),
                                    std::move(*element));
    }
}

Result<Value> scalarValue(plist_t node) {
    std::uint64_t length = 0;
    switch (plist_get_node_type(node)) {
    case PLIST_BOOLEAN: {
        std::uint8_t b = 0;
        plist_get_bool_val(node, &b);
        return Value(b != 0);
    }
    case PLIST_UINT:
        return integerValue(node);
    case PLIST_REAL: {
        double d = 0;
        plist_get_real_val(node, &d);
        return Value(d);
    }
    case PLIST_STRING: {
        const char* s = plist_get_string_ptr(node, &length);
        return Value(std::string(s ? s : "", s ? length : 0));
    }
    case PLIST_KEY: {
        char* raw = nullptr;
        plist_get_key_val(node, &raw);
        MallocPtr<char> key(raw);
        return Value(std::string(key ? key.get() : ""));
    }
    case PLIST_DATA: {
        auto* p = reinterpret_cast<const std::uint8_t*>(plist_get_data_ptr(node, &length));
        return Value(p ? Value::Data(p, p + length) : Value::Data());
    }
    case PLIST_DATE:
        return dateValue(node);
    default:
        return QRN_UNEXPECTED(QRN_GENERAL_ERROR(kGeneralErrorPropertyListReadCorrupt,
                                                "Unsupported property-list node type {}",
                                                static_cast<int>(plist_get_node_type(node))));
    }
}

// The converter and the checker refuse a node with the same error.
Error missingOrTooDeep() {
    return QRN_GENERAL_ERROR(kGeneralErrorPropertyListReadCorrupt,
                             "Property list missing a node or too deep");
}

Result<Value> fromNode(plist_t node, std::size_t depth) {
    if (!node || depth > kLimits.maxDepth) {
        return QRN_UNEXPECTED(missingOrTooDeep());
    }
    switch (plist_get_node_type(node)) {
    case PLIST_ARRAY:
        return arrayValue(node, depth);
    case PLIST_DICT:
        return dictionaryValue(node, depth);
    default:
        return scalarValue(node);
    }
}

Status checkNode(plist_t node, std::size_t depth);

// Children walked with libplist's iterators: indexed access walks a list.
Status checkArray(plist_t node, std::size_t depth) {
    plist_array_iter raw = nullptr;
    plist_array_new_iter(node, &raw);
    MallocPtr<void> iter(raw);
    for (;;) {
        plist_t item = nullptr;
        plist_array_next_item(node, iter.get(), &item);
        if (!item) {
            return {};
        }
        if (auto checked = checkNode(item, depth + 1); !checked) {
            return checked;
        }
    }
}

Status checkDictionary(plist_t node, std::size_t depth) {
    plist_dict_iter raw = nullptr;
    plist_dict_new_iter(node, &raw);
    MallocPtr<void> iter(raw);
    for (;;) {
        plist_t item = nullptr;
        plist_dict_next_item(node, iter.get(), nullptr, &item);
        if (!item) {
            return {};
        }
        if (auto checked = checkNode(item, depth + 1); !checked) {
            return checked;
        }
    }
}

// Fails exactly where fromNode fails, with the same errors.
Status checkNode(plist_t node, std::size_t depth) {
    if (!node || depth > kLimits.maxDepth) {
        return QRN_UNEXPECTED(missingOrTooDeep());
    }
    switch (plist_get_node_type(node)) {
    case PLIST_ARRAY:
        return checkArray(node, depth);
    case PLIST_DICT:
        return checkDictionary(node, depth);
    case PLIST_BOOLEAN:
    case PLIST_UINT:
    case PLIST_REAL:
    case PLIST_STRING:
    case PLIST_KEY:
    case PLIST_DATA:
        return {};
    default: {
        auto scalar = scalarValue(node); // dates and the refused types
        return scalar ? Status() : QRN_UNEXPECTED(scalar.error());
    }
    }
}

} // namespace

Result<PropertyListPtr> propertyListFromValue(const Value& value) {
    return toNode(value, 1);
}

Result<Value> valueFromPropertyList(plist_t node) {
    return fromNode(node, 1);
}

Status checkPropertyList(plist_t node) {
    return checkNode(node, 1);
}

Result<PropertyListPtr> propertyListFromBytes(std::span<const std::uint8_t> bytes) {
    std::optional<std::string> problem;
    if (bytes.empty()) {
        problem = "no data";
    } else if (bytes.size() > std::numeric_limits<std::uint32_t>::max()) {
        problem = "too large";
    } else {
        problem = propertyListBytesProblem(bytes, kLimits);
    }
    plist_t root = nullptr;
    if (!problem) {
        plist_from_memory(reinterpret_cast<const char*>(bytes.data()),
                          static_cast<std::uint32_t>(bytes.size()), &root);
        if (!root) {
            problem = "not a property list";
        }
    }
    if (problem) {
        return QRN_UNEXPECTED(QRN_GENERAL_ERROR(
            kGeneralErrorPropertyListReadCorrupt,
            "The data couldn't be read because it isn't in the correct format: {}", *problem));
    }
    return PropertyListPtr(root);
}

Result<Value> valueFromPropertyListBytes(std::span<const std::uint8_t> bytes) {
    auto root = propertyListFromBytes(bytes);
    if (!root) {
        return QRN_UNEXPECTED(root.error());
    }
    return fromNode(root->get(), 1);
}

Result<std::vector<std::uint8_t>> binaryPropertyList(const Value& value) {
    auto node = toNode(value, 1);
    if (!node) {
        return QRN_UNEXPECTED(node.error());
    }
    char* bin = nullptr;
    std::uint32_t length = 0;
    plist_to_bin(node->get(), &bin, &length);
    if (!bin || length == 0) {
        plist_to_bin_free(bin);
        return QRN_UNEXPECTED(QRN_GENERAL_ERROR(kGeneralErrorPropertyListWriteInvalid,
                                                "Failed to encode a binary property list"));
    }
    std::vector<std::uint8_t> bytes(bin, bin + length);
    plist_to_bin_free(bin);
    return bytes;
}

} // namespace quarn
