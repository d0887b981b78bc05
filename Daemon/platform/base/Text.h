#pragma once

#include <algorithm>
#include <string>
#include <string_view>

namespace ost::platform {

/// Takes what stands before the first `separator` off `rest`, and the separator with it; all of `rest` when there is
/// none.
inline std::string_view takeUntil(std::string_view& rest, char separator) {
    const auto part = rest.substr(0, rest.find(separator));
    rest.remove_prefix(std::min(part.size() + 1, rest.size()));
    return part;
}

/// Appends a byte as two hexadecimal digits.
inline void appendHex(std::string& out, unsigned char byte) {
    constexpr char digits[] = "0123456789abcdef";
    out += digits[byte >> 4];
    out += digits[byte & 15];
}

} // namespace ost::platform
