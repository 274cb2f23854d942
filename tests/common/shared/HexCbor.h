#pragma once
// Request and reply dictionaries as hex text of their CBOR bytes: the form
// in which the test client takes requests on its command line and prints
// replies, one per line, and in which the load tool hands its echo server
// the reply to send.

#include "Daemon/support/QRNError.h"
#include "Daemon/support/Value.h"

#include <string>
#include <string_view>

namespace quarn::test {

class HexCbor {
public:
    static std::string encode(const Value& value);
    // Fails on odd length, non-hex characters, or bytes that do not decode.
    static Result<Value> decode(std::string_view hex);
};

} // namespace quarn::test
