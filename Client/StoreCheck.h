#pragma once

#include "Client/Connection.h"

#include <expected>
#include <string>
#include <vector>

namespace ostrand {

/// Something in a device's store that does not agree with the rest of it.
struct Finding {
    std::string path; ///< of the device
    std::string what; ///< "two containers of com.example.Sketches"
    std::string meaning;
    std::string repair;
};

/// What a look at the store brought to light.
struct StoreReport {
    std::vector<Finding> findings;
    std::size_t containers = 0;          ///< that were looked at
    std::vector<std::string> waiting;    ///< what lies where things wait to be finished or destroyed, for people
    std::vector<std::string> unreadable; ///< what could not be looked at, and why
};

/// Looks at the store of the device whose directory is `device`, and at what its daemon says, while the daemon runs.
/// Changes nothing and follows no link. What changes meanwhile may be reported although it is in order.
[[nodiscard]] Result<StoreReport> checkStore(Connection& connection, const std::string& device);

} // namespace ostrand
