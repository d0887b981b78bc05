#pragma once

#include "platform/base/Errno.h"

#include <cstddef>
#include <expected>
#include <string>
#include <string_view>

namespace ost::platform {

/// Whether a symbolic link may stand in the file's place.
enum class FinalLink { follow, refuse };

/// Reads a whole regular file of at most `limit` bytes without ever waiting for what stands in its place. Fails with
/// the errno of opening or reading it, EINVAL when it is not a regular file, EFBIG when it is larger.
[[nodiscard]] std::expected<std::string, Errno> readSmallFile(const char* path, std::size_t limit, FinalLink finalLink);
/// The same with a path relative to the directory `base`.
[[nodiscard]] std::expected<std::string, Errno> readSmallFile(int base, const char* path, std::size_t limit,
                                                              FinalLink finalLink);

/// Writes all of `bytes`, however little the file takes at a time. Fails with the errno of writing.
[[nodiscard]] std::expected<void, Errno> writeAll(int file, std::string_view bytes);

} // namespace ost::platform
