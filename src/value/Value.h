#pragma once
// The value model of reports: the plain values a payload dictionary may hold, with
// dictionaries that keep their insertion order. A report is copied several times on
// its way through the daemon (sinks, session, backend queue), so arrays and
// dictionaries share immutable storage and copy on write: a copy costs one reference
// count, and a writer that is not the only holder gets a private copy first.
// Values are safe to share between threads as long as each thread writes only its own
// copies.

#include <chrono>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <variant>
#include <vector>

namespace mx {

class Value;

using Date = std::chrono::time_point<std::chrono::system_clock, std::chrono::nanoseconds>;
using Data = std::vector<std::uint8_t>;

class Array {
public:
    Array() = default;
    Array(std::initializer_list<Value> values);
    explicit Array(std::vector<Value> values);

    std::size_t size() const;
    bool empty() const { return size() == 0; }
    const Value& operator[](std::size_t index) const;
    std::vector<Value>::const_iterator begin() const;
    std::vector<Value>::const_iterator end() const;

    void append(Value value);

    friend bool operator==(const Array& a, const Array& b);

private:
    std::vector<Value>& mutableItems();

    std::shared_ptr<const std::vector<Value>> items_;
};

class Dictionary {
public:
    using Entry = std::pair<std::string, Value>;

    Dictionary() = default;
    Dictionary(std::initializer_list<Entry> entries);

    std::size_t size() const;
    bool empty() const { return size() == 0; }
    bool contains(std::string_view key) const { return find(key) != nullptr; }
    // nullptr when the key is absent.
    const Value* find(std::string_view key) const;
    std::vector<Entry>::const_iterator begin() const;
    std::vector<Entry>::const_iterator end() const;

    // Replaces the value of an existing key in place (its position is kept), else
    // appends the entry.
    void set(std::string key, Value value);
    // Room for `entries` in all, so that a dictionary built key by key moves none.
    void reserve(std::size_t entries);
    void erase(std::string_view key);
    // Copies every entry of `other` into this one, later entries replacing earlier.
    void merge(const Dictionary& other);

    friend bool operator==(const Dictionary& a, const Dictionary& b);

private:
    struct Storage;
    Storage& mutableStorage();

    std::shared_ptr<const Storage> storage_;
};

class Value {
public:
// GCC takes scoped enumerators for declarations that shadow the types of the same
// name, although they can only be named as Kind::Date and Kind::Data.
#pragma GCC diagnostic push
#pragma GCC diagnostic ignored "-Wshadow"
    enum class Kind { Nil, Bool, Int, UInt, Double, String, Date, Data, Array, Dictionary };
#pragma GCC diagnostic pop

    Value() = default;
    Value(std::nullptr_t) {}
    Value(bool value) : value_(value) {}
    Value(int value) : value_(std::int64_t{value}) {}
    Value(long value) : value_(std::int64_t{value}) {}
    Value(long long value) : value_(std::int64_t{value}) {}
    Value(unsigned value) : value_(std::uint64_t{value}) {}
    Value(unsigned long value) : value_(std::uint64_t{value}) {}
    Value(unsigned long long value) : value_(std::uint64_t{value}) {}
    Value(float value) : value_(double{value}) {}
    Value(double value) : value_(value) {}
    Value(const char* value) : value_(std::string(value)) {}
    Value(std::string_view value) : value_(std::string(value)) {}
    Value(std::string value) : value_(std::move(value)) {}
    Value(Date value) : value_(value) {}
    Value(Data value) : value_(std::move(value)) {}
    Value(Array value) : value_(std::move(value)) {}
    Value(Dictionary value) : value_(std::move(value)) {}

    Kind kind() const { return static_cast<Kind>(value_.index()); }
    bool isNil() const { return kind() == Kind::Nil; }
    bool isNumber() const;

    // nullptr unless the value is of that kind.
    const bool* asBool() const { return std::get_if<bool>(&value_); }
    const std::int64_t* asInt() const { return std::get_if<std::int64_t>(&value_); }
    const std::uint64_t* asUInt() const { return std::get_if<std::uint64_t>(&value_); }
    const double* asDouble() const { return std::get_if<double>(&value_); }
    const std::string* asString() const { return std::get_if<std::string>(&value_); }
    const Date* asDate() const { return std::get_if<Date>(&value_); }
    const Data* asData() const { return std::get_if<Data>(&value_); }
    const Array* asArray() const { return std::get_if<Array>(&value_); }
    const Dictionary* asDictionary() const { return std::get_if<Dictionary>(&value_); }

    // A number (or bool) read as a signed 64-bit integer: doubles truncate toward
    // zero (saturating), unsigned values wrap as a cast would. Anything else is 0.
    std::int64_t int64Value() const;
    // A number (or bool) read as a double; anything else is 0.
    double doubleValue() const;
    // A number's truth: non-zero. Anything else is false.
    bool boolValue() const { return doubleValue() != 0.0 || int64Value() != 0; }

    // The one text form used wherever a value is shown: log lines, summaries,
    // message keys. Strings are themselves at the top level and quoted inside
    // containers; numbers are decimal; dates RFC 3339 UTC; raw data hex in <>.
    std::string description() const;

    friend bool operator==(const Value& a, const Value& b) { return a.value_ == b.value_; }

private:
    std::variant<std::monostate, bool, std::int64_t, std::uint64_t, double, std::string, Date, Data, Array, Dictionary>
        value_;
};

std::string formatDate(Date date);

// Roughly the memory a value takes, its shared storage counted as its own: what a
// queue that holds it is charged for.
std::size_t approximateBytes(const Value& value);

} // namespace mx
