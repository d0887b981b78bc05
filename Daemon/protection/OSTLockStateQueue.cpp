#include "protection/OSTLockStateQueue.h"

#include "platform/base/Immortal.h"
#include "platform/base/Log.h"
#include "platform/device/DeviceLockState.h"

namespace ost {

platform::WorkQueue& OSTLockStateQueue() {
    static platform::Immortal queue([] { return platform::WorkQueue("com.tamarok.ostrandd.lockstate"); });
    return *queue;
}

void OSTLockStateFollower::brevind_notification_callback() {
    const auto state = platform::deviceLockState();
    platform::logDebug("LockState=%d", state);
    if (state == static_cast<std::int64_t>(State::locked)) {
        if (_remembered != State::locked)
            OSTLockStateQueue().suspend();
        _remembered = State::locked;
    } else if (state == static_cast<std::int64_t>(State::unlocked)) {
        if (_remembered == State::locked)
            OSTLockStateQueue().resume();
        _remembered = State::unlocked;
    }
}

} // namespace ost
