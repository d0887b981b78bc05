#pragma once

#include <source_location>

namespace ost::platform {

/// Logs "Assertion failed: (condition), function name" at error level and aborts the process.
[[noreturn]] void assertionFailed(const char* condition, std::source_location where = std::source_location::current());

} // namespace ost::platform

/// Stops the process when an invariant of the program itself is broken, in every build. Client input, disk content and
/// errno never trip one.
#define OST_ASSERT(condition) ((condition) ? static_cast<void>(0) : ::ost::platform::assertionFailed(#condition))
