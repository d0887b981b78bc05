#include "platform/codec/CBOR.h"

#include "platform/codec/CBORFormat.h"

#include <bit>
#include <cmath>
#include <limits>

namespace ost::platform {

using namespace cbor;

namespace {

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

} // namespace

std::optional<double> cbor::realValue(const Head& head) {
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

void CBOREncoder::_head(unsigned majorType, std::uint64_t argument) {
    const auto initial = [&](std::uint64_t information) {
        _out += static_cast<char>(majorType << 5 | static_cast<unsigned>(information));
    };
    if (argument < oneByteArgument)
        return initial(argument);
    const unsigned exponent = argument <= 0xff ? 0 : argument <= 0xffff ? 1 : argument <= 0xffffffff ? 2 : 3;
    initial(oneByteArgument + exponent);
    appendBigEndian(_out, argument, std::size_t{1} << exponent);
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
    appendBigEndian(_out, std::bit_cast<std::uint64_t>(value), sizeof value);
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
