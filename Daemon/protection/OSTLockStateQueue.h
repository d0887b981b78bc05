#pragma once

#include "platform/threads/WorkQueue.h"

namespace ost {

/// The serial queue of data-protection changes that wait until the device is unlocked. Suspended while it is locked.
[[nodiscard]] platform::WorkQueue& OSTLockStateQueue();

/// Brings the lock-state queue in step with the device's lock state as it is now: suspends it once when the device is
/// locked and resumes it once when it is unlocked, however often either is reported. False, and nothing is done, when
/// the state cannot be read now. Threads: any.
bool brevind_notification_callback();

/// Opens a transaction and runs `work` on the lock-state queue as soon as the device is unlocked, after what came
/// before.
void run_when_unlocked(platform::WorkQueue::Work work);

} // namespace ost
