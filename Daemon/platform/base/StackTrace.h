#pragma once

#include <string>
#include <vector>

namespace ost::platform {

/// The call stack of the throw whose exception is being handled, innermost frame first, one frame a string: its address
/// and, where the program's symbol table has it, the function with the offset in it. The stack of the handler when
/// another thread threw the exception, or a shared library that does not call this program's hook.
///
/// Where memory has run out, frames are left out instead of an exception.
[[nodiscard]] std::vector<std::string> exceptionCallStackSymbols() noexcept;

} // namespace ost::platform
