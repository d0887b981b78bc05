#pragma once

#include <algorithm>
#include <charconv>
#include <optional>
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

/// The number that the text is, in decimal and nothing else.
template<typename Number>
std::optional<Number> numberIn(std::string_view text) {
    Number number = 0;
    const auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), number);
    return error == std::errc{} && end == text.data() + text.size() ? std::optional(number) : std::nullopt;
}

} // namespace ost::platform
