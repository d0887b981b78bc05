#pragma once

#include "Client/Error.h"
#include "platform/base/FileDescriptor.h"

#include <chrono>
#include <optional>
#include <string>
#include <string_view>

namespace ostrand {

/// Connects a socket of a type (SOCK_STREAM) to a service of the device whose directory, as this process sees it, is
/// `device`. `timeout` bounds the wait for a place among those that the daemon has not accepted yet. Fails with the
/// errno of the attempt: ENOENT when the device is not booted, ECONNREFUSED when nobody serves it.
[[nodiscard]] Result<ost::platform::FileDescriptor>
connectToService(const std::string& device, std::string_view service, int type,
                 std::optional<std::chrono::milliseconds> timeout = {});

/// When a wait ends; absent: never.
using Deadline = std::optional<std::chrono::steady_clock::time_point>;

/// Waits until a socket has one of poll's events, and gives those that it has. Fails with ETIMEDOUT once the deadline
/// has passed.
[[nodiscard]] Result<short> awaitEvents(const ost::platform::FileDescriptor& socket, short events,
                                        const Deadline& deadline);

} // namespace ostrand
