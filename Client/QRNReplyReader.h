#pragma once
// Reads typed keys out of one reply dictionary, remembering the first key
// that is missing or of the wrong type, so a reader can take every key it
// needs and check once at the end.

#include "Client/ClientError.h"
#include "Daemon/support/UUID.h"
#include "Daemon/support/Value.h"

#include <map>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace quarn {

class QRNReplyReader {
public:
    explicit QRNReplyReader(const Value& reply) : reply_(reply) {}

    // Required keys: a default value and a recorded error when missing.
    std::string string(std::string_view key);
    bool boolean(std::string_view key);
    UUID uuid(std::string_view key); // a UUID value or 16 bytes of data
    std::uint64_t unsignedNumber(std::string_view key);

    // Optional keys: none when absent, an error when of another type.
    std::optional<std::string> optionalString(std::string_view key);
    std::optional<bool> optionalBoolean(std::string_view key);
    // Absent reads as empty.
    std::vector<std::string> strings(std::string_view key);
    std::vector<UUID> uuids(std::string_view key);
    std::map<std::string, std::string> stringMap(std::string_view key);

    template <class T> ClientResult<T> finish(T value) const {
        if (error_) {
            return Unexpected(*error_);
        }
        return value;
    }

private:
    const Value* find(std::string_view key, Value::Kind kind, bool required);
    void fail(std::string_view key, std::string_view what);

    const Value& reply_;
    std::optional<ClientError> error_;
};

} // namespace quarn
