#pragma once

#include <cstdint>
#include <string>

namespace ostrand {

/// What the "ReplyError" of a reply means, in words. The system's own codes come first; any other number is an errno of
/// a file operation ("system error: ..."), as far as the host knows it.
[[nodiscard]] std::string meaningOfErrorCode(std::uint64_t code);

} // namespace ostrand
