#include "RequestValues.h"

namespace quarn::test {

Value dictionaryOf(std::initializer_list<std::pair<const char*, Value>> entries) {
    Value dictionary = Value::dictionary();
    for (const auto& [key, value] : entries) {
        dictionary.set(key, value);
    }
    return dictionary;
}

Value arrayOf(std::initializer_list<Value> items) {
    return Value(Value::Array(items));
}

std::uint64_t replyError(const Value& reply) {
    const Value* error = reply.get("ReplyError");
    return error ? error->asUInt64().value_or(0) : 0;
}

} // namespace quarn::test
