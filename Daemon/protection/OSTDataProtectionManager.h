#pragma once

#include "model/OSTContainerName.h"
#include "platform/base/OSTError.h"

#include <cstdint>
#include <functional>

namespace ost {

/// A data container that is to get another data-protection class.
struct OSTDataProtectionRequest {
    OSTContainerName container; ///< a live one of a per-user class
    std::int32_t dataProtectionClass = 0;
    bool isSecondOrThirdPartyApp = false; ///< allows fewer classes
    bool retryIfLocked = false;           ///< wait for an unlock when the device is locked
};

/// The info value that says which class a data container was last set to, a number.
inline constexpr const char* OSTContentProtectionClassKey = "com.tamarok.Tessaly.ContentProtectionClass";
/// The class of a data container that was never given one.
inline constexpr std::int32_t OSTDefaultContentProtectionClass = 3;

/// Gives data containers another data-protection class. One shared instance, without state. Threads: any.
class OSTDataProtectionManager {
public:
    static const OSTDataProtectionManager& defaultManager();

    /// Gets `success` or a code: `invalidObject` (no identifier, or not a per-user class), `notFound`,
    /// `invalidParameter` (a class that may not be), `unexpectedPath` (the container was replaced meanwhile),
    /// `lockedWithoutRetry`, or the errno of an item that could not be changed.
    using Completion = std::move_only_function<void(OSTErrorCode)>;

    /// Changes the class of the container's user data and records it. Calls `completion` before it returns or, when the
    /// change has to wait for an unlock, later on the lock-state queue; an end of the daemon before that drops it.
    void setDataProtectionOnDataContainerForUser(const OSTDataProtectionRequest& request, Completion completion) const;

private:
    OSTDataProtectionManager() = default;
};

} // namespace ost
