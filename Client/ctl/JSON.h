#pragma once

#include "platform/base/OSTValue.h"

#include <optional>
#include <string_view>

namespace ostrand::ctl {

/// The value of a JSON text, absent when it is none or nests deeper than a request can hold. A number without fraction
/// and exponent is an integer when 64 bits hold it. There is no null among property-list values, so it is refused.
[[nodiscard]] std::optional<ost::OSTValue> parseJSON(std::string_view text);

} // namespace ostrand::ctl
