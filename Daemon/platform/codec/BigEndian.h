#pragma once

#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>

namespace ost::platform {

/// `bytes`, at most 8, as one number, the high byte first.
[[nodiscard]] constexpr std::uint64_t bigEndian(std::string_view bytes) {
    std::uint64_t value = 0;
    for (const char byte : bytes)
        value = value << 8 | static_cast<std::uint8_t>(byte);
    return value;
}

/// Appends the low `width` bytes of `value`, the high one first.
inline void appendBigEndian(std::string& out, std::uint64_t value, std::size_t width) {
    for (std::size_t i = width; i-- > 0;)
        out += static_cast<char>(value >> (8 * i) & 0xff);
}

} // namespace ost::platform
