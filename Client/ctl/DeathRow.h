#pragma once

#include "platform/base/Errno.h"

#include <cstdint>
#include <expected>
#include <string>
#include <vector>

namespace ostrand::ctl {

/// Something that waits to be destroyed.
struct CondemnedItem {
    std::string name;       ///< of its directory on death row
    std::string identifier; ///< of the container that it was; empty when that cannot be told
    std::uint64_t files = 0, bytes = 0;
    bool measured = true; ///< false: parts of it could not be looked at, and are not counted
};

/// What lies on the death row of a device, as root sees it: nothing is changed, no link followed and no file waited
/// for. ENOENT never: without the directory nothing waits.
[[nodiscard]] std::expected<std::vector<CondemnedItem>, ost::platform::Errno> deathRowOf(const std::string& device);

/// How many items lie there; 0 also when that cannot be told.
[[nodiscard]] std::size_t deathRowLength(const std::string& device);

} // namespace ostrand::ctl
