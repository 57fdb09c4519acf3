// Value: one property-list or message value. Every stored state file and
// every request and reply is a tree of these.
//
// Kinds: null, bool, integer (signed or unsigned 64-bit), double, UTF-8
// string, data, date, UUID, array and dictionary with string keys.
//
// Integers compare by their mathematical value, whichever of the two integer
// kinds holds them: a uint64 5 equals an int64 5, while an int64 -1 never
// equals a uint64 0xFFFFFFFFFFFFFFFF. Stored files keep small unsigned
// numbers as plain integers, so a value read back may carry the other integer
// kind and must still be equal to what was written. hash() agrees with ==.
//
// Values are immutable by convention once shared; the mutators exist for the
// code that builds them.
#pragma once

#include <compare>
#include <cstdint>
#include <map>
#include <optional>
#include <string>
#include <string_view>
#include <type_traits>
#include <variant>
#include <vector>

#include "core/Uuid.h"

namespace berth {

class Value {
  public:
    enum class Kind {
        Null,
        Bool,
        Int64,
        UInt64,
        Double,
        String,
        Data,
        Date,
        Uuid,
        Array,
        Dictionary
    };

    using Array = std::vector<Value>;
    using Dictionary = std::map<std::string, Value, std::less<>>;
    using Data = std::vector<uint8_t>;

    // A point in time, in seconds since 1970-01-01 00:00:00 UTC.
    struct Date {
        double secondsSince1970 = 0;
        friend bool operator==(const Date&, const Date&) = default;
    };

    Value() = default;
    Value(std::nullptr_t) {}
    Value(bool b) : storage_(b) {}
    template <typename T>
    requires(std::is_integral_v<T>&& std::is_signed_v<T> && !std::is_same_v<T, bool> &&
             !std::is_same_v<T, char>) Value(T v)
        : storage_(static_cast<int64_t>(v)) {}
    template <typename T>
    requires(std::is_integral_v<T>&& std::is_unsigned_v<T> && !std::is_same_v<T, bool>) Value(T v)
        : storage_(static_cast<uint64_t>(v)) {}
    Value(double d) : storage_(d) {}
    Value(const char* s) : storage_(std::string(s)) {}
    Value(std::string_view s) : storage_(std::string(s)) {}
    Value(std::string s) : storage_(std::move(s)) {}
    Value(Data d) : storage_(std::move(d)) {}
    Value(Date d) : storage_(d) {}
    Value(const berth::Uuid& u) : storage_(u) {}
    Value(Array a) : storage_(std::move(a)) {}
    Value(Dictionary d) : storage_(std::move(d)) {}

    static Value array() { return Value(Array{}); }
    static Value dictionary() { return Value(Dictionary{}); }

    Kind kind() const { return static_cast<Kind>(storage_.index()); }
    bool isNull() const { return kind() == Kind::Null; }
    bool isBool() const { return kind() == Kind::Bool; }
    bool isInteger() const { return kind() == Kind::Int64 || kind() == Kind::UInt64; }
    bool isNumber() const { return isInteger() || kind() == Kind::Double; }
    bool isString() const { return kind() == Kind::String; }
    bool isData() const { return kind() == Kind::Data; }
    bool isDate() const { return kind() == Kind::Date; }
    bool isUuid() const { return kind() == Kind::Uuid; }
    bool isArray() const { return kind() == Kind::Array; }
    bool isDictionary() const { return kind() == Kind::Dictionary; }

    // Typed views: null when the value is of another kind.
    const bool* boolValue() const { return std::get_if<bool>(&storage_); }
    const std::string* string() const { return std::get_if<std::string>(&storage_); }
    const Data* data() const { return std::get_if<Data>(&storage_); }
    const Date* date() const { return std::get_if<Date>(&storage_); }
    const berth::Uuid* uuid() const { return std::get_if<berth::Uuid>(&storage_); }
    const Array* arrayValue() const { return std::get_if<Array>(&storage_); }
    Array* arrayValue() { return std::get_if<Array>(&storage_); }
    const Dictionary* dictionaryValue() const { return std::get_if<Dictionary>(&storage_); }
    Dictionary* dictionaryValue() { return std::get_if<Dictionary>(&storage_); }

    // Numeric conversions of any number kind, with C conversion semantics
    // (two's complement between the integer kinds, truncation from double);
    // nullopt when the value is not a number.
    std::optional<uint64_t> uint64Value() const;
    std::optional<int64_t> int64Value() const;
    std::optional<double> doubleValue() const;

    // Dictionary access. find() is null when this is not a dictionary or the
    // key is absent; set() and erase() do nothing on other kinds.
    const Value* find(std::string_view key) const;
    void set(std::string key, Value value);
    void erase(std::string_view key);

    // Array append; does nothing on other kinds.
    void push(Value value);

    // Number of elements of an array or dictionary, bytes of data or a string.
    size_t size() const;

    friend bool operator==(const Value& a, const Value& b);
    size_t hash() const;

    // Text for log lines and error messages: strings as themselves at the top
    // level, containers in a property-list-like notation.
    std::string description() const;

  private:
    void describe(std::string& out, int indent, bool topLevel) const;

    std::variant<std::monostate, bool, int64_t, uint64_t, double, std::string, Data, Date,
                 berth::Uuid, Array, Dictionary>
        storage_;
};

const char* kindName(Value::Kind kind);

}  // namespace berth

template <>
struct std::hash<berth::Value> {
    size_t operator()(const berth::Value& v) const noexcept { return v.hash(); }
};
