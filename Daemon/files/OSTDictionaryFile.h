#pragma once

#include "files/OSTFileManager.h"
#include "platform/base/OSTError.h"
#include "platform/base/OSTValue.h"

#include <cstddef>
#include <string_view>

namespace ost {

/// The largest metadata or replace file that is read or written.
inline constexpr std::size_t OSTSmallDictionaryFileSize = std::size_t{1} << 20U;
/// The largest code-signing mapping or legacy file that is read.
inline constexpr std::size_t OSTLargeDictionaryFileSize = std::size_t{64} << 20U;

/// Parses the bytes of a dictionary file, read from `path`, in either property-list encoding.
/// Fails with the general domain's `corruptPropertyList` when they are no property list or its root is no dictionary.
[[nodiscard]] OSTResult<OSTDictionary> OST_dictionaryWithContents(std::string_view bytes, std::string_view path);

/// Reads the dictionary file at `path`, which may be at most `maximumSize` bytes large and must be a regular file.
/// Fails with the read error (POSIX domain) or as above.
[[nodiscard]] OSTResult<OSTDictionary> OST_dictionaryWithContentsOfURL(std::string_view path, std::size_t maximumSize);

/// The bytes of a dictionary file, a binary property list. Fails with EFBIG (POSIX domain) when they are more than
/// `maximumSize`, since the file could not be read again.
[[nodiscard]] OSTResult<std::string> OST_contentsOfDictionary(const OSTDictionary& dictionary, std::string_view path,
                                                              std::size_t maximumSize);

/// Writes a dictionary file: atomically, without data protection, and durable when this returns. Fails as above or with
/// the write error.
[[nodiscard]] OSTResult<void> OST_writeToURL(const OSTDictionary& dictionary, std::string_view path,
                                             std::size_t maximumSize, OSTWorkshop workshop = OSTWorkshop::ownDirectory);

} // namespace ost
