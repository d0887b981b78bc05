#pragma once

#include <compare>
#include <concepts>
#include <cstddef>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <variant>
#include <vector>

namespace ost {

class OSTDictionary;
class OSTValue;
using OSTArray = std::vector<OSTValue>;

/// Bytes without a meaning of their own.
struct OSTData {
    std::string bytes;
    friend bool operator==(const OSTData&, const OSTData&) = default;
};

/// A moment, in seconds since 1970-01-01T00:00:00Z.
struct OSTDate {
    double secondsSince1970 = 0;
    friend bool operator==(const OSTDate&, const OSTDate&) = default;
};

/// A property-list value: dictionary, array, string, signed or unsigned 64-bit integer, real, boolean, data or date.
///
/// Values are immutable once made and share their arrays and dictionaries, so copying one is cheap and reading one from
/// any thread is safe. Non-negative integers are held unsigned and negative ones signed, so equal numbers compare
/// equal.
class OSTValue {
public:
    /// Takes nothing but a `bool`: a pointer is no boolean.
    template<std::same_as<bool> T>
    OSTValue(T value) : _value(value) {}
    OSTValue(std::int64_t value);
    OSTValue(std::uint64_t value) : _value(value) {}
    OSTValue(double value) : _value(value) {}
    OSTValue(std::string value) : _value(std::move(value)) {}
    OSTValue(const char* value) : _value(std::string(value)) {}
    OSTValue(OSTData value) : _value(std::move(value)) {}
    OSTValue(OSTDate value) : _value(value) {}
    OSTValue(OSTArray value);
    OSTValue(OSTDictionary value);
    /// The pointer must not be null.
    OSTValue(std::shared_ptr<const OSTArray> value);
    OSTValue(std::shared_ptr<const OSTDictionary> value);

    /// Each gives the value when it is of that type, else null.
    [[nodiscard]] const std::string* asString() const { return std::get_if<std::string>(&_value); }
    [[nodiscard]] const OSTData* asData() const { return std::get_if<OSTData>(&_value); }
    [[nodiscard]] const OSTDate* asDate() const { return std::get_if<OSTDate>(&_value); }
    [[nodiscard]] const OSTArray* asArray() const;
    [[nodiscard]] const OSTDictionary* asDictionary() const;
    [[nodiscard]] std::shared_ptr<const OSTDictionary> sharedDictionary() const;

    [[nodiscard]] bool isBoolean() const { return std::holds_alternative<bool>(_value); }
    /// An integer, real or boolean.
    [[nodiscard]] bool isNumber() const;
    /// The number as an unsigned 64-bit integer: negative integers wrap, reals are truncated (out of range: 0 or the
    /// largest), booleans are 0 and 1. Absent when this is no number.
    [[nodiscard]] std::optional<std::uint64_t> unsignedValue() const;
    /// Whether this is a number other than 0.
    [[nodiscard]] bool truthValue() const;

    /// Deep comparison. Numbers are equal by value within integers, within reals, within booleans; NaN is NaN's equal.
    friend bool operator==(const OSTValue& a, const OSTValue& b);

    /// The value in words, for messages: a string as it is, a number in decimal, `(a, b)`, `{key = value; }`, a boolean
    /// as 0 or 1, data as `<hex>`, a date in ISO 8601. Bounded in length: what does not fit is cut with an ellipsis.
    [[nodiscard]] std::string description() const;

    using Variant = std::variant<bool, std::int64_t, std::uint64_t, double, std::string, OSTData, OSTDate,
                                 std::shared_ptr<const OSTArray>, std::shared_ptr<const OSTDictionary>>;
    /// For code that has to tell every type apart (serialisers, converters).
    [[nodiscard]] const Variant& variant() const { return _value; }

private:
    Variant _value;
};

/// Strings mapped to values, in ascending order of the keys' bytes. A value type: build it, then share it as `const`.
class OSTDictionary {
public:
    using Entry = std::pair<std::string, OSTValue>;

    OSTDictionary() = default;
    /// Takes entries in any order; of equal keys the last one counts.
    explicit OSTDictionary(std::vector<Entry> entries);

    [[nodiscard]] const OSTValue* find(std::string_view key) const;
    void set(std::string key, OSTValue value);
    void remove(std::string_view key);

    [[nodiscard]] std::size_t size() const { return _entries.size(); }
    [[nodiscard]] bool empty() const { return _entries.empty(); }
    [[nodiscard]] auto begin() const { return _entries.begin(); }
    [[nodiscard]] auto end() const { return _entries.end(); }

    [[nodiscard]] std::string description() const;
    friend bool operator==(const OSTDictionary&, const OSTDictionary&) = default;

private:
    std::vector<Entry> _entries;
};

} // namespace ost
