#pragma once
// Values as JSON, for `quarnctl raw` and `--json`. JSON has fewer types than
// a Value, so the types it lacks are one-key objects:
//
//   plain integer >= 0      unsigned 64-bit
//   {"$int": -5}            signed 64-bit (a plain negative integer is signed too)
//   1.5, 2.0                real (a number written with a point or exponent)
//   {"$uuid": "E621E1F8-C36C-495A-93FC-0C247A3E6E5F"}
//   {"$data": "3q2+7w=="}   bytes, standard base64 with padding
//   {"$date": 1700000000.5} seconds since 1970, microsecond precision
//   "text", true, null, [...], {...}
//
// A dictionary key that starts with "$" is written with the "$" doubled.
// Refused: other "$" keys, a "$" key beside other keys, integers that do not
// fit 64 bits, bad UUID text or base64, nesting deeper than kMaxNesting.

#include "Daemon/support/QRNError.h"
#include "Daemon/support/Value.h"

#include <nlohmann/json.hpp>

#include <cstddef>
#include <string>
#include <string_view>

namespace quarn::ctl {

class JsonConvention {
public:
    static constexpr std::size_t kMaxNesting = 64;

    static Result<Value> parse(std::string_view text);
    static Result<Value> toValue(const nlohmann::json& json);
    static nlohmann::json toJson(const Value& value);
    // Indented by two, or on one line when `indent` is negative. Strings
    // that are not UTF-8 have the bad bytes replaced.
    static std::string print(const Value& value, int indent = 2);
};

} // namespace quarn::ctl
