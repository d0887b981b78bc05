#include "protection/OSTLockStateQueue.h"

#include "platform/base/Immortal.h"
#include "platform/base/Log.h"
#include "platform/device/DeviceLockState.h"
#include "platform/threads/Transactions.h"

#include <mutex>

namespace ost {

platform::WorkQueue& OSTLockStateQueue() {
    static platform::Immortal queue([] { return platform::WorkQueue("com.tamarok.ostrandd.lockstate"); });
    return *queue;
}

bool brevind_notification_callback() {
    static std::mutex mutex;
    static bool isSuspended = false; // guarded by the mutex, as is the order of looking and acting
    const std::lock_guard lock(mutex);
    const auto state = platform::deviceLockState();
    if (!state)
        return false;
    platform::logDebug("LockState=%d", *state);
    if (state == platform::deviceLocked && !isSuspended) {
        OSTLockStateQueue().suspend();
        isSuspended = true;
    } else if (state == platform::deviceUnlocked && isSuspended) {
        OSTLockStateQueue().resume();
        isSuspended = false;
    }
    return true;
}

void run_when_unlocked(platform::WorkQueue::Work work) {
    // The notification of a lock that the caller has just met may still be on its way.
    brevind_notification_callback();
    async_with_transaction(OSTLockStateQueue(), std::move(work));
}

} // namespace ost
