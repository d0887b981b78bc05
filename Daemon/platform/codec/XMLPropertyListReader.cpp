#include "platform/codec/XMLPropertyListReader.h"

#include "platform/base/Try.h"
#include "platform/codec/XMLScanner.h"

#include <algorithm>
#include <charconv>
#include <chrono>
#include <limits>

namespace ost::platform {

namespace {

template<typename T>
using Result = std::expected<T, PropertyListError>;
using Tag = XMLScanner::Tag;

std::string_view trimmed(std::string_view text) {
    while (!text.empty() && isXMLSpace(text.front()))
        text.remove_prefix(1);
    while (!text.empty() && isXMLSpace(text.back()))
        text.remove_suffix(1);
    return text;
}

/// The number that all of `text` spells.
template<typename Number, typename... Format>
std::optional<Number> parsedNumber(std::string_view text, Format... format) {
    Number number{};
    const auto parsed = std::from_chars(text.data(), text.data() + text.size(), number, format...);
    const bool isWhole = parsed.ec == std::errc() && parsed.ptr == text.data() + text.size();
    return isWhole ? std::optional(number) : std::nullopt;
}

/// A decimal or, after "0x", hexadecimal integer with an optional sign.
std::optional<OSTValue> parseInteger(std::string_view text) {
    text = trimmed(text);
    const bool isNegative = text.starts_with('-');
    if (isNegative || text.starts_with('+'))
        text.remove_prefix(1);
    const bool isHexadecimal = text.starts_with("0x") || text.starts_with("0X");
    const auto magnitude = parsedNumber<std::uint64_t>(text.substr(isHexadecimal ? 2 : 0), isHexadecimal ? 16 : 10);
    constexpr std::uint64_t lowestMagnitude = std::uint64_t{1} << 63;
    if (!magnitude || (isNegative && *magnitude > lowestMagnitude))
        return std::nullopt;
    return isNegative ? OSTValue(static_cast<std::int64_t>(-*magnitude)) : OSTValue(*magnitude);
}

std::optional<OSTValue> parseReal(std::string_view text) {
    text = trimmed(text);
    if (text.starts_with('+') && !text.starts_with("+-"))
        text.remove_prefix(1);
    return parsedNumber<double>(text);
}

/// YYYY-MM-DDTHH:MM:SSZ.
std::optional<OSTValue> parseDate(std::string_view text) {
    using namespace std::chrono;
    text = trimmed(text);
    if (text.size() != 20 || text[4] != '-' || text[7] != '-' || text[10] != 'T' || text[13] != ':' ||
        text[16] != ':' || text[19] != 'Z')
        return std::nullopt;
    const auto field = [&](std::size_t at, std::size_t width) {
        return parsedNumber<unsigned>(text.substr(at, width)).value_or(std::numeric_limits<unsigned>::max());
    };
    const auto yearNumber = field(0, 4);
    const auto hour = field(11, 2), minute = field(14, 2), second = field(17, 2);
    if (yearNumber > 9999 || hour > 23 || minute > 59 || second > 59)
        return std::nullopt;
    const auto date = year(static_cast<int>(yearNumber)) / month(field(5, 2)) / day(field(8, 2));
    if (field(5, 2) > 12 || field(8, 2) > 31 || !date.ok())
        return std::nullopt;
    const sys_seconds moment = sys_days(date) + hours(hour) + minutes(minute) + seconds(second);
    return OSTDate{static_cast<double>(moment.time_since_epoch().count())};
}

std::optional<std::uint32_t> base64Digit(char c) {
    constexpr std::string_view alphabet = "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789+/";
    const auto at = alphabet.find(c);
    return at == std::string_view::npos ? std::nullopt : std::optional(static_cast<std::uint32_t>(at));
}

/// Base64 with padding, and white space anywhere.
std::optional<OSTValue> parseData(std::string_view text) {
    std::string bytes;
    bytes.reserve(text.size() / 4 * 3);
    std::uint32_t bits = 0;
    std::size_t digits = 0;
    std::size_t padding = 0;
    const auto append = [&](unsigned shift) { bytes += static_cast<char>(bits >> shift); };
    for (const char c : text) {
        if (isXMLSpace(c))
            continue;
        if (c == '=' && ++padding <= 2)
            continue;
        const auto digit = base64Digit(c);
        if (!digit || padding > 0)
            return std::nullopt;
        bits = bits << 6 | *digit;
        if (++digits % 4 == 0)
            for (const unsigned shift : {16U, 8U, 0U})
                append(shift);
    }
    if ((digits + padding) % 4 != 0)
        return std::nullopt;
    if (padding == 2) {
        append(4);
    } else if (padding == 1) {
        append(10);
        append(2);
    }
    return OSTData{std::move(bytes)};
}

class Reader {
public:
    Reader(std::string_view document, const PropertyListLimits& limits) : _scanner(document), _limits(limits) {}

    Result<OSTValue> read() {
        OST_TRY(_scanner.readProlog());
        const auto root = OST_TRY(_scanner.nextTag());
        if (!root || root->name != "plist" || root->kind != Tag::Kind::opening)
            return _scanner.malformed("no element \"plist\" with a value");
        const auto tag = OST_TRY(_openingTag());
        auto value = OST_TRY(_value(tag, 1));
        if (OST_TRY(_tagWithin("plist")))
            return _scanner.malformed("more than one value");
        if (OST_TRY(_scanner.nextTag()))
            return _scanner.malformed("element behind the root element");
        return value;
    }

private:
    /// The next tag inside the element `name`; absent when that element is closed.
    Result<std::optional<Tag>> _tagWithin(std::string_view name) {
        const auto tag = OST_TRY(_scanner.nextTag());
        if (!tag)
            return _scanner.malformed("element without an end");
        if (tag->kind != Tag::Kind::closing)
            return tag;
        if (tag->name != name)
            return _scanner.malformed("closing tag of another element");
        return std::nullopt;
    }

    Result<Tag> _openingTag() {
        const auto tag = OST_TRY(_scanner.nextTag());
        if (!tag || tag->kind == Tag::Kind::closing)
            return _scanner.malformed("value missing");
        return *tag;
    }

    Result<void> _chargeObject() {
        if (_objects == _limits.objectCount)
            return _scanner.malformed("too many objects");
        ++_objects;
        return {};
    }

    Result<std::string> _text(const Tag& tag) {
        return tag.kind == Tag::Kind::empty ? std::string() : _scanner.textUntilClosing(tag.name);
    }

    Result<OSTValue> _value(const Tag& tag, std::size_t depth) {
        OST_TRY(_chargeObject());
        const bool isArray = tag.name == "array";
        if (isArray || tag.name == "dict") {
            if (depth > _limits.depth)
                return _scanner.malformed("nested too deeply");
            return isArray ? _array(tag, depth) : _dictionary(tag, depth);
        }
        auto text = OST_TRY(_text(tag));
        if (tag.name == "string")
            return OSTValue(std::move(text));
        if (auto value = _parsed(tag.name, text))
            return *std::move(value);
        return _scanner.malformed("bad or unknown element \"" + std::string(tag.name) + "\"");
    }

    static std::optional<OSTValue> _parsed(std::string_view type, std::string_view text) {
        if (type == "integer")
            return parseInteger(text);
        if (type == "real")
            return parseReal(text);
        if (type == "date")
            return parseDate(text);
        if (type == "data")
            return parseData(text);
        if ((type == "true" || type == "false") && trimmed(text).empty())
            return type == "true";
        return std::nullopt;
    }

    Result<OSTValue> _array(const Tag& tag, std::size_t depth) {
        OSTArray values;
        while (tag.kind == Tag::Kind::opening) {
            const auto element = OST_TRY(_tagWithin(tag.name));
            if (!element)
                break;
            values.push_back(OST_TRY(_value(*element, depth + 1)));
        }
        return OSTValue(std::move(values));
    }

    Result<OSTValue> _dictionary(const Tag& tag, std::size_t depth) {
        std::vector<OSTDictionary::Entry> entries;
        while (tag.kind == Tag::Kind::opening) {
            const auto keyTag = OST_TRY(_tagWithin(tag.name));
            if (!keyTag)
                break;
            if (keyTag->name != "key")
                return _scanner.malformed("value without a key");
            OST_TRY(_chargeObject());
            auto key = OST_TRY(_text(*keyTag));
            const auto valueTag = OST_TRY(_openingTag());
            entries.emplace_back(std::move(key), OST_TRY(_value(valueTag, depth + 1)));
        }
        return OSTValue(OSTDictionary(std::move(entries)));
    }

    XMLScanner _scanner;
    const PropertyListLimits _limits;
    std::size_t _objects = 0;
};

} // namespace

std::expected<OSTValue, PropertyListError> readXMLPropertyList(std::string_view document,
                                                               const PropertyListLimits& limits) {
    return Reader(document, limits).read();
}

} // namespace ost::platform
