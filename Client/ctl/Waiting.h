#pragma once

#include "Client/Connection.h"
#include "Client/ctl/Output.h"

#include <chrono>
#include <functional>

namespace ostrand::ctl {

/// How long it is waited for a reply before somebody who looks on is told how far things are: the time limit of the
/// connections of commands that take long.
inline constexpr std::chrono::milliseconds betweenReports{500};

/// Waits for the end of a request that was only sent, and calls `report` each time the connection's time limit passes.
[[nodiscard]] std::expected<void, Failure>
waitForReply(Connection& connection, const Result<std::uint32_t>& requestNumber, const std::function<void()>& report);

/// "3.142".
[[nodiscard]] std::string secondsSince(std::chrono::steady_clock::time_point begin);

} // namespace ostrand::ctl
