#pragma once

#include "platform/base/Errno.h"

#include <sys/types.h>

#include <cstdint>
#include <expected>

namespace ost::platform {

/// One process, told apart from later ones that get its number. A value.
struct ProcessInstance {
    pid_t pid = 0;
    std::uint64_t startTime = 0; ///< in ticks since the system started

    friend bool operator==(const ProcessInstance&, const ProcessInstance&) = default;
};

/// The process that has the number now. Fails with ESRCH when there is none; one of which all threads have ended is
/// none, although its parent has not waited for it yet. Any other errno means that nobody could look.
[[nodiscard]] std::expected<ProcessInstance, Errno> processInstance(pid_t pid);

/// Whether that very process still runs. Fails like `processInstance`, but never with ESRCH.
[[nodiscard]] std::expected<bool, Errno> isRunning(const ProcessInstance& process);

} // namespace ost::platform
