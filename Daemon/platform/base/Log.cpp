#include "platform/base/Log.h"

#include "platform/base/Immortal.h"

#include <fcntl.h>
#include <poll.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <climits>
#include <cstdio>
#include <ctime>

namespace ost::platform {

namespace {

const char* nameOf(LogLevel level) {
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

std::string linePrefix(LogLevel level) {
    timespec now{};
    ::clock_gettime(CLOCK_REALTIME, &now);
    tm utc{};
    ::gmtime_r(&now.tv_sec, &utc);
    char buffer[96];
    const auto date = std::strftime(buffer, sizeof buffer, "%Y-%m-%dT%H:%M:%S", &utc);
    const auto rest = std::snprintf(buffer + date, sizeof buffer - date, ".%06ldZ <%s> [%d:%d] ", now.tv_nsec / 1000,
                                    nameOf(level), ::getpid(), ::gettid());
    return {buffer, date + static_cast<std::size_t>(rest)};
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
    line += '\n';

    const MutexLock lock(_mutex);
    if (level == LogLevel::error)
        copyToStandardError(line);
    if (_disk.path.empty() || (!_fileIsLinked() && !_openFile()))
        return;
    if (_written > 0 && _written + line.size() > _disk.size)
        _rotate();
    if (_file && ::write(_file.get(), line.data(), line.size()) > 0)
        _written += line.size();
}

} // namespace ost::platform
