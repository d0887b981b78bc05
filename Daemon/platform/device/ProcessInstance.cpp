#include "platform/device/ProcessInstance.h"

#include "platform/base/FileDescriptor.h"
#include "platform/base/Text.h"
#include "platform/base/Try.h"

#include <fcntl.h>
#include <signal.h> // NOLINT(modernize-deprecated-headers): kill is POSIX's
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <charconv>
#include <optional>
#include <string>
#include <string_view>

namespace ost::platform {

namespace {

// Positions behind the process's name, which may itself hold spaces and parentheses.
constexpr std::size_t stateField = 0, threadCountField = 17, startTimeField = 19, fieldCount = 20;

std::expected<std::string, Errno> statusLine(pid_t pid) {
    const auto path = "/proc/" + std::to_string(pid) + "/stat";
    const FileDescriptor file(::open(path.c_str(), O_RDONLY | O_CLOEXEC));
    if (!file) {
        const int error = errno;
        // Without a mounted /proc nothing is there either.
        return std::unexpected(error == ENOENT && ::kill(pid, 0) != 0 && errno == ESRCH ? ESRCH : error);
    }
    std::string line(4096, '\0');
    const auto count = ::read(file.get(), line.data(), line.size());
    if (count < 0)
        return std::unexpected(errno);
    line.resize(static_cast<std::size_t>(count));
    return line;
}

std::optional<std::array<std::string_view, fieldCount>> fieldsOf(std::string_view line) {
    std::array<std::string_view, fieldCount> fields;
    const auto nameEnd = line.rfind(") ");
    if (nameEnd == line.npos)
        return std::nullopt;
    line.remove_prefix(nameEnd + 2);
    for (auto& field : fields) {
        field = takeUntil(line, ' ');
        if (field.empty())
            return std::nullopt;
    }
    return fields;
}

/// A first thread that has ended may have left others behind, which are the process.
bool hasEnded(const std::array<std::string_view, fieldCount>& fields) {
    const auto state = fields[stateField], threads = fields[threadCountField];
    return (state == "Z" || state == "X") && (threads == "0" || threads == "1");
}

} // namespace

std::expected<ProcessInstance, Errno> processInstance(pid_t pid) {
    const auto line = OST_TRY(statusLine(pid));
    const auto fields = fieldsOf(line);
    if (!fields)
        return std::unexpected(EBADMSG);
    if (hasEnded(*fields))
        return std::unexpected(ESRCH);
    ProcessInstance process{.pid = pid};
    const auto text = (*fields)[startTimeField];
    if (std::from_chars(text.data(), text.data() + text.size(), process.startTime).ec != std::errc{})
        return std::unexpected(EBADMSG);
    return process;
}

std::expected<bool, Errno> isRunning(const ProcessInstance& process) {
    const auto now = processInstance(process.pid);
    if (!now && now.error() != ESRCH)
        return std::unexpected(now.error());
    return now && *now == process;
}

} // namespace ost::platform
