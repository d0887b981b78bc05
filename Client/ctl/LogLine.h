#pragma once

#include "platform/base/Log.h"
#include "platform/base/OSTValue.h"

#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace ostrand::ctl {

/// What a line of the log weighs, the heaviest first.
using LogLevel = ost::platform::LogLevel;

/// What users call the levels: "error", "notice", "debug".
[[nodiscard]] std::vector<std::string> logLevelNames();
/// The level of that name, in any case.
[[nodiscard]] std::optional<LogLevel> logLevelNamed(std::string_view name);

/// One line of the daemon's log: "2026-11-22T19:46:01.123456Z <Error> [PID:TID] function: message".
struct LogLine {
    std::string text; ///< as it stands in the file, without its end
    LogLevel level = LogLevel::error;
    std::string time, thread, message; ///< a line of another form is all message, and of the level error

    [[nodiscard]] static LogLine parse(std::string text);
    [[nodiscard]] ost::OSTDictionary json() const;
};

} // namespace ostrand::ctl
