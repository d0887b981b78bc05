#pragma once

#include "platform/codec/PropertyListReading.h"

namespace ost::platform {

/// Reads `bytes`, which begin with "bplist00".
[[nodiscard]] std::expected<OSTValue, PropertyListError> readBinaryPropertyList(std::string_view bytes,
                                                                                const PropertyListLimits& limits);

} // namespace ost::platform
