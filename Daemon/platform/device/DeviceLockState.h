#pragma once

#include "platform/base/Errno.h"
#include "platform/threads/RunLoop.h"

#include <expected>
#include <functional>
#include <memory>
#include <string>

namespace ost::platform {

/// The device's lock state is a decimal number in a file of the device, which the system's key store writes.

inline constexpr const char* deviceLockStateFile = "/private/var/run/device-lock-state";

inline constexpr int deviceUnlocked = 0;
inline constexpr int deviceLocked = 1;
inline constexpr int deviceLockStateUnknown = -1;

/// The current state of the device that one runs on: 0 when nobody has written one, `deviceLockStateUnknown` when the
/// file is anything but a number. Reads the file when it has changed, so it may be asked for each of many items. Fails
/// with the errno of reading when that says nothing about the file.
[[nodiscard]] std::expected<int, Errno> deviceLockState();
/// The same for the device whose image is the directory `image`.
[[nodiscard]] std::expected<int, Errno> deviceLockState(const std::string& image);

/// Replaces the state of a device, given by its image or "" for the device that one runs on. Fails with the errno of
/// writing the file, and then leaves the old state.
[[nodiscard]] std::expected<void, Errno> writeDeviceLockState(int state, const std::string& image = "");

/// The notification of a changed lock state. Belongs to the thread of its run loop.
class DeviceLockStateNotification {
public:
    /// Gives false when it could not read the state, and is called again a second later.
    using Handler = std::move_only_function<bool()>;

    /// Calls `handler` on `loop` after the state's file was written, replaced or removed; changes that come together
    /// are one call. Fails with the errno of the watch on the file's directory, or of the timer.
    [[nodiscard]] static std::expected<std::unique_ptr<DeviceLockStateNotification>, Errno>
    registerHandler(RunLoop& loop, Handler handler);

private:
    DeviceLockStateNotification(FileDescriptor watch, FileDescriptor timer, Handler handler)
        : _watch(std::move(watch)), _timer(std::move(timer)), _handler(std::move(handler)) {}

    void _notify();

    FileDescriptor _watch, _timer;
    Handler _handler;
    RunLoop::Source _watchSource, _timerSource; // declared last: go before the descriptors they listen to
};

} // namespace ost::platform
