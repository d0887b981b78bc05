#pragma once

#include "platform/base/OSTValue.h"

#include <cstddef>
#include <expected>
#include <string>

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

} // namespace ost::platform
