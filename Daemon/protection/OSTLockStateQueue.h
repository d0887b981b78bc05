#pragma once

#include "platform/threads/WorkQueue.h"

#include <cstdint>

namespace ost {

/// The serial queue of data-protection changes that wait until the device is unlocked. Suspended while it is locked.
[[nodiscard]] platform::WorkQueue& OSTLockStateQueue();

/// Keeps the lock-state queue in step with the device: suspends it once when the device is locked and resumes it once
/// when it is unlocked, however often either is reported.
///
/// Threads: the main thread alone.
class OSTLockStateFollower {
public:
    /// Acts on the device's current lock state.
    void brevind_notification_callback();

private:
    enum class State : std::int64_t { unlocked = 0, locked = 1, none = 3 };

    State _remembered = State::none; ///< the last state acted upon
};

} // namespace ost
