#include "Daemon/platform/CborEncoder.h"

#include "Daemon/platform/CborCodec.h"

#include <cbor.h>

namespace quarn {

namespace {

// The longest head libcbor writes: one initial byte and eight argument bytes.
constexpr std::size_t kMaxHead = 9;

// Runs one libcbor encoder on room for a head at the end of `out`.
template <class Encode> void put(std::vector<std::uint8_t>& out, Encode encode) {
    const std::size_t used = out.size();
    out.resize(used + kMaxHead);
    out.resize(used + encode(out.data() + used, kMaxHead));
}

void putUInt(std::vector<std::uint8_t>& out, std::uint64_t u) {
    put(out, [u](unsigned char* p, std::size_t n) { return cbor_encode_uint(u, p, n); });
}

void putDouble(std::vector<std::uint8_t>& out, double d) {
    put(out, [d](unsigned char* p, std::size_t n) { return cbor_encode_double(d, p, n); });
}

void putTag(std::vector<std::uint8_t>& out, std::uint64_t tag) {
    put(out, [tag](unsigned char* p, std::size_t n) { return cbor_encode_tag(tag, p, n); });
}

template <class Bytes> void putByteString(std::vector<std::uint8_t>& out, const Bytes& bytes) {
    const std::size_t size = bytes.size();
    put(out, [size](unsigned char* p, std::size_t n) {
        return cbor_encode_bytestring_start(size, p, n);
    });
    out.insert(out.end(), bytes.begin(), bytes.end());
}

void putText(std::vector<std::uint8_t>& out, const std::string& text) {
    const std::size_t size = text.size();
    put(out,
        [size](unsigned char* p, std::size_t n) { return cbor_encode_string_start(size, p, n); });
    out.insert(out.end(), text.begin(), text.end());
}

} // namespace

void CborEncoder::append(const Value& value, std::vector<std::uint8_t>& out) {
    switch (value.kind()) {
    case Value::Kind::None:
        put(out, [](unsigned char* p, std::size_t n) { return cbor_encode_null(p, n); });
        return;
    case Value::Kind::UInt64:
        putUInt(out, *value.asUInt64());
        return;
    case Value::Kind::Int64:
        if (const std::int64_t i = *value.asInt64(); i >= 0) {
            putUInt(out, static_cast<std::uint64_t>(i));
        } else {
            // -1 - n, computed without overflow at INT64_MIN.
            const auto n = static_cast<std::uint64_t>(-(i + 1));
            put(out,
                [n](unsigned char* p, std::size_t size) { return cbor_encode_negint(n, p, size); });
        }
        return;
    case Value::Kind::Real:
        putDouble(out, *value.asDouble());
        return;
    case Value::Kind::Bool: {
        const bool b = *value.asBool();
        put(out, [b](unsigned char* p, std::size_t n) { return cbor_encode_bool(b, p, n); });
        return;
    }
    case Value::Kind::String:
        putText(out, *value.asString());
        return;
    case Value::Kind::Data:
        putByteString(out, *value.asData());
        return;
    case Value::Kind::Date:
        putTag(out, CborCodec::kTagDate);
        putDouble(out, value.asDate()->seconds());
        return;
    case Value::Kind::UUID:
        putTag(out, CborCodec::kTagUUID);
        putByteString(out, value.asUUID()->bytes());
        return;
    case Value::Kind::Array:
    case Value::Kind::Dictionary:
        appendContainer(value, out);
        return;
    }
}

void CborEncoder::appendContainer(const Value& value, std::vector<std::uint8_t>& out) {
    if (const auto* array = value.asArray()) {
        const std::size_t count = array->size();
        put(out, [count](unsigned char* p, std::size_t n) {
            return cbor_encode_array_start(count, p, n);
        });
        for (const Value& element : *array) {
            append(element, out);
        }
        return;
    }
    const auto& dictionary = *value.asDictionary();
    const std::size_t count = dictionary.size();
    put(out,
        [count](unsigned char* p, std::size_t n) { return cbor_encode_map_start(count, p, n); });
    for (const auto& [key, element] : dictionary) {
        putText(out, key);
        append(element, out);
    }
}

} // namespace quarn
