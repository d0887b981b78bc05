#pragma once

#include <string_view>

namespace ost::platform {

inline constexpr const char* crashReportDirectory = "/private/var/root/Library/Logs/CrashReporter";

/// Leaves `message` as the process's last words and aborts it: in the file ostrandd-TIME-PID.crash of the crash report
/// directory, which is made if need be, and on standard error, as far as either takes it. Of several threads that fail
/// at once the first one reports, and the others wait for the end.
[[noreturn]] void crashWithMessage(std::string_view message);

} // namespace ost::platform
