#pragma once

#include "platform/codec/PropertyListReading.h"

#include <expected>
#include <string>
#include <string_view>

namespace ost::platform {

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
