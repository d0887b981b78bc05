#pragma once

#include <string>
#include <string_view>

namespace ost::platform {

/// Names the calling thread. The kernel, and with it `ps` and the debuggers, keeps the first 15 bytes of what follows
/// the name's last dot; `currentThreadName` gives the whole name back.
void setCurrentThreadName(std::string_view name);

/// The name given to the calling thread, or an empty one.
[[nodiscard]] const std::string& currentThreadName() noexcept;

} // namespace ost::platform
