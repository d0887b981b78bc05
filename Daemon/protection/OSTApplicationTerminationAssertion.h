#pragma once

#include "platform/device/TerminationAssertion.h"

#include <cstdint>
#include <memory>
#include <string>

namespace ost {

/// A termination assertion that was granted: the application does not run until it is invalidated.
///
/// Threads: one at a time. Ownership: whoever has it invalidates it before he lets it go; the process stops otherwise.
class OSTApplicationTerminationAssertion {
public:
    /// The reasons, by their numbers. Any other stops the process.
    enum class Reason : std::uint8_t { installation = 0, cacheDeletion = 1, critical = 255 };

    /// Takes an assertion and waits until it is granted, which ends the application. Null, with the reason in the log,
    /// when it is refused.
    [[nodiscard]] static std::unique_ptr<OSTApplicationTerminationAssertion>
    withBundleIdentifier(const std::string& bundleIdentifier, Reason reason);

    OSTApplicationTerminationAssertion(const OSTApplicationTerminationAssertion&) = delete;
    OSTApplicationTerminationAssertion& operator=(const OSTApplicationTerminationAssertion&) = delete;
    ~OSTApplicationTerminationAssertion();

    /// Does nothing when it was called before.
    void invalidate();

private:
    explicit OSTApplicationTerminationAssertion(std::unique_ptr<platform::TerminationAssertion> termAssertion)
        : _termAssertion(std::move(termAssertion)) {}

    std::unique_ptr<platform::TerminationAssertion> _termAssertion;
};

} // namespace ost
