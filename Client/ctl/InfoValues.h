#pragma once

#include "Client/ctl/Arguments.h"
#include "platform/base/OSTValue.h"

#include <array>

namespace ostrand::ctl {

// A value on the command line: as JSON, or by an option that says its type.

inline constexpr Operand infoValueOperand{"JSON", "the value, unless an option gives it", Operand::Count::optional};
inline constexpr std::array<Option, 6> infoValueOptions = {{
    {"string", "TEXT", "a string"},
    {"integer", "N", "an integer of 64 bits, signed or unsigned"},
    {"boolean", "true|false", "a truth value"},
    {"data", "HEX", "bytes, as hexadecimal digits"},
    {"date", "DATE", "a moment: 2026-11-23T08:00:00Z, or seconds since 1970"},
    {"plist", "FILE", "the value in a property-list file of either encoding; - is standard input"},
}};
inline constexpr std::string_view aboutInfoValues =
    "The value is given once, as in: info set ID KEY '{\"a\": [1, true]}'   or: info set ID KEY --string text.\n"
    "A negative number in JSON stands behind --, so that it is no option.";

[[nodiscard]] std::expected<ost::OSTValue, Failure> infoValueOf(const Arguments& arguments);

} // namespace ostrand::ctl
