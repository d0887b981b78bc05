#include "platform/CBOR.h"

#include "platform/MessageFormat.h"
#include "platform/Try.h"

#include <algorithm>
#include <array>
#include <bit>
#include <cmath>
#include <cstring>
#include <functional>
#include <limits>
#include <memory_resource>
#include <span>
#include <vector>

namespace ost::platform {

namespace {

// The major types of RFC 8949, and the additional information that this subset knows.
enum Major : unsigned { unsignedInteger, negativeInteger, byteString, textString, arrayItem, mapItem, tag, simple };
constexpr unsigned falseValue = 20, trueValue = 21, nullValue = 22, halfFloat = 25, singleFloat = 26, doubleFloat = 27;
constexpr unsigned oneByteArgument = 24, eightByteArgument = 27;
constexpr std::uint64_t dateTag = 1, uuidTag = 37;

/// An initial byte with its argument: a number, a length, a count, a tag or the bits of a float.
struct Head {
    unsigned major;
    unsigned information;
    std::uint64_t argument;
    const char* next; ///< behind the argument
};

constexpr std::size_t argumentWidth(unsigned information) {
    return information < oneByteArgument ? 0 : std::size_t{1} << (information - oneByteArgument);
}

/// Reads the head at `at`, whose bytes are known to be there.
Head readHead(const char* at) {
    const unsigned initial = static_cast<std::uint8_t>(*at++);
    Head head{.major = initial >> 5U, .information = initial & 0x1fU, .argument = initial & 0x1fU, .next = at};
    if (const auto width = argumentWidth(head.information); width > 0) {
        head.argument = 0;
        for (std::size_t i = 0; i < width; ++i)
            head.argument = head.argument << 8 | static_cast<std::uint8_t>(at[i]);
        head.next += width;
    }
    return head;
}

/// The bytes of the string whose head is at `at`.
std::string_view stringAt(const char* at) {
    const auto head = readHead(at);
    return {head.next, head.argument};
}

/// The end of the valid item at `at`, found without recursion.
const char* endOf(const char* at) {
    for (std::uint64_t items = 1; items > 0; --items) {
        const auto head = readHead(at);
        at = head.next;
        switch (head.major) {
        case byteString:
        case textString:
            at += head.argument;
            break;
        case arrayItem:
            items += head.argument;
            break;
        case mapItem:
            items += head.argument * 2;
            break;
        case tag:
            ++items;
            break;
        default:
            break;
        }
    }
    return at;
}

double halfToDouble(std::uint64_t bits) {
    const auto exponent = static_cast<int>(bits >> 10 & 0x1f);
    const auto mantissa = static_cast<double>(bits & 0x3ff);
    double value = 0;
    if (exponent == 0)
        value = std::ldexp(mantissa, -24);
    else if (exponent != 31)
        value = std::ldexp(mantissa + 1024, exponent - 25);
    else
        value = mantissa == 0 ? std::numeric_limits<double>::infinity() : std::numeric_limits<double>::quiet_NaN();
    return (bits & 0x8000) != 0 ? -value : value;
}

std::optional<double> realValue(const Head& head) {
    if (head.major != simple)
        return std::nullopt;
    switch (head.information) {
    case halfFloat:
        return halfToDouble(head.argument);
    case singleFloat:
        return static_cast<double>(std::bit_cast<float>(static_cast<std::uint32_t>(head.argument)));
    case doubleFloat:
        return std::bit_cast<double>(head.argument);
    default:
        return std::nullopt;
    }
}

/// The length of the UTF-8 sequence at the start of `text`, 0 when there is no valid one or it is NUL.
std::size_t sequenceLength(std::string_view text) {
    const auto byte = [&](std::size_t index) {
        return index < text.size() ? static_cast<std::uint8_t>(text[index]) : std::uint8_t{0};
    };
    const auto continues = [&](std::size_t index) { return (byte(index) & 0xc0) == 0x80; };
    const unsigned first = byte(0), second = byte(1);
    if (first < 0x80)
        return first == 0 ? 0 : 1;
    if (first >= 0xc2 && first <= 0xdf)
        return continues(1) ? 2 : 0;
    if (first >= 0xe0 && first <= 0xef) {
        const bool overlong = first == 0xe0 && second < 0xa0;
        const bool surrogate = first == 0xed && second >= 0xa0;
        return continues(1) && continues(2) && !overlong && !surrogate ? 3 : 0;
    }
    if (first >= 0xf0 && first <= 0xf4) {
        const bool overlong = first == 0xf0 && second < 0x90;
        const bool tooLarge = first == 0xf4 && second >= 0x90;
        return continues(1) && continues(2) && continues(3) && !overlong && !tooLarge ? 4 : 0;
    }
    return 0;
}

/// Whether `text` is UTF-8 without NUL. Almost all texts are ASCII, which goes eight bytes at a time.
bool isValidText(std::string_view text) {
    constexpr std::uint64_t ones = 0x0101010101010101, highBits = 0x8080808080808080;
    while (!text.empty()) {
        if (std::uint64_t word = 0; text.size() >= sizeof word) {
            std::memcpy(&word, text.data(), sizeof word);
            const bool plain = (((word - ones) | word) & highBits) == 0;
            if (plain) {
                text.remove_prefix(sizeof word);
                continue;
            }
        }
        const auto length = sequenceLength(text);
        if (length == 0)
            return false;
        text.remove_prefix(length);
    }
    return true;
}

/// The check of one payload: one pass, with a stack of the arrays and maps that are open.
class Validator {
public:
    explicit Validator(std::string_view bytes)
        : _begin(bytes.data()), _at(_begin), _end(_begin + bytes.size()), _keys(&_memory) {
        _keys.reserve(keysOnStack / 2);
    }

    std::expected<void, CBORError> run() {
        if (!_root())
            return std::unexpected(_error);
        return {};
    }

private:
    static constexpr std::size_t maximumDepth = 64; ///< deeper than any message, shallow enough for recursive readers
    static constexpr std::size_t keysOnStack = 64;  ///< no ordinary request has more, so checking it allocates nothing
    static constexpr std::size_t fewKeys = 16;      ///< up to here, comparing each with each is the fastest

    struct Level {
        std::uint64_t itemsLeft; ///< keys and values counted each
        std::size_t firstKey;    ///< index into _keys
        bool isMap;
    };

    /// A key is kept as 32 bits of hash above its 32-bit offset: small, and equal keys sort side by side.
    using Key = std::uint64_t;
    [[nodiscard]] std::string_view _text(Key key) const { return stringAt(_begin + static_cast<std::uint32_t>(key)); }
    [[nodiscard]] static std::uint64_t _hash(Key key) { return key >> 32; }

    // Each check gives whether all is well; what is not is in _error. A message has many items, and this is what costs
    // least.
    [[nodiscard]] bool _fail(const char* at, const char* reason) {
        _error = {reason, static_cast<std::size_t>(at - _begin)};
        return false;
    }
    [[nodiscard]] std::size_t _left() const { return static_cast<std::size_t>(_end - _at); }

    [[nodiscard]] bool _root() {
        if (static_cast<std::size_t>(_end - _begin) > std::numeric_limits<std::uint32_t>::max())
            return _fail(_begin, "too long");
        if (_at == _end || static_cast<std::uint8_t>(*_at) >> 5 != mapItem)
            return _fail(_at, "not a map");
        do {
            if (!_item() || !_closeFinishedLevels())
                return false;
        } while (_depth > 0);
        return _at == _end || _fail(_at, "bytes after the item");
    }

    [[nodiscard]] bool _readHead(Head& head) {
        if (_at == _end)
            return _fail(_at, "ends early");
        const unsigned information = static_cast<std::uint8_t>(*_at) & 0x1fU;
        if (information > eightByteArgument)
            return _fail(_at, "indefinite length or reserved encoding");
        if (_left() < 1 + argumentWidth(information))
            return _fail(_at, "ends early");
        head = readHead(_at);
        _at = head.next;
        return true;
    }

    /// Checks one item, opening a level for an array or map.
    [[nodiscard]] bool _item() {
        const char* const start = _at;
        Head head;
        if (!_readHead(head))
            return false;
        if (_depth > 0) {
            auto& level = _levels[_depth - 1];
            const bool isKey = level.isMap && level.itemsLeft % 2 == 0;
            --level.itemsLeft;
            if (isKey)
                return _key(start, head);
        }
        switch (head.major) {
        case byteString:
        case textString:
            return _string(start, head);
        case arrayItem:
        case mapItem:
            return _open(start, head);
        case tag:
            return _tagged(start, head);
        case simple:
            return _simple(start, head);
        default:
            return true;
        }
    }

    [[nodiscard]] bool _simple(const char* start, const Head& head) {
        const bool isFloat = head.information >= halfFloat;
        const bool isKnown = head.information >= falseValue && head.information <= nullValue;
        return isFloat || isKnown || _fail(start, "unknown simple value");
    }

    [[nodiscard]] bool _string(const char* start, const Head& head) {
        if (head.argument > _left())
            return _fail(start, "ends early");
        if (head.major == textString && !isValidText({_at, head.argument}))
            return _fail(start, "invalid text");
        _at += head.argument;
        return true;
    }

    [[nodiscard]] bool _key(const char* start, const Head& head) {
        if (head.major != textString)
            return _fail(start, "a key that is no text");
        if (!_string(start, head))
            return false;
        const std::uint64_t hash = std::hash<std::string_view>{}({head.next, head.argument});
        _keys.push_back(hash << 32 | static_cast<std::uint32_t>(start - _begin));
        return true;
    }

    [[nodiscard]] bool _open(const char* start, const Head& head) {
        const bool isMap = head.major == mapItem;
        // Every item takes a byte at least, so a claim beyond that is refused before anything is done for it.
        if (head.argument > _left() / (isMap ? 2 : 1))
            return _fail(start, "ends early");
        if (_depth == maximumDepth)
            return _fail(start, "nested too deeply");
        _levels[_depth++] = {head.argument * (isMap ? 2 : 1), _keys.size(), isMap};
        return true;
    }

    [[nodiscard]] bool _tagged(const char* start, const Head& head) {
        Head content;
        if (!_readHead(content))
            return false;
        if (head.argument == uuidTag) {
            if (content.major != byteString || content.argument != UUID::size)
                return _fail(start, "a UUID that is not 16 bytes");
            return _string(start, content);
        }
        if (head.argument != dateTag)
            return _fail(start, "unknown tag");
        return content.major <= negativeInteger || realValue(content) || _fail(start, "a date that is no number");
    }

    [[nodiscard]] bool _closeFinishedLevels() {
        while (_depth > 0 && _levels[_depth - 1].itemsLeft == 0) {
            const auto first = _levels[--_depth].firstKey;
            if (const auto twice = _keyStandingTwice(std::span(_keys).subspan(first)))
                return _fail(_begin + static_cast<std::uint32_t>(*twice), "a key stands twice");
            _keys.resize(first);
        }
        return true;
    }

    [[nodiscard]] std::optional<Key> _keyStandingTwice(std::span<Key> keys) const {
        if (keys.size() > fewKeys)
            return _keyStandingTwiceAmongMany(keys);
        for (std::size_t i = 1; i < keys.size(); ++i)
            for (std::size_t j = 0; j < i; ++j)
                if (_hash(keys[i]) == _hash(keys[j]) && _text(keys[i]) == _text(keys[j]))
                    return keys[i];
        return std::nullopt;
    }

    /// Sorts by hash, then keys of equal hash by text, so that no choice of keys costs more than sorting does.
    [[nodiscard]] std::optional<Key> _keyStandingTwiceAmongMany(std::span<Key> keys) const {
        std::ranges::sort(keys);
        for (auto run = keys.begin(); run != keys.end();) {
            const auto end = std::find_if(run, keys.end(), [&](Key key) { return _hash(key) != _hash(*run); });
            if (end - run > 1) {
                const auto text = [&](Key key) { return _text(key); };
                std::ranges::sort(run, end, {}, text);
                if (const auto twice = std::ranges::adjacent_find(run, end, {}, text); twice != end)
                    return *twice;
            }
            run = end;
        }
        return std::nullopt;
    }

    const char* const _begin;
    const char* _at;
    const char* const _end;
    CBORError _error{};
    std::size_t _depth = 0;
    std::array<Level, maximumDepth> _levels; // the first _depth are in use
    std::array<std::byte, keysOnStack * sizeof(Key)> _storage;
    std::pmr::monotonic_buffer_resource _memory{_storage.data(), _storage.size()};
    std::pmr::vector<Key> _keys; ///< of all open maps, those of an inner one behind those of the outer
};

} // namespace

std::string CBORError::description() const { return formatMessage("%s at byte %llu", reason, offset); }

std::expected<CBORItem, CBORError> validateCBOR(std::string_view payload) {
    OST_TRY(Validator(payload).run());
    return CBORItem(payload.data());
}

CBORType CBORItem::type() const {
    const auto head = readHead(_head);
    switch (head.major) {
    case unsignedInteger:
        return CBORType::unsignedNumber;
    case negativeInteger:
        return CBORType::negativeNumber;
    case byteString:
        return CBORType::data;
    case textString:
        return CBORType::text;
    case arrayItem:
        return CBORType::array;
    case mapItem:
        return CBORType::map;
    case tag:
        return head.argument == uuidTag ? CBORType::uuid : CBORType::date;
    default:
        break;
    }
    if (head.information == nullValue)
        return CBORType::null;
    return head.information <= trueValue ? CBORType::boolean : CBORType::real;
}

std::optional<std::uint64_t> CBORItem::asUnsigned() const {
    const auto head = readHead(_head);
    return head.major == unsignedInteger ? std::optional(head.argument) : std::nullopt;
}

std::optional<std::int64_t> CBORItem::asSigned() const {
    const auto head = readHead(_head);
    if (head.major > negativeInteger || head.argument > std::numeric_limits<std::int64_t>::max())
        return std::nullopt;
    const auto magnitude = static_cast<std::int64_t>(head.argument);
    return head.major == unsignedInteger ? magnitude : -1 - magnitude;
}

std::optional<bool> CBORItem::asBoolean() const {
    const auto head = readHead(_head);
    if (head.major != simple || head.information > trueValue)
        return std::nullopt;
    return head.information == trueValue;
}

std::optional<double> CBORItem::asReal() const { return realValue(readHead(_head)); }

std::optional<std::string_view> CBORItem::asText() const {
    return readHead(_head).major == textString ? std::optional(stringAt(_head)) : std::nullopt;
}

std::optional<std::string_view> CBORItem::asData() const {
    return readHead(_head).major == byteString ? std::optional(stringAt(_head)) : std::nullopt;
}

std::optional<UUID> CBORItem::asUUID() const {
    const auto head = readHead(_head);
    if (head.major != tag || head.argument != uuidTag)
        return std::nullopt;
    return UUID::fromBytes(stringAt(head.next));
}

std::optional<double> CBORItem::asDate() const {
    const auto head = readHead(_head);
    if (head.major != tag || head.argument != dateTag)
        return std::nullopt;
    const auto content = readHead(head.next);
    switch (content.major) {
    case unsignedInteger:
        return static_cast<double>(content.argument);
    case negativeInteger:
        return -1 - static_cast<double>(content.argument);
    default:
        return realValue(content);
    }
}

std::size_t CBORItem::count() const {
    const auto head = readHead(_head);
    return head.major == arrayItem || head.major == mapItem ? head.argument : 0;
}

CBORElements CBORItem::elements() const {
    const auto head = readHead(_head);
    return {head.next, head.major == arrayItem ? head.argument : 0};
}

CBOREntries CBORItem::entries() const {
    const auto head = readHead(_head);
    return {head.next, head.major == mapItem ? head.argument : 0};
}

std::optional<CBORItem> CBORItem::find(std::string_view key) const {
    for (const auto entry : entries())
        if (entry.key == key)
            return entry.value;
    return std::nullopt;
}

std::string_view CBORItem::bytes() const { return {_head, static_cast<std::size_t>(endOf(_head) - _head)}; }

CBORElements::Iterator& CBORElements::Iterator::operator++() {
    _head = endOf(_head);
    --_left;
    return *this;
}

CBOREntry CBOREntries::Iterator::operator*() const {
    const auto key = stringAt(_head);
    return {key, CBORItem(key.data() + key.size())};
}

CBOREntries::Iterator& CBOREntries::Iterator::operator++() {
    _head = endOf(endOf(_head));
    --_left;
    _skipNulls();
    return *this;
}

void CBOREntries::Iterator::_skipNulls() {
    for (; _left > 0; --_left) {
        const auto key = stringAt(_head);
        const char* const value = key.data() + key.size();
        if (CBORItem(value).type() != CBORType::null)
            return;
        _head = value + 1;
    }
}

void CBOREncoder::_bigEndian(std::uint64_t value, std::size_t width) {
    for (std::size_t i = width; i-- > 0;)
        _out += static_cast<char>(value >> (8 * i) & 0xff);
}

void CBOREncoder::_head(unsigned majorType, std::uint64_t argument) {
    const auto initial = [&](std::uint64_t information) {
        _out += static_cast<char>(majorType << 5 | static_cast<unsigned>(information));
    };
    if (argument < oneByteArgument)
        return initial(argument);
    const unsigned exponent = argument <= 0xff ? 0 : argument <= 0xffff ? 1 : argument <= 0xffffffff ? 2 : 3;
    initial(oneByteArgument + exponent);
    _bigEndian(argument, std::size_t{1} << exponent);
}

void CBOREncoder::beginMap(std::uint64_t count) { _head(mapItem, count); }
void CBOREncoder::beginArray(std::uint64_t count) { _head(arrayItem, count); }
void CBOREncoder::unsignedNumber(std::uint64_t value) { _head(unsignedInteger, value); }

void CBOREncoder::signedNumber(std::int64_t value) {
    if (value >= 0)
        _head(unsignedInteger, static_cast<std::uint64_t>(value));
    else
        _head(negativeInteger, static_cast<std::uint64_t>(-1 - value));
}

void CBOREncoder::boolean(bool value) { _head(simple, value ? trueValue : falseValue); }
void CBOREncoder::null() { _head(simple, nullValue); }

void CBOREncoder::real(double value) {
    _out += static_cast<char>(simple << 5 | doubleFloat);
    _bigEndian(std::bit_cast<std::uint64_t>(value), sizeof value);
}

void CBOREncoder::text(std::string_view value) {
    _head(textString, value.size());
    _out.append(value);
}

void CBOREncoder::data(std::string_view bytes) {
    _head(byteString, bytes.size());
    _out.append(bytes);
}

void CBOREncoder::uuid(const UUID& value) {
    _head(tag, uuidTag);
    data(value.view());
}

void CBOREncoder::date(double secondsSince1970) {
    constexpr double exactIntegers = 9007199254740992; // up to 2^53 a double tells every integer apart
    _head(tag, dateTag);
    if (std::abs(secondsSince1970) <= exactIntegers && std::trunc(secondsSince1970) == secondsSince1970)
        signedNumber(static_cast<std::int64_t>(secondsSince1970));
    else
        real(secondsSince1970);
}

} // namespace ost::platform
