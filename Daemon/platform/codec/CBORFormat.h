#pragma once

#include "platform/codec/BigEndian.h"

#include <cstddef>
#include <cstdint>
#include <optional>
#include <string_view>

/// How the bytes of CBOR are laid out: what the reader, the validator and the encoder share.
namespace ost::platform::cbor {

// The major types of RFC 8949, and the additional information that this subset knows.
enum Major : unsigned { unsignedInteger, negativeInteger, byteString, textString, arrayItem, mapItem, tag, simple };
inline constexpr unsigned falseValue = 20, trueValue = 21, nullValue = 22, halfFloat = 25, singleFloat = 26,
                          doubleFloat = 27;
inline constexpr unsigned oneByteArgument = 24, eightByteArgument = 27;
inline constexpr std::uint64_t dateTag = 1, uuidTag = 37;

/// An initial byte with its argument: a number, a length, a count, a tag or the bits of a float.
struct Head {
    unsigned major;
    unsigned information;
    std::uint64_t argument;
    const char* next; ///< behind the argument
};

constexpr std::size_t argumentWidth(unsigned information) {
    return information < oneByteArgument ? 0 : std::size_t{1} << (information - oneByteArgument);
}

/// Reads the head at `at`, whose bytes are known to be there.
inline Head readHead(const char* at) {
    const unsigned initial = static_cast<std::uint8_t>(*at++);
    Head head{.major = initial >> 5U, .information = initial & 0x1fU, .argument = initial & 0x1fU, .next = at};
    if (const auto width = argumentWidth(head.information); width > 0) {
        head.argument = bigEndian({at, width});
        head.next += width;
    }
    return head;
}

/// The bytes of the string whose head is at `at`.
inline std::string_view stringAt(const char* at) {
    const auto head = readHead(at);
    return {head.next, head.argument};
}

/// The number that a float stands for; absent when `head` is none.
[[nodiscard]] std::optional<double> realValue(const Head& head);

} // namespace ost::platform::cbor
