#include "platform/base/Unicode.h"

#include <cstdint>
#include <cstring>

namespace ost::platform {

namespace {

constexpr bool isSurrogate(char32_t unit) { return unit >= 0xd800 && unit < 0xe000; }

char32_t byteAt(std::string_view text, std::size_t index) { return static_cast<unsigned char>(text[index]); }

} // namespace

bool isASCII(std::string_view text) {
    constexpr std::uint64_t highBits = 0x8080808080808080;
    std::uint64_t word = 0;
    for (; text.size() >= sizeof word; text.remove_prefix(sizeof word)) {
        std::memcpy(&word, text.data(), sizeof word);
        if (word & highBits)
            return false;
    }
    word = 0;
    std::memcpy(&word, text.data(), text.size());
    return (word & highBits) == 0;
}

std::optional<char32_t> takeCodePoint(std::string_view& text) {
    const char32_t first = byteAt(text, 0);
    const std::size_t length = first < 0x80   ? 1
                               : first < 0xc2 ? 0
                               : first < 0xe0 ? 2
                               : first < 0xf0 ? 3
                               : first < 0xf5 ? 4
                                              : 0;
    bool valid = length > 0 && length <= text.size();
    char32_t codePoint = length < 2 ? first : first & (0x7fU >> length);
    for (std::size_t i = 1; valid && i < length; ++i) {
        valid = (byteAt(text, i) & 0xc0) == 0x80;
        codePoint = codePoint << 6 | (byteAt(text, i) & 0x3f);
    }
    const bool overlong = (length == 3 && codePoint < 0x800) || (length == 4 && codePoint < 0x10000);
    valid = valid && !overlong && !isSurrogate(codePoint) && codePoint <= 0x10ffff;
    text.remove_prefix(valid ? length : 1);
    return valid ? std::optional(codePoint) : std::nullopt;
}

bool isValidText(std::string_view text) {
    // Almost all texts are ASCII, which goes eight bytes at a time.
    constexpr std::uint64_t ones = 0x0101010101010101, highBits = 0x8080808080808080;
    while (!text.empty()) {
        if (std::uint64_t word = 0; text.size() >= sizeof word) {
            std::memcpy(&word, text.data(), sizeof word);
            const bool plain = (((word - ones) | word) & highBits) == 0;
            if (plain) {
                text.remove_prefix(sizeof word);
                continue;
            }
        }
        if (byteAt(text, 0) - 1 < 0x7f)
            text.remove_prefix(1);
        else if (!takeCodePoint(text).value_or(0))
            return false;
    }
    return true;
}

bool onlyShowsItself(char32_t codePoint) {
    const auto isBetween = [&](char32_t first, char32_t last) { return codePoint >= first && codePoint <= last; };
    const bool controls = codePoint < 0x20 || isBetween(0x7f, 0x9f);
    const bool rearranges = isBetween(0x2028, 0x202e) || isBetween(0x2066, 0x2069);
    return !controls && !rearranges;
}

void appendUTF8(std::string& out, char32_t codePoint) {
    const auto append = [&](char32_t byte) { out += static_cast<char>(byte); };
    const auto appendTail = [&](unsigned shift) { append(0x80 | (codePoint >> shift & 0x3f)); };
    if (codePoint < 0x80) {
        append(codePoint);
    } else if (codePoint < 0x800) {
        append(0xc0 | codePoint >> 6);
        appendTail(0);
    } else if (codePoint < 0x10000) {
        append(0xe0 | codePoint >> 12);
        appendTail(6);
        appendTail(0);
    } else {
        append(0xf0 | codePoint >> 18);
        appendTail(12);
        appendTail(6);
        appendTail(0);
    }
}

bool appendUTF16BE(std::string& out, std::string_view text) {
    if (text.size() % 2 != 0)
        return false;
    const auto unitAt = [&](std::size_t index) { return byteAt(text, index) << 8 | byteAt(text, index + 1); };
    for (std::size_t i = 0; i < text.size(); i += 2) {
        char32_t codePoint = unitAt(i);
        if (isSurrogate(codePoint)) {
            if (codePoint >= 0xdc00 || i + 2 == text.size())
                return false;
            i += 2;
            const char32_t low = unitAt(i);
            if (low < 0xdc00 || low >= 0xe000)
                return false;
            codePoint = 0x10000 + ((codePoint & 0x3ff) << 10 | (low & 0x3ff));
        }
        appendUTF8(out, codePoint);
    }
    return true;
}

} // namespace ost::platform
