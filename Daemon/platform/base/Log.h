#pragma once

#include "platform/base/Errno.h"
#include "platform/base/FileDescriptor.h"
#include "platform/base/MessageFormat.h"
#include "platform/base/Mutex.h"

#include <sys/types.h>

#include <atomic>
#include <chrono>
#include <cstddef>
#include <cstdint>
#include <expected>
#include <string>
#include <string_view>
#include <unordered_map>

namespace ost::platform {

enum class LogLevel : int { error = 3, notice = 5, debug = 7 };

/// "Error": as a line has it.
[[nodiscard]] const char* nameOfLogLevel(LogLevel level);

/// The process's leveled, rotating log. One line is
/// `2026-11-22T19:46:01.123456Z <Error> [PID:TID] function: message`, written with one `write`, alone or behind the
/// lines of a `LogBatch`. Lines stand in the file in the order in which they were logged.
///
/// Nobody above 0 fills the file: the lines that one user causes may take a quarter of its size in a while. What is
/// left out beyond that is counted, and said in one line. Standard error gets every error line.
///
/// Threads: any. Before `open`, and while the disk file cannot be written, lines are lost and nothing else happens;
/// error lines still reach standard error, which is never waited for.
class Log {
public:
    struct DiskFile {
        std::string path;
        unsigned files;     ///< files kept, the one being written included; at least 1
        std::uint64_t size; ///< bytes a file may reach before the next line starts a new one
        std::chrono::milliseconds userTime = std::chrono::minutes(10); ///< in which a user's lines take so much of it
    };

    static Log& shared();

    /// Writes lines of `level` and below to `file` from now on. Fails with the errno of opening the file; the file is
    /// then tried again at each line.
    std::expected<void, Errno> open(LogLevel level, DiskFile file);

    [[nodiscard]] bool accepts(LogLevel level) const { return level <= _level.load(std::memory_order_relaxed); }

    /// Writes one line, control characters of `message` (other than tab) escaped.
    void write(LogLevel level, std::string_view function, std::string_view message);

    /// Readable when the time of a user is over of whom lines were left out; -1 before `open`.
    [[nodiscard]] int leftOutDescriptor();
    /// Says how many lines were left out: of users whose time is over, or of all, and begins their time anew.
    enum class LeftOut : bool { whereTimeIsOver, everywhere };
    void sayWhatWasLeftOut(LeftOut where);

private:
    using Clock = std::chrono::steady_clock;

    /// What a user has caused since a moment.
    struct OfUser {
        Clock::time_point begin;
        std::uint64_t bytes = 0;
        std::uint64_t leftOut = 0; ///< lines
    };

    [[nodiscard]] bool _mayCause(uid_t user, std::size_t bytes) OST_REQUIRES(_mutex);
    void _sayWhatWasLeftOut(LeftOut where) OST_REQUIRES(_mutex);
    void _armTimer() OST_REQUIRES(_mutex);
    friend class LogBatch;
    void _writeCollected();
    void _put(std::string_view line) OST_REQUIRES(_mutex);
    void _putCollected() OST_REQUIRES(_mutex);
    [[nodiscard]] bool _fileIsLinked() const OST_REQUIRES(_mutex);
    [[nodiscard]] std::expected<void, Errno> _openFile() OST_REQUIRES(_mutex);
    void _rotate() OST_REQUIRES(_mutex);

    std::atomic<LogLevel> _level{LogLevel::notice};
    Mutex _mutex;
    DiskFile _disk OST_GUARDED_BY(_mutex){};
    FileDescriptor _file OST_GUARDED_BY(_mutex);
    std::uint64_t _written OST_GUARDED_BY(_mutex) = 0;
    std::string _collected OST_GUARDED_BY(_mutex); ///< lines of a batch that are not written yet
    std::unordered_map<uid_t, OfUser> _users OST_GUARDED_BY(_mutex);
    FileDescriptor _timer OST_GUARDED_BY(_mutex);
};

/// While it exists, the lines of its thread are caused by that user. Those of other threads are the daemon's own.
class LogOrigin {
public:
    explicit LogOrigin(uid_t user);
    LogOrigin(const LogOrigin&) = delete;
    LogOrigin& operator=(const LogOrigin&) = delete;
    ~LogOrigin();

private:
    const uid_t _before;
};

/// While it exists, lines of its thread below an error are collected and written some at a time: for work that logs
/// thousands. An error line, a line of another thread and the end of the batch write what was collected before.
class LogBatch {
public:
    LogBatch();
    LogBatch(const LogBatch&) = delete;
    LogBatch& operator=(const LogBatch&) = delete;
    ~LogBatch();

private:
    const bool _before;
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
