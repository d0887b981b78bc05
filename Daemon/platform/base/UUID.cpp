#include "platform/base/UUID.h"

#include "platform/base/Assert.h"

#include <sys/random.h>

#include <algorithm>
#include <cerrno>

namespace ost::platform {

namespace {

constexpr std::size_t textSize = 36;

/// Whether a hyphen stands before byte `index` of the canonical form.
constexpr bool hyphenBefore(std::size_t index) { return index == 4 || index == 6 || index == 8 || index == 10; }

int digitValue(char digit) {
    if (digit >= '0' && digit <= '9')
        return digit - '0';
    if (digit >= 'A' && digit <= 'F')
        return digit - 'A' + 10;
    if (digit >= 'a' && digit <= 'f')
        return digit - 'a' + 10;
    return -1;
}

} // namespace

UUID UUID::generate() {
    Bytes bytes;
    ssize_t count = -1;
    do
        count = ::getrandom(bytes.data(), size, 0);
    while (count < 0 && errno == EINTR);
    // Requests of up to 256 bytes are never cut short.
    OST_ASSERT(count == static_cast<ssize_t>(size));
    bytes[6] = static_cast<std::uint8_t>((bytes[6] & 0x0f) | 0x40);
    bytes[8] = static_cast<std::uint8_t>((bytes[8] & 0x3f) | 0x80);
    return UUID(bytes);
}

std::optional<UUID> UUID::parse(std::string_view text) {
    if (text.size() != textSize)
        return std::nullopt;
    Bytes bytes;
    const char* at = text.data();
    for (std::size_t i = 0; i < size; ++i) {
        if (hyphenBefore(i) && *at++ != '-')
            return std::nullopt;
        const int high = digitValue(*at++);
        const int low = digitValue(*at++);
        if (high < 0 || low < 0)
            return std::nullopt;
        bytes[i] = static_cast<std::uint8_t>(high << 4 | low);
    }
    return UUID(bytes);
}

std::optional<UUID> UUID::fromBytes(std::string_view bytes) {
    if (bytes.size() != size)
        return std::nullopt;
    UUID uuid;
    std::copy(bytes.begin(), bytes.end(), uuid._bytes.begin());
    return uuid;
}

std::string UUID::string() const {
    static constexpr std::string_view digits = "0123456789ABCDEF";
    std::string text;
    text.reserve(textSize);
    for (std::size_t i = 0; i < size; ++i) {
        if (hyphenBefore(i))
            text += '-';
        text += digits[_bytes[i] >> 4];
        text += digits[_bytes[i] & 0xf];
    }
    return text;
}

} // namespace ost::platform
