#include "Daemon/support/Value.h"

#include <fmt/format.h>

#include <limits>

namespace quarn {

Date Date::now() {
    auto t = std::chrono::system_clock::now().time_since_epoch();
    return Date{std::chrono::duration_cast<std::chrono::microseconds>(t).count()};
}

Date Date::fromSeconds(double secondsSince1970) {
    return Date{static_cast<std::int64_t>(secondsSince1970 * 1e6)};
}

const char* Value::kindName(Kind k) {
    switch (k) {
    case Kind::None:
        return "none";
    case Kind::UInt64:
        return "unsigned";
    case Kind::Int64:
        return "signed";
    case Kind::Real:
        return "real";
    case Kind::Bool:
        return "bool";
    case Kind::String:
        return "string";
    case Kind::Data:
        return "data";
    case Kind::Date:
        return "date";
    case Kind::UUID:
        return "uuid";
    case Kind::Array:
        return "array";
    case Kind::Dictionary:
        return "dictionary";
    }
    return "unknown";
}

bool Value::isNumber() const {
    auto k = kind();
    return k == Kind::UInt64 || k == Kind::Int64 || k == Kind::Real;
}

std::optional<std::uint64_t> Value::asUInt64() const {
    if (auto* u = std::get_if<std::uint64_t>(&v_)) {
        return *u;
    }
    if (auto* i = std::get_if<std::int64_t>(&v_); i && *i >= 0) {
        return static_cast<std::uint64_t>(*i);
    }
    return std::nullopt;
}

std::optional<std::int64_t> Value::asInt64() const {
    if (auto* i = std::get_if<std::int64_t>(&v_)) {
        return *i;
    }
    if (auto* u = std::get_if<std::uint64_t>(&v_);
        u && *u <= static_cast<std::uint64_t>(std::numeric_limits<std::int64_t>::max())) {
        return static_cast<std::int64_t>(*u);
    }
    return std::nullopt;
}

std::optional<double> Value::asDouble() const {
    if (auto* d = std::get_if<double>(&v_)) {
        return *d;
    }
    if (auto* u = std::get_if<std::uint64_t>(&v_)) {
        return static_cast<double>(*u);
    }
    if (auto* i = std::get_if<std::int64_t>(&v_)) {
        return static_cast<double>(*i);
    }
    return std::nullopt;
}

std::optional<bool> Value::asBool() const {
    if (auto* b = std::get_if<bool>(&v_)) {
        return *b;
    }
    return std::nullopt;
}

const std::string* Value::asString() const {
    return std::get_if<std::string>(&v_);
}
const Value::Data* Value::asData() const {
    return std::get_if<Data>(&v_);
}

std::optional<Date> Value::asDate() const {
    if (auto* d = std::get_if<Date>(&v_)) {
        return *d;
    }
    return std::nullopt;
}

std::optional<UUID> Value::asUUID() const {
    if (auto* u = std::get_if<UUID>(&v_)) {
        return *u;
    }
    return std::nullopt;
}

const Value::Array* Value::asArray() const {
    auto* p = std::get_if<std::shared_ptr<Array>>(&v_);
    return p ? p->get() : nullptr;
}

const Value::Dictionary* Value::asDictionary() const {
    auto* p = std::get_if<std::shared_ptr<Dictionary>>(&v_);
    return p ? p->get() : nullptr;
}

const Value* Value::get(std::string_view key) const {
    const Dictionary* d = asDictionary();
    if (!d) {
        return nullptr;
    }
    auto it = d->find(key);
    return it == d->end() ? nullptr : &it->second;
}

Value::Dictionary& Value::mutableDictionary() {
    auto* p = std::get_if<std::shared_ptr<Dictionary>>(&v_);
    if (!p) {
        v_ = std::make_shared<Dictionary>();
        p = std::get_if<std::shared_ptr<Dictionary>>(&v_);
    } else if (p->use_count() > 1) {
        *p = std::make_shared<Dictionary>(**p);
    }
    return **p;
}

Value::Array& Value::mutableArray() {
    auto* p = std::get_if<std::shared_ptr<Array>>(&v_);
    if (!p) {
        v_ = std::make_shared<Array>();
        p = std::get_if<std::shared_ptr<Array>>(&v_);
    } else if (p->use_count() > 1) {
        *p = std::make_shared<Array>(**p);
    }
    return **p;
}

Value& Value::set(std::string key, Value value) {
    mutableDictionary().insert_or_assign(std::move(key), std::move(value));
    return *this;
}

bool Value::erase(std::string_view key) {
    if (!asDictionary() || !get(key)) {
        return false;
    }
    auto& d = mutableDictionary();
    d.erase(d.find(key));
    return true;
}

Value& Value::append(Value value) {
    mutableArray().push_back(std::move(value));
    return *this;
}

std::size_t Value::size() const {
    if (auto* a = asArray()) {
        return a->size();
    }
    if (auto* d = asDictionary()) {
        return d->size();
    }
    if (auto* s = asString()) {
        return s->size();
    }
    if (auto* d = asData()) {
        return d->size();
    }
    return 0;
}

bool operator==(const Value& a, const Value& b) {
    using K = Value::Kind;
    auto ka = a.kind(), kb = b.kind();
    bool intA = ka == K::UInt64 || ka == K::Int64;
    bool intB = kb == K::UInt64 || kb == K::Int64;
    if (intA && intB) {
        auto ua = a.asUInt64(), ub = b.asUInt64();
        if (ua && ub) {
            return *ua == *ub;
        }
        auto ia = a.asInt64(), ib = b.asInt64();
        return ia && ib && *ia == *ib;
    }
    if (ka != kb) {
        return false;
    }
    switch (ka) {
    case K::Array:
        return *a.asArray() == *b.asArray();
    case K::Dictionary:
        return *a.asDictionary() == *b.asDictionary();
    default:
        return a.v_ == b.v_;
    }
}

std::size_t Value::hash() const {
    auto mix = [](std::size_t seed, std::size_t h) {
        return seed ^ (h + 0x9E3779B97F4A7C15ull + (seed << 6) + (seed >> 2));
    };
    switch (kind()) {
    case Kind::None:
        return 0;
    case Kind::UInt64:
    case Kind::Int64: {
        // Equal integers of either signedness hash alike.
        auto u = asUInt64();
        return std::hash<std::uint64_t>{}(u ? *u : static_cast<std::uint64_t>(*asInt64()));
    }
    case Kind::Real:
        return std::hash<double>{}(std::get<double>(v_));
    case Kind::Bool:
        return std::get<bool>(v_) ? 0x51 : 0x50;
    case Kind::String:
        return std::hash<std::string>{}(*asString());
    case Kind::Data:
        return std::hash<std::string_view>{}(
            std::string_view(reinterpret_cast<const char*>(asData()->data()), asData()->size()));
    case Kind::Date:
        return std::hash<std::int64_t>{}(asDate()->microsecondsSince1970);
    case Kind::UUID:
        return asUUID()->hash();
    case Kind::Array: {
        std::size_t h = 0xA0;
        for (const auto& e : *asArray()) {
            h = mix(h, e.hash());
        }
        return h;
    }
    case Kind::Dictionary: {
        std::size_t h = 0xD0;
        for (const auto& [k, e] : *asDictionary()) {
            h = mix(mix(h, std::hash<std::string>{}(k)), e.hash());
        }
        return h;
    }
    }
    return 0;
}

static void appendQuoted(std::string& out, const std::string& s) {
    out.push_back('"');
    for (char c : s) {
        if (c == '"' || c == '\\') {
            out.push_back('\\');
        }
        out.push_back(c);
    }
    out.push_back('"');
}

void Value::describe(std::string& out, int indent) const {
    const std::string pad(static_cast<std::size_t>(indent + 1) * 4, ' ');
    const std::string closePad(static_cast<std::size_t>(indent) * 4, ' ');
    switch (kind()) {
    case Kind::None:
        out += "(null)";
        break;
    case Kind::UInt64:
        out += std::to_string(std::get<std::uint64_t>(v_));
        break;
    case Kind::Int64:
        out += std::to_string(std::get<std::int64_t>(v_));
        break;
    case Kind::Real:
        out += fmt::format("{}", std::get<double>(v_));
        break;
    case Kind::Bool:
        out += std::get<bool>(v_) ? "true" : "false";
        break;
    case Kind::String:
        appendQuoted(out, *asString());
        break;
    case Kind::Data: {
        out += "<";
        for (auto b : *asData()) {
            out += fmt::format("{:02x}", b);
        }
        out += ">";
        break;
    }
    case Kind::Date:
        out += fmt::format("date({})", asDate()->seconds());
        break;
    case Kind::UUID:
        out += asUUID()->string();
        break;
    case Kind::Array: {
        const auto& a = *asArray();
        if (a.empty()) {
            out += "()";
            break;
        }
        out += "(\n";
        for (std::size_t i = 0; i < a.size(); ++i) {
            out += pad;
            a[i].describe(out, indent + 1);
            out += i + 1 < a.size() ? ",\n" : "\n";
        }
        out += closePad + ")";
        break;
    }
    case Kind::Dictionary: {
        const auto& d = *asDictionary();
        if (d.empty()) {
            out += "{}";
            break;
        }
        out += "{\n";
        for (const auto& [k, e] : d) {
            out += pad;
            appendQuoted(out, k);
            out += " = ";
            e.describe(out, indent + 1);
            out += ";\n";
        }
        out += closePad + "}";
        break;
    }
    }
}

std::string Value::description() const {
    std::string out;
    describe(out, 0);
    return out;
}

} // namespace quarn
