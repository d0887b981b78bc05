#include "platform/base/Log.h"

#include "platform/base/Immortal.h"

#include <fcntl.h>
#include <poll.h>
#include <sys/stat.h>
#include <sys/timerfd.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <climits>
#include <cstdio>
#include <ctime>
#include <optional>
#include <utility>

namespace ost::platform {

using namespace std::chrono_literals;

const char* nameOfLogLevel(LogLevel level) {
    switch (level) {
    case LogLevel::error:
        return "Error";
    case LogLevel::notice:
        return "Notice";
    case LogLevel::debug:
        return "Debug";
    }
    return "Error";
}

namespace {

/// The time as the lines have it, worked out once a second for each thread.
std::string_view dateAndTime(std::time_t second) {
    struct Shown {
        std::time_t second = -1;
        std::array<char, 32> text{};
        std::size_t size = 0;
    };
    thread_local Shown shown;
    if (second != shown.second) {
        tm utc{};
        ::gmtime_r(&second, &utc);
        shown.size = std::strftime(shown.text.data(), shown.text.size(), "%Y-%m-%dT%H:%M:%S", &utc);
        shown.second = second;
    }
    return {shown.text.data(), shown.size};
}

std::string linePrefix(LogLevel level) {
    timespec now{};
    ::clock_gettime(CLOCK_REALTIME, &now);
    char rest[64];
    const auto size = std::snprintf(rest, sizeof rest, ".%06ldZ <%s> [%d:%d] ", now.tv_nsec / 1000,
                                    nameOfLogLevel(level), ::getpid(), ::gettid());
    return std::string(dateAndTime(now.tv_sec)).append(rest, static_cast<std::size_t>(size));
}

/// A quarter: four users together still leave some of the file to root and to the daemon.
constexpr std::uint64_t partOfUser = 4;

/// Whom this thread's lines are caused by.
thread_local uid_t currentOrigin = 0;

/// Whether this thread has a batch.
thread_local bool isCollecting = false;
/// Some thirty lines: more would hardly save anything, and would be lost when the process is killed.
constexpr std::uint64_t batchSize = 4096;

std::string makeLine(LogLevel level, std::string_view function, std::string_view message) {
    std::string line = linePrefix(level);
    if (message.ends_with('\n')) // Some texts bring the end of their line with them.
        message.remove_suffix(1);
    line.append(function).append(": ");
    while (!message.empty()) {
        const auto tab = std::min(message.find('\t'), message.size());
        appendEscaped(line, message.substr(0, tab));
        if (tab < message.size())
            line += '\t';
        message.remove_prefix(std::min(tab + 1, message.size()));
    }
    return line += '\n';
}

/// Copies a line to standard error unless that would wait: its reader may have stopped reading.
void copyToStandardError(std::string_view line) {
    pollfd out{.fd = STDERR_FILENO, .events = POLLOUT, .revents = 0};
    if (::poll(&out, 1, 0) != 1 || (out.revents & POLLOUT) == 0)
        return;
    // A writable pipe takes PIPE_BUF bytes without waiting, and no more than that is sure.
    std::string shown(line.substr(0, PIPE_BUF));
    shown.back() = '\n';
    [[maybe_unused]] const auto written = ::write(STDERR_FILENO, shown.data(), shown.size());
}

} // namespace

Log& Log::shared() {
    static Immortal log([] { return Log(); });
    return *log;
}

std::expected<void, Errno> Log::open(LogLevel level, DiskFile file) {
    const MutexLock lock(_mutex);
    _level = level;
    _disk = std::move(file);
    if (!_timer)
        _timer.reset(::timerfd_create(CLOCK_MONOTONIC, TFD_CLOEXEC | TFD_NONBLOCK));
    return _openFile();
}

std::expected<void, Errno> Log::_openFile() {
    _file.reset(::open(_disk.path.c_str(),
                       O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC | O_NOFOLLOW | O_NONBLOCK | O_NOCTTY, 0644));
    struct stat status{};
    if (!_file || ::fstat(_file.get(), &status) != 0) {
        _file.reset();
        return std::unexpected(errno);
    }
    if (!S_ISREG(status.st_mode)) {
        _file.reset();
        return std::unexpected(EINVAL);
    }
    _written = static_cast<std::uint64_t>(status.st_size);
    return {};
}

/// Whether there is a file, and nobody has removed it meanwhile.
bool Log::_fileIsLinked() const {
    struct stat status{};
    return _file && (::fstat(_file.get(), &status) != 0 || status.st_nlink > 0);
}

void Log::_rotate() {
    if (_disk.files <= 1) {
        if (::ftruncate(_file.get(), 0) == 0)
            _written = 0;
        return;
    }
    const auto numbered = [&](unsigned number) OST_REQUIRES(_mutex) {
        return number == 0 ? _disk.path : _disk.path + "." + std::to_string(number);
    };
    for (unsigned number = _disk.files - 1; number > 0; --number)
        ::rename(numbered(number - 1).c_str(), numbered(number).c_str());
    [[maybe_unused]] const auto opened = _openFile();
}

void Log::write(LogLevel level, std::string_view function, std::string_view message) {
    const auto line = makeLine(level, function, message);
    const MutexLock lock(_mutex);
    if (level == LogLevel::error)
        copyToStandardError(line);
    if (currentOrigin == 0 || _mayCause(currentOrigin, line.size()))
        _put(line);
    if (level == LogLevel::error || !isCollecting)
        _putCollected();
}

/// Counts a line of a user, as one that is written or as one that is left out.
bool Log::_mayCause(uid_t user, std::size_t bytes) {
    const auto now = Clock::now();
    if (const auto known = _users.find(user); known == _users.end() || now - known->second.begin >= _disk.userTime)
        _sayWhatWasLeftOut(LeftOut::whereTimeIsOver);
    auto& ofUser = _users.try_emplace(user, OfUser{.begin = now}).first->second;
    if (_disk.path.empty() || (ofUser.leftOut == 0 && ofUser.bytes + bytes <= _disk.size / partOfUser)) {
        ofUser.bytes += bytes;
        return true;
    }
    if (ofUser.leftOut++ == 0)
        _armTimer();
    return false;
}

/// For the next user whose time is over and of whom there is something to say.
void Log::_armTimer() {
    std::optional<Clock::time_point> next;
    for (const auto& [user, caused] : _users)
        if (caused.leftOut > 0)
            next = std::min(next.value_or(Clock::time_point::max()), caused.begin + _disk.userTime);
    itimerspec time{};
    if (next) {
        const auto left = std::max(std::chrono::ceil<std::chrono::milliseconds>(*next - Clock::now()), 1ms).count();
        time.it_value = {.tv_sec = left / 1000, .tv_nsec = left % 1000 * 1'000'000};
    }
    ::timerfd_settime(_timer.get(), 0, &time, nullptr);
}

int Log::leftOutDescriptor() {
    const MutexLock lock(_mutex);
    return _timer.get();
}

void Log::sayWhatWasLeftOut(LeftOut where) {
    const MutexLock lock(_mutex);
    _sayWhatWasLeftOut(where);
    _putCollected();
}

void Log::_sayWhatWasLeftOut(LeftOut where) {
    const auto now = Clock::now();
    for (auto user = _users.begin(); user != _users.end();) {
        const auto& caused = user->second;
        if (where == LeftOut::whereTimeIsOver && now - caused.begin < _disk.userTime) {
            ++user;
            continue;
        }
        if (caused.leftOut > 0)
            _put(makeLine(LogLevel::error, "Log",
                          formatMessage("%llu lines that user %u caused were left out", caused.leftOut, user->first)));
        user = _users.erase(user);
    }
    _armTimer();
}

void Log::_put(std::string_view line) {
    if (!_collected.empty() && _collected.size() + line.size() > std::min(batchSize, _disk.size / partOfUser))
        _putCollected();
    _collected += line;
}

void Log::_putCollected() {
    const auto lines = std::exchange(_collected, {});
    if (lines.empty() || _disk.path.empty() || (!_fileIsLinked() && !_openFile()))
        return;
    if (_written > 0 && _written + lines.size() > _disk.size)
        _rotate();
    if (_file && ::write(_file.get(), lines.data(), lines.size()) > 0)
        _written += lines.size();
}

void Log::_writeCollected() {
    const MutexLock lock(_mutex);
    _putCollected();
}

LogOrigin::LogOrigin(uid_t user) : _before(std::exchange(currentOrigin, user)) {}

LogOrigin::~LogOrigin() { currentOrigin = _before; }

LogBatch::LogBatch() : _before(std::exchange(isCollecting, true)) {}

LogBatch::~LogBatch() {
    isCollecting = _before;
    Log::shared()._writeCollected();
}

} // namespace ost::platform
