#pragma once

#include "Support/BootedDevice.h"

#include <sys/types.h>

#include <cstddef>
#include <functional>
#include <string>
#include <vector>

namespace ost::test {

/// The error lines of a device's daemons from the moment on that the object was made.
class DeviceLog {
public:
    explicit DeviceLog(const BootedDevice& device) : _device(device), _seen(device.complaints().size()) {}

    /// The error lines since the last call, as "function: message". A line that is not of the log's form fails the
    /// test.
    [[nodiscard]] std::vector<std::string> takeErrors();

private:
    const BootedDevice& _device;
    std::size_t _seen;
};

/// The number of times that `text` occurs in the log file of a device.
[[nodiscard]] std::size_t linesInLogFile(const BootedDevice& device, const std::string& text);

/// The open descriptors of a process.
[[nodiscard]] std::size_t openDescriptors(pid_t process);

/// The bytes of memory that a process has.
[[nodiscard]] std::size_t residentMemory(pid_t process);

/// Waits until something is so; false when it does not come about.
[[nodiscard]] bool comesTrue(const std::function<bool()>& condition);

} // namespace ost::test
