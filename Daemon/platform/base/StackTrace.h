#pragma once

#include <string>
#include <vector>

namespace ost::platform {

/// The calling thread's call stack, innermost frame first, one frame a string.
[[nodiscard]] std::vector<std::string> callStackSymbols();

/// The call stack of the calling thread's last throw, for use where its exception is handled. Programs that are linked
/// with `-Wl,--wrap=__cxa_throw` record it when they throw; in others it is that of the handler.
[[nodiscard]] std::vector<std::string> exceptionCallStackSymbols();

} // namespace ost::platform
