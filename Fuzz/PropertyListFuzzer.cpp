#include "platform/base/Assert.h"
#include "platform/codec/PropertyList.h"

#include <algorithm>
#include <cmath>

using ost::OSTValue;

namespace {

/// NaN is no value's equal, not even its own.
bool holdsNaN(const OSTValue& value) {
    if (const auto* number = std::get_if<double>(&value.variant()))
        return std::isnan(*number);
    if (const auto* date = value.asDate())
        return std::isnan(date->secondsSince1970);
    if (const auto* array = value.asArray())
        return std::ranges::any_of(*array, holdsNaN);
    if (const auto* dictionary = value.asDictionary())
        return std::ranges::any_of(*dictionary, [](const auto& entry) { return holdsNaN(entry.second); });
    return false;
}

} // namespace

/// What can be read can be written, and reads the same again.
extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    const auto value = ost::platform::parsePropertyList({reinterpret_cast<const char*>(data), size});
    if (!value || !value->asDictionary())
        return 0;
    const auto bytes = ost::platform::serializeBinaryPropertyList(*value->asDictionary());
    const auto again = ost::platform::parsePropertyList(bytes);
    OST_ASSERT(again && again->asDictionary());
    OST_ASSERT(*again == *value || holdsNaN(*value));
    OST_ASSERT(ost::platform::serializeBinaryPropertyList(*again->asDictionary()) == bytes);
    OST_ASSERT(!value->description().empty());
    return 0;
}
