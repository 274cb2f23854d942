#pragma once
// Request dictionaries written inline, and the code a reply carries.

#include "Daemon/support/Value.h"

#include <cstdint>
#include <initializer_list>
#include <utility>

namespace quarn::test {

Value dictionaryOf(std::initializer_list<std::pair<const char*, Value>> entries);
Value arrayOf(std::initializer_list<Value> items);
// "ReplyError" of a reply; 0 when it has none.
std::uint64_t replyError(const Value& reply);

} // namespace quarn::test
