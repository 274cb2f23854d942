#include "Daemon/platform/CborDecoder.h"

#include <fmt/format.h>

#include <algorithm>

#include <cmath>
#include <limits>

namespace quarn {

namespace {

// Seconds whose microseconds still fit a signed 64-bit count.
constexpr double kMaxDateSeconds = 9.2e12;

// RFC 3629: no overlong forms, no surrogates, nothing above U+10FFFF.
bool isValidUTF8(const unsigned char* s, std::size_t length) {
    std::size_t i = 0;
    while (i < length) {
        const unsigned char c = s[i];
        std::size_t extra = 0;
        unsigned char low = 0x80;
        unsigned char high = 0xBF;
        if (c < 0x80) {
            ++i;
            continue;
        } else if (c >= 0xC2 && c <= 0xDF) {
            extra = 1;
        } else if (c >= 0xE0 && c <= 0xEF) {
            extra = 2;
            low = c == 0xE0 ? 0xA0 : 0x80;
            high = c == 0xED ? 0x9F : 0xBF;
        } else if (c >= 0xF0 && c <= 0xF4) {
            extra = 3;
            low = c == 0xF0 ? 0x90 : 0x80;
            high = c == 0xF4 ? 0x8F : 0xBF;
        } else {
            return false;
        }
        if (length - i <= extra || s[i + 1] < low || s[i + 1] > high) {
            return false;
        }
        for (std::size_t k = 2; k <= extra; ++k) {
            if ((s[i + k] & 0xC0) != 0x80) {
                return false;
            }
        }
        i += extra + 1;
    }
    return true;
}

} // namespace

void CborDecoder::fail(std::string why) {
    if (failure_.empty()) {
        failure_ = std::move(why);
    }
}

// Takes the slot of the item about to be decoded in the innermost open
// container; the content of a tag uses the slot the tag took.
bool CborDecoder::beginItem() {
    if (!failure_.empty()) {
        return false;
    }
    if (++decodedItems_ > limits_.maxItems) {
        fail(fmt::format("the message holds more than {} items", limits_.maxItems));
        return false;
    }
    if (tag_ != Tag::None || stack_.empty()) {
        return true;
    }
    --stack_.back().remaining;
    --pendingItems_;
    return true;
}

// After beginItem: whether the item being decoded is a map key.
bool CborDecoder::nextIsKey() const {
    return !stack_.empty() && stack_.back().isMap && stack_.back().remaining % 2 == 1;
}

void CborDecoder::finishItem(Value value) {
    if (tag_ != Tag::None) {
        auto tagged = applyTag(std::move(value));
        if (!tagged) {
            return;
        }
        value = std::move(*tagged);
    }
    place(std::move(value));
    // Close every container the item completed, innermost first.
    while (failure_.empty() && !stack_.empty() && stack_.back().remaining == 0) {
        Frame frame = std::move(stack_.back());
        stack_.pop_back();
        place(frame.isMap ? Value(std::move(frame.dictionary)) : Value(std::move(frame.array)));
    }
}

void CborDecoder::place(Value value) {
    if (stack_.empty()) {
        root_ = std::move(value);
        return;
    }
    Frame& frame = stack_.back();
    if (!frame.isMap) {
        frame.array.push_back(std::move(value));
    } else if (frame.remaining % 2 == 1) {
        const std::string* key = value.asString();
        if (key == nullptr) {
            return fail(fmt::format("a map key is a {}, not text", value.kindName()));
        }
        if (frame.dictionary.contains(*key)) {
            // The key itself stays out of the message: it may be a megabyte.
            return fail("a map key appears twice");
        }
        frame.key = *key;
    } else {
        frame.dictionary.emplace(std::move(frame.key), std::move(value));
    }
}

void CborDecoder::openContainer(std::uint64_t count, bool isMap) {
    if (!beginItem()) {
        return;
    }
    if (tag_ != Tag::None) {
        return fail("a tag is over an array or map");
    }
    if (nextIsKey()) {
        return fail("a map key is a container, not text");
    }
    if (stack_.size() >= limits_.maxNesting) {
        return fail(fmt::format("arrays and maps nest deeper than {}", limits_.maxNesting));
    }
    decodedItems_ += CborCodec::kContainerCost - 1; // beginItem counted one
    if (decodedItems_ > limits_.maxItems) {
        return fail(fmt::format("the message holds more than {} items", limits_.maxItems));
    }
    if (count == 0) {
        return finishItem(isMap ? Value::dictionary() : Value::array());
    }
    // Every item still to come takes at least one byte after this head.
    const std::size_t after = inputSize_ - offset_ - 1;
    const std::size_t available = after > pendingItems_ ? after - pendingItems_ : 0;
    if (count > available || (isMap && count > available / 2)) {
        return fail(fmt::format("a {} declares {} entries but {} bytes remain",
                                isMap ? "map" : "array", count, after));
    }
    // Refused before anything is reserved for them.
    const std::size_t budget = limits_.maxItems - std::min(limits_.maxItems, decodedItems_);
    if (count > budget || (isMap && count > budget / 2)) {
        return fail(fmt::format("a {} of {} entries is over the budget of {} items",
                                isMap ? "map" : "array", count, limits_.maxItems));
    }
    Frame frame;
    frame.isMap = isMap;
    frame.remaining = static_cast<std::size_t>(isMap ? count * 2 : count);
    if (!isMap) {
        frame.array.reserve(frame.remaining);
    }
    pendingItems_ += frame.remaining;
    stack_.push_back(std::move(frame));
}

void CborDecoder::beginTag(std::uint64_t tag) {
    if (tag_ != Tag::None) {
        return fail("a tag is over another tag");
    }
    if (!beginItem()) {
        return;
    }
    if (nextIsKey()) {
        return fail("a map key is tagged, not plain text");
    }
    if (tag == CborCodec::kTagDate) {
        tag_ = Tag::Date;
    } else if (tag == CborCodec::kTagUUID) {
        tag_ = Tag::UUID;
    } else {
        fail(fmt::format("tag {} is not supported", tag));
    }
}

std::optional<Value> CborDecoder::applyTag(Value value) {
    const Tag tag = tag_;
    tag_ = Tag::None;
    if (tag == Tag::UUID) {
        const Value::Data* data = value.asData();
        if (data == nullptr || data->size() != UUID::Bytes().size()) {
            fail(fmt::format("tag 37 is over a {} of {} bytes, not 16 bytes", value.kindName(),
                             value.size()));
            return std::nullopt;
        }
        UUID::Bytes bytes;
        std::copy(data->begin(), data->end(), bytes.begin());
        return Value(UUID(bytes));
    }
    const auto seconds = value.kind() == Value::Kind::Bool ? std::nullopt : value.asDouble();
    if (!seconds || !std::isfinite(*seconds) || std::fabs(*seconds) > kMaxDateSeconds) {
        fail(fmt::format("tag 1 is over a {} that is no time", value.kindName()));
        return std::nullopt;
    }
    return Value(Date{std::llround(*seconds * 1e6)});
}

void CborDecoder::onScalar(Value value) {
    if (beginItem()) {
        finishItem(std::move(value));
    }
}

void CborDecoder::onNegInt(std::uint64_t value) {
    if (!beginItem()) {
        return;
    }
    if (value > static_cast<std::uint64_t>(std::numeric_limits<std::int64_t>::max())) {
        return fail(fmt::format("the integer -1-{} is below the signed 64-bit range", value));
    }
    finishItem(Value(-1 - static_cast<std::int64_t>(value)));
}

void CborDecoder::onText(cbor_data data, std::size_t length) {
    if (!beginItem()) {
        return;
    }
    if (!isValidUTF8(data, length)) {
        return fail("a text string is not UTF-8");
    }
    finishItem(Value(std::string(reinterpret_cast<const char*>(data), length)));
}

void CborDecoder::onBytes(cbor_data data, std::size_t length) {
    if (beginItem()) {
        finishItem(Value(Value::Data(data, data + length)));
    }
}

const cbor_callbacks& CborDecoder::callbacks() {
    static const cbor_callbacks table = [] {
        cbor_callbacks c = cbor_empty_callbacks;
        c.uint8 = [](void* ctx, std::uint8_t v) { self(ctx).onScalar(Value(v)); };
        c.uint16 = [](void* ctx, std::uint16_t v) { self(ctx).onScalar(Value(v)); };
        c.uint32 = [](void* ctx, std::uint32_t v) { self(ctx).onScalar(Value(v)); };
        c.uint64 = [](void* ctx, std::uint64_t v) { self(ctx).onScalar(Value(v)); };
        c.negint8 = [](void* ctx, std::uint8_t v) { self(ctx).onNegInt(v); };
        c.negint16 = [](void* ctx, std::uint16_t v) { self(ctx).onNegInt(v); };
        c.negint32 = [](void* ctx, std::uint32_t v) { self(ctx).onNegInt(v); };
        c.negint64 = [](void* ctx, std::uint64_t v) { self(ctx).onNegInt(v); };
        c.string = [](void* ctx, cbor_data d, std::size_t n) { self(ctx).onText(d, n); };
        c.byte_string = [](void* ctx, cbor_data d, std::size_t n) { self(ctx).onBytes(d, n); };
        c.array_start = [](void* ctx, std::size_t n) { self(ctx).openContainer(n, false); };
        c.map_start = [](void* ctx, std::size_t n) { self(ctx).openContainer(n, true); };
        c.tag = [](void* ctx, std::uint64_t tag) { self(ctx).beginTag(tag); };
        c.float2 = [](void* ctx, float f) { self(ctx).onScalar(Value(static_cast<double>(f))); };
        c.float4 = [](void* ctx, float f) { self(ctx).onScalar(Value(static_cast<double>(f))); };
        c.float8 = [](void* ctx, double d) { self(ctx).onScalar(Value(d)); };
        c.boolean = [](void* ctx, bool b) { self(ctx).onScalar(Value(b)); };
        c.null = [](void* ctx) { self(ctx).onScalar(Value()); };
        c.undefined = [](void* ctx) { self(ctx).fail("undefined is not a value"); };
        const auto indefinite = [](void* ctx) { self(ctx).fail("indefinite lengths are refused"); };
        c.byte_string_start = indefinite;
        c.string_start = indefinite;
        c.indef_array_start = indefinite;
        c.indef_map_start = indefinite;
        c.indef_break = indefinite;
        return c;
    }();
    return table;
}

Result<Value> CborDecoder::decode(std::span<const std::uint8_t> bytes) {
    inputSize_ = bytes.size();
    if (bytes.size() > limits_.maxBytes) {
        fail(fmt::format("{} bytes are over the limit of {}", bytes.size(), limits_.maxBytes));
    }
    while (failure_.empty() && !root_) {
        if (offset_ == bytes.size()) {
            fail(fmt::format("the input ends after {} bytes, inside an item", offset_));
            break;
        }
        const auto result =
            cbor_stream_decode(bytes.data() + offset_, bytes.size() - offset_, &callbacks(), this);
        if (result.status == CBOR_DECODER_NEDATA) {
            fail(fmt::format("the input ends inside the item at byte {}", offset_));
        } else if (result.status == CBOR_DECODER_ERROR) {
            fail(fmt::format("the item at byte {} is malformed or reserved", offset_));
        }
        offset_ += result.read;
    }
    if (failure_.empty() && offset_ != bytes.size()) {
        fail(fmt::format("{} bytes follow the value", bytes.size() - offset_));
    }
    if (!failure_.empty()) {
        Error error;
        error.code = kQRNErrorBadRequestArgument;
        error.message = std::move(failure_);
        error.function = "quarn::CborCodec::decode";
        return QRN_UNEXPECTED(std::move(error));
    }
    return std::move(*root_);
}

} // namespace quarn
