#pragma once

#include "platform/device/Applications.h"

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

namespace ost::platform {

/// Keeps an application from running, from the moment it is granted until it is invalidated: `ostrandctl run` starts
/// nothing meanwhile. One that was not invalidated when its process ended counts no more.
///
/// Threads: one at a time.
class TerminationAssertion {
public:
    enum class Reason : std::uint8_t { installation, cacheDeletion, critical };
    /// Gets 0 when the assertion is granted, else an errno.
    using Completion = std::move_only_function<void(Errno error)>;

    /// Records the assertion and ends the application's processes, which are asked first. Calls `completion` before it
    /// returns: with success when none of them is left, else with the errno of recording or of looking, or ETIMEDOUT
    /// when one cannot be ended.
    [[nodiscard]] static std::unique_ptr<TerminationAssertion> create(std::string_view bundleIdentifier, Reason reason,
                                                                      Completion completion);

    /// Ends the assertion.
    void invalidate() { _record.reset(); }

private:
    std::optional<ApplicationRecord> _record;
};

} // namespace ost::platform
