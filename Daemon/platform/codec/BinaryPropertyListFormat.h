#pragma once

#include <cstddef>
#include <cstdint>
#include <string_view>

/// The binary property-list format: a magic, objects, a table of their offsets, and a trailer. All numbers are
/// big-endian.
///
/// An object begins with a marker: its kind in the high four bits, and in the low four bits a count, or `countFollows`
/// when an integer object with the count stands behind the marker. Arrays hold references, which are indexes into the
/// table; dictionaries hold the references of all keys, then those of all values.
namespace ost::platform::binaryPropertyList {

constexpr std::string_view magic = "bplist00";

enum Kind : std::uint8_t {
    simple = 0x0,      ///< `falseMarker`, `trueMarker`
    integer = 0x1,     ///< of 2^count bytes; signed when of 8 bytes
    real = 0x2,        ///< of 2^count bytes
    date = 0x3,        ///< a real of 8 bytes
    data = 0x4,        ///< count bytes
    asciiString = 0x5, ///< count bytes
    utf16String = 0x6, ///< count units of 2 bytes
    array = 0xa,       ///< count references
    dictionary = 0xd,  ///< count references of keys and as many of values
};

constexpr std::uint8_t falseMarker = 0x08;
constexpr std::uint8_t trueMarker = 0x09;
constexpr std::uint8_t countFollows = 0xf;

/// Dates count from 2001-01-01T00:00:00Z.
constexpr double epochInSecondsSince1970 = 978'307'200;

/// The last bytes of a file: six unused bytes, the widths of an offset and of a reference, then three numbers of 8
/// bytes: how many objects there are, which of them is the root, and where the table is.
constexpr std::size_t trailerSize = 32;
constexpr std::size_t trailerPadding = 6;

} // namespace ost::platform::binaryPropertyList
