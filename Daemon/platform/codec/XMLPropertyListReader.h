#pragma once

#include "platform/codec/PropertyListReading.h"

namespace ost::platform {

/// Reads an XML document in UTF-8, with or without a byte-order mark.
[[nodiscard]] std::expected<OSTValue, PropertyListError> readXMLPropertyList(std::string_view document,
                                                                             const PropertyListLimits& limits);

} // namespace ost::platform
