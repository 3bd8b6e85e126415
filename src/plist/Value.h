// A property-list value: dictionary, array, string, integer, real, boolean, date or data.
// Values have value semantics: copying one copies the whole tree, so every container a caller
// holds is its own and may be changed freely. "No value" is std::optional<Value>, never a Value.
#pragma once

#include <compare>
#include <cstdint>
#include <map>
#include <optional>
#include <string>
#include <string_view>
#include <variant>
#include <vector>

namespace tavrix::plist {

enum class Type { Dictionary, Array, String, Integer, Real, Boolean, Date, Data };

// A point in time as seconds (with fractions) since 2001-01-01 00:00:00 UTC.
struct Date {
    double secondsSinceReferenceDate = 0;

    // Seconds between the Unix epoch and the reference date.
    static constexpr double kUnixEpochOffset = 978307200.0;

    static Date fromUnixTime(double unixSeconds) { return {unixSeconds - kUnixEpochOffset}; }
    double unixTime() const { return secondsSinceReferenceDate + kUnixEpochOffset; }
    auto operator<=>(const Date&) const = default;
};

// A 64-bit integer that remembers whether it was read as an unsigned value above INT64_MAX,
// so that such values are written back unchanged.
class Integer {
  public:
    constexpr Integer(std::int64_t value = 0) : bits_(static_cast<std::uint64_t>(value)) {}
    static constexpr Integer fromUnsigned(std::uint64_t value) {
        Integer result;
        result.bits_ = value;
        result.isLargeUnsigned_ = value > static_cast<std::uint64_t>(INT64_MAX);
        return result;
    }

    constexpr std::int64_t signedValue() const { return static_cast<std::int64_t>(bits_); }
    constexpr std::uint64_t unsignedValue() const { return bits_; }
    // True for values above INT64_MAX, which have no signed reading.
    constexpr bool isLargeUnsigned() const { return isLargeUnsigned_; }
    bool operator==(const Integer&) const = default;

  private:
    std::uint64_t bits_ = 0;
    bool isLargeUnsigned_ = false;
};

using Data = std::vector<std::uint8_t>;

class Value {
  public:
    using Array = std::vector<Value>;
    using Dictionary = std::map<std::string, Value, std::less<>>;

    Value(bool value) : storage_(value) {}
    Value(int value) : storage_(Integer(value)) {}
    Value(long value) : storage_(Integer(value)) {}
    Value(long long value) : storage_(Integer(value)) {}
    Value(Integer value) : storage_(value) {}
    Value(double value) : storage_(value) {}
    Value(const char* value) : storage_(std::string(value)) {}
    Value(std::string_view value) : storage_(std::string(value)) {}
    Value(std::string value) : storage_(std::move(value)) {}
    Value(Date value) : storage_(value) {}
    Value(Data value) : storage_(std::move(value)) {}
    Value(Array value) : storage_(std::move(value)) {}
    Value(Dictionary value) : storage_(std::move(value)) {}
    // Guards against pointers silently becoming booleans.
    template <typename T>
    Value(T*) = delete;

    Type type() const { return static_cast<Type>(storage_.index()); }

    // Typed access: a pointer to the content when the value has that type, else null.
    const Dictionary* asDictionary() const { return std::get_if<Dictionary>(&storage_); }
    Dictionary* asDictionary() { return std::get_if<Dictionary>(&storage_); }
    const Array* asArray() const { return std::get_if<Array>(&storage_); }
    Array* asArray() { return std::get_if<Array>(&storage_); }
    const std::string* asString() const { return std::get_if<std::string>(&storage_); }
    const Integer* asInteger() const { return std::get_if<Integer>(&storage_); }
    const double* asReal() const { return std::get_if<double>(&storage_); }
    const bool* asBoolean() const { return std::get_if<bool>(&storage_); }
    const Date* asDate() const { return std::get_if<Date>(&storage_); }
    const Data* asData() const { return std::get_if<Data>(&storage_); }

    bool isDictionary() const { return type() == Type::Dictionary; }
    bool isString() const { return type() == Type::String; }

    // The dictionary entry for key, or null when this is not a dictionary or has no such key.
    const Value* find(std::string_view key) const;
    Value* find(std::string_view key);

    // Values of different types are never equal; reals compare as doubles.
    bool operator==(const Value& other) const { return storage_ == other.storage_; }

    // A readable rendering for logs: strings as they are at the top level, containers in braces.
    std::string description() const;

  private:
    // The order of the alternatives is the order of Type.
    std::variant<Dictionary, Array, std::string, Integer, double, bool, Date, Data> storage_;
};

// Shorthands for the two container types.
using Dictionary = Value::Dictionary;
using Array = Value::Array;

// Description of an optional value: "(null)" for no value.
std::string describe(const Value* value);

}  // namespace tavrix::plist
