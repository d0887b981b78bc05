#pragma once

#include "platform/base/Errno.h"

#include <sys/types.h>

#include <expected>
#include <string>

namespace ost::platform {

/// POSIX semaphores by name, used as markers: they are there until the device reboots. `name` has no slash.

/// Fails with an errno that says nothing about the semaphore, such as a want of descriptors.
[[nodiscard]] std::expected<bool, Errno> namedSemaphoreExists(const std::string& name);

/// Makes the semaphore; one that exists stays as it is. Fails with the errno of sem_open.
[[nodiscard]] std::expected<void, Errno> createNamedSemaphore(const std::string& name, mode_t mode,
                                                              unsigned initialValue);

} // namespace ost::platform
