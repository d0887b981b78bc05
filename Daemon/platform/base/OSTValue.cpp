#include "platform/base/OSTValue.h"

#include "platform/base/Assert.h"
#include "platform/base/Text.h"

#include <algorithm>
#include <charconv>
#include <chrono>
#include <cmath>
#include <iterator>
#include <limits>

namespace ost {

namespace {

/// Long enough for any path in a message, short enough for a log line.
constexpr std::size_t longestDescription = 4096;

/// Puts values into words until the longest description is reached; what comes then costs nothing.
class Describer {
public:
    void describe(const OSTValue& value) {
        if (!_isFull())
            std::visit([this](const auto& content) { _append(content); }, value.variant());
    }

    void describe(const OSTDictionary& dictionary) {
        _append(std::string_view("{"));
        for (const auto& [key, value] : dictionary) {
            if (_isFull())
                return;
            _append(std::string_view(key));
            _append(std::string_view(" = "));
            describe(value);
            _append(std::string_view("; "));
        }
        _append(std::string_view("}"));
    }

    std::string finish() && {
        if (_isFull()) {
            std::size_t end = longestDescription;
            while (end > 0 && (static_cast<unsigned char>(_text[end]) & 0xc0) == 0x80)
                --end; // a character is cut off whole
            _text.resize(end);
            _text += "…";
        }
        return std::move(_text);
    }

private:
    [[nodiscard]] bool _isFull() const { return _text.size() > longestDescription; }

    void _append(std::string_view text) {
        if (!_isFull())
            _text += text.substr(0, longestDescription + 1 - _text.size());
    }
    void _append(const std::string& text) { _append(std::string_view(text)); }
    void _append(bool value) { _append(std::string_view(value ? "1" : "0")); }
    void _append(std::int64_t value) { _appendNumber(value); }
    void _append(std::uint64_t value) { _appendNumber(value); }
    void _append(double value) { _appendNumber(value); }

    void _append(const OSTData& data) {
        _append(std::string_view("<"));
        for (const char c : data.bytes) {
            if (_isFull())
                return;
            platform::appendHex(_text, static_cast<unsigned char>(c));
        }
        _append(std::string_view(">"));
    }

    void _append(const OSTDate& date) {
        using namespace std::chrono;
        // Years of four digits; a moment outside them, or none at all, is given in seconds.
        constexpr double firstSecond = -62'167'219'200;
        constexpr double lastSecond = 253'402'300'799;
        if (!(date.secondsSince1970 >= firstSecond && date.secondsSince1970 <= lastSecond))
            return _appendNumber(date.secondsSince1970);
        const sys_seconds moment{seconds(static_cast<std::int64_t>(std::floor(date.secondsSince1970)))};
        const auto day = floor<days>(moment);
        const year_month_day calendar(day);
        const hh_mm_ss time(moment - day);
        _appendPadded(static_cast<int>(calendar.year()), 4, '-');
        _appendPadded(static_cast<unsigned>(calendar.month()), 2, '-');
        _appendPadded(static_cast<unsigned>(calendar.day()), 2, 'T');
        _appendPadded(time.hours().count(), 2, ':');
        _appendPadded(time.minutes().count(), 2, ':');
        _appendPadded(time.seconds().count(), 2, 'Z');
    }

    void _append(const std::shared_ptr<const OSTArray>& array) {
        std::string_view separator = "(";
        for (const auto& value : *array) {
            if (_isFull())
                return;
            _append(separator);
            describe(value);
            separator = ", ";
        }
        _append(std::string_view(array->empty() ? "()" : ")"));
    }

    void _append(const std::shared_ptr<const OSTDictionary>& dictionary) { describe(*dictionary); }

    template<typename Number>
    void _appendNumber(Number value) {
        char buffer[32];
        const auto end = std::to_chars(std::begin(buffer), std::end(buffer), value).ptr;
        _append(std::string_view(buffer, end));
    }

    void _appendPadded(auto value, std::size_t width, char separator) {
        const auto digits = std::to_string(value);
        _text.append(width - digits.size(), '0').append(digits) += separator;
    }

    std::string _text;
};

std::uint64_t truncated(double value) {
    constexpr double firstTooLarge = 0x1p64;
    if (!(value > 0))
        return 0;
    return value < firstTooLarge ? static_cast<std::uint64_t>(value) : std::numeric_limits<std::uint64_t>::max();
}

bool isSameReal(double a, double b) { return a == b || (std::isnan(a) && std::isnan(b)); }

} // namespace

OSTValue::OSTValue(std::int64_t value) {
    if (value < 0)
        _value = value;
    else
        _value = static_cast<std::uint64_t>(value);
}

OSTValue::OSTValue(OSTArray value) : OSTValue(std::make_shared<const OSTArray>(std::move(value))) {}

OSTValue::OSTValue(OSTDictionary value) : OSTValue(std::make_shared<const OSTDictionary>(std::move(value))) {}

OSTValue::OSTValue(std::shared_ptr<const OSTArray> value) : _value(std::move(value)) {
    OST_ASSERT(asArray() != nullptr);
}

OSTValue::OSTValue(std::shared_ptr<const OSTDictionary> value) : _value(std::move(value)) {
    OST_ASSERT(asDictionary() != nullptr);
}

const OSTArray* OSTValue::asArray() const {
    const auto* array = std::get_if<std::shared_ptr<const OSTArray>>(&_value);
    return array ? array->get() : nullptr;
}

const OSTDictionary* OSTValue::asDictionary() const {
    const auto* dictionary = std::get_if<std::shared_ptr<const OSTDictionary>>(&_value);
    return dictionary ? dictionary->get() : nullptr;
}

std::shared_ptr<const OSTDictionary> OSTValue::sharedDictionary() const {
    const auto* dictionary = std::get_if<std::shared_ptr<const OSTDictionary>>(&_value);
    return dictionary ? *dictionary : nullptr;
}

bool OSTValue::isNumber() const {
    return isBoolean() || std::holds_alternative<std::uint64_t>(_value) ||
           std::holds_alternative<std::int64_t>(_value) || std::holds_alternative<double>(_value);
}

std::optional<std::uint64_t> OSTValue::unsignedValue() const {
    if (const auto* number = std::get_if<std::uint64_t>(&_value))
        return *number;
    if (const auto* number = std::get_if<std::int64_t>(&_value))
        return static_cast<std::uint64_t>(*number);
    if (const auto* number = std::get_if<double>(&_value))
        return truncated(*number);
    if (const auto* number = std::get_if<bool>(&_value))
        return *number ? 1 : 0;
    return std::nullopt;
}

bool OSTValue::truthValue() const {
    if (const auto* number = std::get_if<double>(&_value))
        return *number != 0;
    return unsignedValue().value_or(0) != 0;
}

bool operator==(const OSTValue& a, const OSTValue& b) {
    if (const auto *array = a.asArray(), *other = b.asArray(); array && other)
        return array == other || *array == *other;
    if (const auto *dictionary = a.asDictionary(), *other = b.asDictionary(); dictionary && other)
        return dictionary == other || *dictionary == *other;
    if (const auto *real = std::get_if<double>(&a._value), *other = std::get_if<double>(&b._value); real && other)
        return isSameReal(*real, *other);
    if (const auto *date = std::get_if<OSTDate>(&a._value), *other = std::get_if<OSTDate>(&b._value); date && other)
        return isSameReal(date->secondsSince1970, other->secondsSince1970);
    return a._value == b._value;
}

std::string OSTValue::description() const {
    Describer describer;
    describer.describe(*this);
    return std::move(describer).finish();
}

OSTDictionary::OSTDictionary(std::vector<Entry> entries) : _entries(std::move(entries)) {
    // Writers put keys in order as a rule, which makes this one pass.
    const auto disorder = [](const Entry& a, const Entry& b) { return a.first >= b.first; };
    if (std::ranges::adjacent_find(_entries, disorder) == _entries.end())
        return;
    std::vector<Entry*> order;
    order.reserve(_entries.size());
    for (Entry& entry : _entries)
        order.push_back(&entry);
    // Equal keys end up beside each other, the last one first: the one that remains.
    std::ranges::sort(order, [](const Entry* a, const Entry* b) {
        const auto compared = a->first <=> b->first;
        return compared == 0 ? a > b : compared < 0;
    });
    const auto rest = std::ranges::unique(order, {}, &Entry::first);
    order.erase(rest.begin(), rest.end());
    std::vector<Entry> sorted;
    sorted.reserve(order.size());
    for (Entry* entry : order)
        sorted.push_back(std::move(*entry));
    _entries = std::move(sorted);
}

const OSTValue* OSTDictionary::find(std::string_view key) const {
    const auto at = std::ranges::lower_bound(_entries, key, {}, &Entry::first);
    return at != _entries.end() && at->first == key ? &at->second : nullptr;
}

void OSTDictionary::set(std::string key, OSTValue value) {
    const auto at = std::ranges::lower_bound(_entries, key, {}, &Entry::first);
    if (at != _entries.end() && at->first == key)
        at->second = std::move(value);
    else
        _entries.emplace(at, std::move(key), std::move(value));
}

void OSTDictionary::remove(std::string_view key) {
    const auto at = std::ranges::lower_bound(_entries, key, {}, &Entry::first);
    if (at != _entries.end() && at->first == key)
        _entries.erase(at);
}

std::string OSTDictionary::description() const {
    Describer describer;
    describer.describe(*this);
    return std::move(describer).finish();
}

} // namespace ost
