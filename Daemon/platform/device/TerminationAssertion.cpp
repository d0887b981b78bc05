#include "platform/device/TerminationAssertion.h"

#include "platform/base/FileDescriptor.h"
#include "platform/base/Try.h"

#include <poll.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <csignal>
#include <vector>

namespace ost::platform {

namespace {

using Clock = std::chrono::steady_clock;

constexpr std::chrono::seconds timeToEndInOrder{5};
/// A killed process ends at once, unless it waits for a device that does not answer.
constexpr std::chrono::seconds timeToEndWhenKilled{10};

const char* nameOf(TerminationAssertion::Reason reason) {
    switch (reason) {
    case TerminationAssertion::Reason::installation:
        return "installation";
    case TerminationAssertion::Reason::cacheDeletion:
        return "cache deletion";
    case TerminationAssertion::Reason::critical:
        return "critical";
    }
    return "";
}

/// Descriptors of exactly these processes. One that has ended, or whose number is another's by now, has none.
std::expected<std::vector<FileDescriptor>, Errno> openProcesses(const std::vector<ProcessInstance>& processes) {
    std::vector<FileDescriptor> opened;
    for (const auto& process : processes) {
        FileDescriptor descriptor(static_cast<int>(::syscall(SYS_pidfd_open, process.pid, 0)));
        if (!descriptor && errno != ESRCH)
            return std::unexpected(errno);
        // Looked at last: one that runs now under this number ran when the descriptor was opened.
        if (descriptor && process.pid != ::getpid() && OST_TRY(isRunning(process)))
            opened.push_back(std::move(descriptor));
    }
    return opened;
}

/// Waits until the process has ended, at most until `deadline`.
bool waitForEnd(const FileDescriptor& process, Clock::time_point deadline) {
    for (;;) {
        pollfd end{.fd = process.get(), .events = POLLIN, .revents = 0};
        const auto left = std::chrono::ceil<std::chrono::milliseconds>(deadline - Clock::now());
        const int ready = ::poll(&end, 1, static_cast<int>(std::max<std::int64_t>(left.count(), 0)));
        if (ready > 0)
            return true;
        if (ready == 0 || errno != EINTR)
            return false;
    }
}

/// Sends the signal to all and lets go of those that end in the time.
void end(std::vector<FileDescriptor>& processes, int signal, std::chrono::seconds time) {
    for (const auto& process : processes)
        ::syscall(SYS_pidfd_send_signal, process.get(), signal, nullptr, 0); // fails for one that has ended
    const auto deadline = Clock::now() + time;
    std::erase_if(processes, [&](const FileDescriptor& process) { return waitForEnd(process, deadline); });
}

/// Ends every process of the application, those too that had begun to start when the assertion was recorded.
std::expected<void, Errno> endProcesses(std::string_view identifier) {
    for (;;) {
        const auto running = OST_TRY(applicationProcesses(identifier));
        auto processes = OST_TRY(openProcesses(running));
        if (processes.empty())
            return {};
        end(processes, SIGTERM, timeToEndInOrder);
        end(processes, SIGKILL, timeToEndWhenKilled);
        if (!processes.empty())
            return std::unexpected(ETIMEDOUT);
    }
}

} // namespace

std::unique_ptr<TerminationAssertion> TerminationAssertion::create(std::string_view bundleIdentifier, Reason reason,
                                                                   Completion completion) {
    auto assertion = std::make_unique<TerminationAssertion>();
    const auto acquire = [&]() -> std::expected<void, Errno> {
        assertion->_record.emplace(OST_TRY(recordTerminationAssertion(bundleIdentifier, nameOf(reason))));
        return endProcesses(bundleIdentifier);
    };
    const auto acquired = acquire();
    completion(acquired ? Errno(0) : acquired.error());
    return assertion;
}

} // namespace ost::platform
