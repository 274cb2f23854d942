#pragma once
// The one dynamic type of the daemon: request and reply dictionaries,
// entitlements, info dictionaries and every property-list file are Values.
//
// Arrays and dictionaries are shared and copied on write, so passing Values
// around is cheap. Typed accessors never throw: on a wrong type they answer
// none (nullopt or nullptr).

#include "Daemon/support/UUID.h"

#include <chrono>
#include <compare>
#include <concepts>
#include <cstdint>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <variant>
#include <vector>

namespace quarn {

// A point in time, microseconds since the Unix epoch.
struct Date {
    std::int64_t microsecondsSince1970 = 0;

    static Date now();
    static Date fromSeconds(double secondsSince1970);
    double seconds() const { return static_cast<double>(microsecondsSince1970) / 1e6; }
    friend auto operator<=>(const Date&, const Date&) = default;
};

class Value {
public:
    using Data = std::vector<std::uint8_t>;
    using Array = std::vector<Value>;
    using Dictionary = std::map<std::string, Value, std::less<>>;

    enum class Kind {
        None,
        UInt64,
        Int64,
        Real,
        Bool,
        String,
        Data,
        Date,
        UUID,
        Array,
        Dictionary
    };

    Value() = default;
    Value(bool b) : v_(b) {}
    template <std::unsigned_integral T>
    requires(!std::same_as<T, bool>) Value(T u) : v_(static_cast<std::uint64_t>(u)) {}
    template <std::signed_integral T> Value(T i) : v_(static_cast<std::int64_t>(i)) {}
    Value(double d) : v_(d) {}
    Value(std::string s) : v_(std::move(s)) {}
    Value(std::string_view s) : v_(std::string(s)) {}
    Value(const char* s) : v_(std::string(s)) {}
    Value(Data d) : v_(std::move(d)) {}
    Value(Date d) : v_(d) {}
    Value(UUID u) : v_(u) {}
    Value(Array a) : v_(std::make_shared<Array>(std::move(a))) {}
    Value(Dictionary d) : v_(std::make_shared<Dictionary>(std::move(d))) {}

    static Value array() { return Value(Array{}); }
    static Value dictionary() { return Value(Dictionary{}); }

    Kind kind() const { return static_cast<Kind>(v_.index()); }
    static const char* kindName(Kind k);
    const char* kindName() const { return kindName(kind()); }

    bool isNone() const { return kind() == Kind::None; }
    bool isNumber() const;
    bool isString() const { return kind() == Kind::String; }
    bool isDictionary() const { return kind() == Kind::Dictionary; }
    bool isArray() const { return kind() == Kind::Array; }

    // Integers convert between signedness when the value fits; reals never
    // convert to integers and integers never to booleans.
    std::optional<std::uint64_t> asUInt64() const;
    std::optional<std::int64_t> asInt64() const;
    std::optional<double> asDouble() const; // any number
    std::optional<bool> asBool() const;
    const std::string* asString() const;
    const Data* asData() const;
    std::optional<Date> asDate() const;
    std::optional<UUID> asUUID() const;
    const Array* asArray() const;
    const Dictionary* asDictionary() const;

    // Dictionary member, or nullptr when this is no dictionary or the key is absent.
    const Value* get(std::string_view key) const;

    // Mutation. A Value that is not yet a dictionary (or array) becomes an
    // empty one first. Shared storage is copied before it is changed.
    Value& set(std::string key, Value value);
    bool erase(std::string_view key);
    Value& append(Value value);
    Dictionary& mutableDictionary();
    Array& mutableArray();

    // Element count of an array or dictionary, byte count of data or string; else 0.
    std::size_t size() const;

    // Deep equality; integers of either signedness compare by value.
    friend bool operator==(const Value& a, const Value& b);
    std::size_t hash() const;

    // A readable, deterministic rendering (dictionaries in key order).
    std::string description() const;

private:
    using Storage =
        std::variant<std::monostate, std::uint64_t, std::int64_t, double, bool, std::string, Data,
                     Date, UUID, std::shared_ptr<Array>, std::shared_ptr<Dictionary>>;
    Storage v_;

    void describe(std::string& out, int indent) const;
};

} // namespace quarn

template <> struct std::hash<quarn::Value> {
    std::size_t operator()(const quarn::Value& v) const noexcept { return v.hash(); }
};
