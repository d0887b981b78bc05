#include "platform/codec/IPCValue.h"

#include <algorithm>
#include <memory>

namespace ost::platform {

namespace {

/// Converts one item and what it holds, which validation has bounded in depth.
class Converter {
public:
    std::optional<OSTValue> convert(const CBORItem& item) {
        if (++_objects > maximumConvertedObjects)
            return std::nullopt;
        switch (item.type()) {
        case CBORType::unsignedNumber:
            return OSTValue(*item.asUnsigned());
        case CBORType::negativeNumber:
            return _negative(item);
        case CBORType::boolean:
            return OSTValue(*item.asBoolean());
        case CBORType::real:
            return OSTValue(*item.asReal());
        case CBORType::text:
            return OSTValue(std::string(*item.asText()));
        case CBORType::data:
            return OSTValue(OSTData{std::string(*item.asData())});
        case CBORType::date:
            return OSTValue(OSTDate{*item.asDate()});
        case CBORType::array:
            return _array(item);
        case CBORType::map:
            return _dictionary(item);
        case CBORType::null:
        case CBORType::uuid:
            return std::nullopt;
        }
        return std::nullopt;
    }

    /// Whether the value says what the item says.
    [[nodiscard]] bool isFaithful() const { return _objects <= maximumConvertedObjects && !_isTooSmall; }

private:
    std::optional<OSTValue> _negative(const CBORItem& item) {
        const auto value = item.asSigned();
        _isTooSmall = _isTooSmall || !value;
        return value ? std::optional(OSTValue(*value)) : std::nullopt;
    }
    std::optional<OSTValue> _array(const CBORItem& item) {
        OSTArray array;
        array.reserve(std::min(item.count(), maximumConvertedObjects - _objects));
        for (const auto element : item.elements())
            if (auto value = convert(element))
                array.push_back(*std::move(value));
        return OSTValue(std::move(array));
    }
    std::optional<OSTValue> _dictionary(const CBORItem& item) {
        std::vector<OSTDictionary::Entry> entries;
        for (const auto& [key, element] : item.entries())
            if (auto value = convert(element))
                entries.emplace_back(key, *std::move(value));
        return OSTValue(OSTDictionary(std::move(entries)));
    }

    std::size_t _objects = 0;
    bool _isTooSmall = false; ///< a number that is
};

bool fits(const OSTDictionary& dictionary, std::size_t depth);

/// `depth` is that of an array or dictionary in the place of the value.
bool fits(const OSTValue& value, std::size_t depth) {
    if (const auto* const array = value.asArray())
        return depth <= CBORMaximumDepth &&
               std::ranges::all_of(*array, [&](const OSTValue& element) { return fits(element, depth + 1); });
    const auto* const dictionary = value.asDictionary();
    return !dictionary || fits(*dictionary, depth);
}

bool fits(const OSTDictionary& dictionary, std::size_t depth) {
    return depth <= CBORMaximumDepth &&
           std::ranges::all_of(dictionary, [&](const auto& entry) { return fits(entry.second, depth + 1); });
}

constexpr std::size_t depthOfValues = 2; // in the message's dictionary

struct Encode {
    CBOREncoder& encoder;

    void operator()(bool value) const { encoder.boolean(value); }
    void operator()(std::int64_t value) const { encoder.signedNumber(value); }
    void operator()(std::uint64_t value) const { encoder.unsignedNumber(value); }
    void operator()(double value) const { encoder.real(value); }
    void operator()(const std::string& value) const { encoder.text(value); }
    void operator()(const OSTData& value) const { encoder.data(value.bytes); }
    void operator()(const OSTDate& value) const { encoder.date(value.secondsSince1970); }
    void operator()(const std::shared_ptr<const OSTArray>& value) const {
        encoder.beginArray(value->size());
        for (const auto& element : *value)
            encodePropertyListValue(encoder, element);
    }
    void operator()(const std::shared_ptr<const OSTDictionary>& value) const {
        encodePropertyListValue(encoder, *value);
    }
};

} // namespace

std::optional<OSTValue> propertyListValue(const CBORItem& item) {
    Converter converter;
    auto value = converter.convert(item);
    return converter.isFaithful() ? value : std::nullopt;
}

bool fitsIntoMessage(const OSTValue& value) { return fits(value, depthOfValues); }

bool fitsIntoMessage(const OSTDictionary& dictionary) { return fits(dictionary, depthOfValues); }

void encodePropertyListValue(CBOREncoder& encoder, const OSTValue& value) {
    std::visit(Encode{encoder}, value.variant());
}

void encodePropertyListValue(CBOREncoder& encoder, const OSTDictionary& dictionary) {
    encoder.beginMap(dictionary.size());
    for (const auto& [key, value] : dictionary) {
        encoder.key(key);
        encodePropertyListValue(encoder, value);
    }
}

} // namespace ost::platform
