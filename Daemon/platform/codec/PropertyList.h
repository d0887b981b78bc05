#pragma once

#include "platform/base/OSTValue.h"

#include <cstddef>
#include <expected>
#include <string>
#include <string_view>

namespace ost::platform {

/// Why a property list could not be read: a sentence for a log line.
struct PropertyListError {
    std::string reason;
    [[nodiscard]] std::string description() const { return reason; }
};

/// What a reader accepts. Files come from directories that users own, so reading one never costs more than time and
/// memory in proportion to its size, whatever it holds. A binary file may refer to an object many times; its tree then
/// counts as it is walked, and is refused when it takes more than 64 bytes for each byte of the file and 1 MiB
/// besides.
struct PropertyListLimits {
    std::size_t depth = 64; ///< nesting of arrays and dictionaries; the root is depth 1
    std::size_t objectCount =
        1'000'000; ///< objects of the whole tree, keys too; one that is referred to twice counts twice
};

/// Reads a property list in the binary ("bplist00") or the XML format, told apart by its first bytes. Strings are UTF-8
/// without NUL, because paths and identifiers are made of them. Of equal keys of a dictionary the last one counts.
///
/// Refused: UTF-16 documents, XML with an internal DTD subset, null, set and UID objects, integers outside 64 bits.
[[nodiscard]] std::expected<OSTValue, PropertyListError> parsePropertyList(std::string_view bytes,
                                                                           const PropertyListLimits& limits = {});

/// Writes `root` in the binary format; equal values always give the same bytes. Equal strings, numbers and data are
/// written once (above 16 bytes: once for every 32 references, so that the tree of a file never outgrows what the
/// reader allows); references and offsets have the least width.
///
/// Bytes of a string that are not UTF-8 are written as U+FFFD. The nesting of `root` must be bounded, as that of every
/// value from a reader is.
[[nodiscard]] std::string serializeBinaryPropertyList(const OSTDictionary& root);

} // namespace ost::platform
