#pragma once

#include <optional>
#include <string>
#include <string_view>

namespace ost::platform {

/// Whether every byte of `text` is below 0x80.
[[nodiscard]] bool isASCII(std::string_view text);

/// Whether `text` is UTF-8 without NUL, as every text is that goes over the wire.
[[nodiscard]] bool isValidText(std::string_view text);

/// Takes the first code point off `text`, which must not be empty. A byte that begins no valid UTF-8 sequence is taken
/// off alone and gives nothing.
[[nodiscard]] std::optional<char32_t> takeCodePoint(std::string_view& text);

/// Whether the code point only shows itself: it neither controls a terminal nor ends a line nor makes the text around
/// it appear in another order than it has.
[[nodiscard]] bool onlyShowsItself(char32_t codePoint);

/// Appends a code point that is no surrogate and at most U+10FFFF in UTF-8.
void appendUTF8(std::string& out, char32_t codePoint);

/// Appends `text`, UTF-16 with the high byte first, in UTF-8. False when it holds half a unit or half a surrogate pair.
[[nodiscard]] bool appendUTF16BE(std::string& out, std::string_view text);

} // namespace ost::platform
