#pragma once

#include "platform/base/Errno.h"
#include "platform/base/FileDescriptor.h"
#include "platform/base/MessageFormat.h"
#include "platform/base/Mutex.h"

#include <atomic>
#include <cstdint>
#include <expected>
#include <string>
#include <string_view>

namespace ost::platform {

enum class LogLevel : int { error = 3, notice = 5, debug = 7 };

/// The process's leveled, rotating log. One line is
/// `2026-11-22T19:46:01.123456Z <Error> [PID:TID] function: message`, written with one `write`.
///
/// Threads: any. Before `open`, and while the disk file cannot be written, lines are lost and nothing else happens;
/// error lines still reach standard error, which is never waited for.
class Log {
public:
    struct DiskFile {
        std::string path;
        unsigned files;     ///< files kept, the one being written included; at least 1
        std::uint64_t size; ///< bytes a file may reach before the next line starts a new one
    };

    static Log& shared();

    /// Writes lines of `level` and below to `file` from now on. Fails with the errno of opening the file; the file is
    /// then tried again at each line.
    std::expected<void, Errno> open(LogLevel level, DiskFile file);

    [[nodiscard]] bool accepts(LogLevel level) const { return level <= _level.load(std::memory_order_relaxed); }

    /// Writes one line, control characters of `message` (other than tab) escaped.
    void write(LogLevel level, std::string_view function, std::string_view message);

private:
    [[nodiscard]] bool _fileIsLinked() const OST_REQUIRES(_mutex);
    [[nodiscard]] std::expected<void, Errno> _openFile() OST_REQUIRES(_mutex);
    void _rotate() OST_REQUIRES(_mutex);

    std::atomic<LogLevel> _level{LogLevel::notice};
    Mutex _mutex;
    DiskFile _disk OST_GUARDED_BY(_mutex){};
    FileDescriptor _file OST_GUARDED_BY(_mutex);
    std::uint64_t _written OST_GUARDED_BY(_mutex) = 0;
};

/// Writes a line whose function field is the calling function's name.
template<typename... Arguments>
void logError(Message<Arguments...> format, const Arguments&... arguments);
template<typename... Arguments>
void logNotice(Message<Arguments...> format, const Arguments&... arguments);
template<typename... Arguments>
void logDebug(Message<Arguments...> format, const Arguments&... arguments);

/// Writes a line whose function field is `function`, for the names that are fixed.
template<typename... Arguments>
void logAs(LogLevel level, std::string_view function, Message<Arguments...> format, const Arguments&... arguments) {
    if (Log::shared().accepts(level))
        Log::shared().write(level, function, formatMessage<Arguments...>(format, arguments...));
}

/// The same with the function at the format's source location.
template<typename... Arguments>
void logHere(LogLevel level, Message<Arguments...> format, const Arguments&... arguments) {
    if (Log::shared().accepts(level))
        Log::shared().write(level, lastPartOfFunctionName(qualifiedFunctionName(format.where())),
                            formatMessage<Arguments...>(format, arguments...));
}

template<typename... Arguments>
void logError(Message<Arguments...> format, const Arguments&... arguments) {
    logHere<Arguments...>(LogLevel::error, format, arguments...);
}
template<typename... Arguments>
void logNotice(Message<Arguments...> format, const Arguments&... arguments) {
    logHere<Arguments...>(LogLevel::notice, format, arguments...);
}
template<typename... Arguments>
void logDebug(Message<Arguments...> format, const Arguments&... arguments) {
    logHere<Arguments...>(LogLevel::debug, format, arguments...);
}

} // namespace ost::platform
