#pragma once

#include "platform/base/FileDescriptor.h"
#include "platform/ipc/UpcallPort.h"
#include "platform/threads/RunLoop.h"

#include <expected>
#include <memory>

namespace ost {

/// The service name of the kernel's port to the daemon.
inline constexpr const char* OSTKernServiceName = "com.tamarok.ostrandd.upcall";

/// Starts to answer the kernel's messages on `loop`, one at a time. `receiveRight` is the port's listening socket, or
/// the errno of its check-in. Null, with the reason in the log, when the port or its receive source cannot be had.
[[nodiscard]] std::unique_ptr<platform::UpcallPort>
OSTKernServerStart(platform::RunLoop& loop, std::expected<platform::FileDescriptor, int> receiveRight);

} // namespace ost
