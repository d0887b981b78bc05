#include "platform/device/CrashReport.h"

#include "platform/base/FileDescriptor.h"
#include "platform/base/Immortal.h"

#include <fcntl.h>
#include <poll.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <climits>
#include <cstdio>
#include <cstdlib>
#include <ctime>
#include <mutex>
#include <string>

namespace ost::platform {

namespace {

void makeDirectories(const std::string& directory) {
    for (auto slash = directory.find('/', 1); slash != std::string::npos; slash = directory.find('/', slash + 1))
        ::mkdir(directory.substr(0, slash).c_str(), 0755);
    ::mkdir(directory.c_str(), 0755);
}

std::string reportFile() {
    const auto now = std::time(nullptr);
    tm utc{};
    ::gmtime_r(&now, &utc);
    char time[32] = "";
    std::strftime(time, sizeof time, "%Y-%m-%d-%H%M%S", &utc);
    return std::string(crashReportDirectory) + "/ostrandd-" + time + "-" + std::to_string(::getpid()) + ".crash";
}

/// Root's alone: a report may quote what a client sent.
void writeReport(std::string_view message) {
    makeDirectories(crashReportDirectory);
    const FileDescriptor file(
        ::open(reportFile().c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_NOFOLLOW | O_CLOEXEC | O_NONBLOCK, 0600));
    while (file && !message.empty()) {
        const auto written = ::write(file.get(), message.data(), message.size());
        if (written <= 0)
            return;
        message.remove_prefix(static_cast<std::size_t>(written));
    }
}

/// Stops where it would wait: the end must come even if nobody reads what is written.
void writeToStandardError(std::string_view message) {
    pollfd out{.fd = STDERR_FILENO, .events = POLLOUT, .revents = 0};
    while (!message.empty() && ::poll(&out, 1, 0) == 1 && (out.revents & POLLOUT) != 0) {
        // A writable pipe takes this much without waiting.
        const auto written = ::write(STDERR_FILENO, message.data(), std::min<std::size_t>(message.size(), PIPE_BUF));
        if (written <= 0)
            return;
        message.remove_prefix(static_cast<std::size_t>(written));
    }
}

} // namespace

void crashWithMessage(std::string_view message) {
    // Never unlocked: the process ends here.
    static Immortal slot([] { return std::mutex(); });
    (*slot).lock();
    auto text = std::string(message);
    if (!text.ends_with('\n'))
        text += '\n';
    writeReport(text);
    writeToStandardError(text);
    std::abort();
}

} // namespace ost::platform
