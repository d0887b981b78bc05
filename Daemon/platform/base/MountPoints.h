#pragma once

#include <string>
#include <vector>

namespace ost::platform {

/// The paths at which file systems are mounted, as far as the process sees them; none when the kernel does not say.
[[nodiscard]] std::vector<std::string> mountPoints();

} // namespace ost::platform
