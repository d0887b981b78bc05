#pragma once

#include "platform/base/Errno.h"
#include "platform/base/FileDescriptor.h"

#include <expected>
#include <string>
#include <vector>

namespace ost::platform {

/// The names in an open directory, but for those that begin with a dot. Fails with the errno of reading it.
[[nodiscard]] std::expected<std::vector<std::string>, Errno> plainNames(const FileDescriptor& directory);
/// Those that do begin with a dot, but for "." and "..".
[[nodiscard]] std::expected<std::vector<std::string>, Errno> hiddenNames(const FileDescriptor& directory);

} // namespace ost::platform
