#pragma once

#include "platform/base/OSTValue.h"
#include "platform/codec/CBOR.h"

#include <optional>

namespace ost::platform {

/// The conversion between the values of the wire and property-list values. Dictionaries, arrays, strings, numbers,
/// booleans, data and dates are the same in both; a UUID is no property-list value.

/// The property-list value of an item. What is null or has no counterpart is left out of arrays and dictionaries.
/// Absent when the item itself is such a thing, holds a number below all signed ones, or more than
/// `maximumConvertedObjects`.
[[nodiscard]] std::optional<OSTValue> propertyListValue(const CBORItem& item);

/// The most objects that one item may become. A byte of the wire can be an object of 40 bytes, so a frame could
/// otherwise cost hundreds of megabytes; a list of a million identifiers still fits.
inline constexpr std::size_t maximumConvertedObjects = 4'000'000;

/// Whether a message can hold the value under one of its keys: nothing in it lies deeper than a message may be.
[[nodiscard]] bool fitsIntoMessage(const OSTValue& value);
[[nodiscard]] bool fitsIntoMessage(const OSTDictionary& dictionary);

/// Writes a property-list value as one item.
void encodePropertyListValue(CBOREncoder& encoder, const OSTValue& value);
void encodePropertyListValue(CBOREncoder& encoder, const OSTDictionary& dictionary);

} // namespace ost::platform
