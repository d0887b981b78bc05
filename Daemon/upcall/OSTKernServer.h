#pragma once

#include "platform/base/Errno.h"
#include "platform/base/FileDescriptor.h"
#include "platform/ipc/UpcallPort.h"
#include "platform/threads/RunLoop.h"

#include <expected>
#include <memory>
#include <optional>

namespace ost {

/// Handles one message: the kernel's question which containers a process gets. Whatever else is wrong with a message, a
/// failure reply says it; a message of an unknown id is not handled. Takes the message's region.
[[nodiscard]] std::optional<platform::UpcallReply> demux_server(platform::UpcallMessage& message);

/// Starts to answer the kernel's messages on `loop`, one at a time. `receiveRight` is the port's listening socket, or
/// the errno of its check-in. Null, with the reason in the log, when the port or its receive source cannot be had.
[[nodiscard]] std::unique_ptr<platform::UpcallPort>
OSTKernServerStart(platform::RunLoop& loop, std::expected<platform::FileDescriptor, platform::Errno> receiveRight);

} // namespace ost
