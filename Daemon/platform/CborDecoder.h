#pragma once
// Builds a Value from CBOR bytes through libcbor's streaming decoder. Each
// callback adds one item to the containers still open; a container is
// reserved only once the input is shown long enough to hold what it
// declares, so a forged length cannot make the decoder allocate.

#include "Daemon/platform/CborCodec.h"

#include <cbor.h>

#include <optional>
#include <string>
#include <vector>

namespace quarn {

class CborDecoder {
public:
    explicit CborDecoder(const CborCodec::Limits& limits) : limits_(limits) {}

    // The refusal reasons are not logged here: decoding is a pure function
    // of the bytes, and the caller says in its own words what it refused.
    Result<Value> decode(std::span<const std::uint8_t> bytes);

private:
    struct Frame {
        bool isMap = false;
        std::size_t remaining = 0; // items still to come; a map entry is two
        Value::Array array;
        Value::Dictionary dictionary;
        std::string key;
    };
    enum class Tag { None, Date, UUID };

    CborCodec::Limits limits_;
    std::size_t inputSize_ = 0;
    std::size_t offset_ = 0;       // where the item being decoded starts
    std::size_t pendingItems_ = 0; // `remaining` summed over `stack_`
    std::size_t decodedItems_ = 0; // counted against limits_.maxItems
    std::vector<Frame> stack_;
    std::optional<Value> root_;
    Tag tag_ = Tag::None;
    std::string failure_; // why the input is refused; empty while it is fine

    void fail(std::string why);
    bool beginItem();
    bool nextIsKey() const;
    void finishItem(Value value);
    void place(Value value);
    void openContainer(std::uint64_t count, bool isMap);
    void beginTag(std::uint64_t tag);
    std::optional<Value> applyTag(Value value);

    void onScalar(Value value);
    void onNegInt(std::uint64_t value);
    void onText(cbor_data data, std::size_t length);
    void onBytes(cbor_data data, std::size_t length);

    static const cbor_callbacks& callbacks();
    static CborDecoder& self(void* context) { return *static_cast<CborDecoder*>(context); }
};

} // namespace quarn
