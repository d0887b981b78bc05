#include "protection/OSTApplicationTerminationAssertion.h"

#include "platform/base/Assert.h"
#include "platform/base/Log.h"

#include <atomic>
#include <cstdlib>
#include <semaphore>

namespace ost {

namespace {

platform::TerminationAssertion::Reason platformReason(OSTApplicationTerminationAssertion::Reason reason) {
    using enum OSTApplicationTerminationAssertion::Reason;
    switch (reason) {
    case installation:
        return platform::TerminationAssertion::Reason::installation;
    case cacheDeletion:
        return platform::TerminationAssertion::Reason::cacheDeletion;
    case critical:
        return platform::TerminationAssertion::Reason::critical;
    }
    platform::logAs(platform::LogLevel::error, "initWithBundleIdentifier", "Unknown reason: %d", reason);
    std::abort();
}

} // namespace

std::unique_ptr<OSTApplicationTerminationAssertion>
OSTApplicationTerminationAssertion::withBundleIdentifier(const std::string& bundleIdentifier, Reason reason) {
    constexpr const char* function = "initWithBundleIdentifier";
    std::binary_semaphore completed(0);
    std::atomic<bool> acquired = true;
    const auto completion = [&](platform::Errno error) {
        if (error != 0) {
            platform::logAs(platform::LogLevel::error, function, "Failed to acquire termination assertion for %@ : %@",
                            bundleIdentifier, error);
            acquired = false;
        }
        completed.release();
    };
    auto assertion = platform::TerminationAssertion::create(bundleIdentifier, platformReason(reason), completion);
    if (!assertion) {
        platform::logAs(platform::LogLevel::error, function, "Failed to get ZNSApplicationTerminationAssertion");
        return nullptr;
    }
    completed.acquire();
    if (!acquired) {
        assertion->invalidate();
        return nullptr;
    }
    return std::unique_ptr<OSTApplicationTerminationAssertion>(
        new OSTApplicationTerminationAssertion(std::move(assertion)));
}

OSTApplicationTerminationAssertion::~OSTApplicationTerminationAssertion() {
    if (_termAssertion)
        platform::assertionFailed("nil == _termAssertion");
}

void OSTApplicationTerminationAssertion::invalidate() {
    if (const auto assertion = std::exchange(_termAssertion, nullptr))
        assertion->invalidate();
}

} // namespace ost
