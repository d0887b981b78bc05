#pragma once

#include <optional>
#include <string>
#include <string_view>

namespace ost::platform {

/// A key as a file name: every byte outside `A-Z a-z 0-9 . _ -`, and a leading dot, as `%XX`. Different keys have
/// different names, and none begins with a dot, which leaves such names for temporary files.
[[nodiscard]] std::string fileNameForKey(std::string_view key);
/// The key of which that is the name; none when it is the name of no key.
[[nodiscard]] std::optional<std::string> keyOfFileName(std::string_view name);

} // namespace ost::platform
