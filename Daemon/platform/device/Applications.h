#pragma once

#include "platform/base/Errno.h"
#include "platform/base/FileDescriptor.h"
#include "platform/device/ProcessInstance.h"

#include <expected>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace ost::platform {

/// Which applications run, and which must not: files that an administrator can look at, below two directories with one
/// sub-directory for each identifier, named by `fileNameForKey`. They do not survive a reboot.
///
/// An application that starts registers itself and then looks for an assertion; an assertion is recorded and then looks
/// for processes. So neither misses the other, whoever comes first.
///
/// Threads: any. `image` is the device's directory as this process sees it. Fails with an errno: ENAMETOOLONG for an
/// identifier too long for a file name, EINVAL for an empty one.

/// `PID` in an identifier's directory, with the start time of that process in it; an empty one stands for whatever
/// process has the number.
inline constexpr const char* applicationsDirectory = "/private/var/run/applications";
/// One file for each assertion, whatever its name: a line with the reason, a line with number and start time of the
/// process that holds it. Names with a leading dot are not finished.
inline constexpr const char* assertionsDirectory = "/private/var/run/assertions";

/// One such file, removed when the object goes, and its directory with it when nothing else is in there.
class ApplicationRecord {
public:
    /// Takes over the file `name` in the directory `directoryName` of `parent`.
    ApplicationRecord(FileDescriptor parent, std::string directoryName, FileDescriptor directory, std::string name)
        : _parent(std::move(parent)), _directory(std::move(directory)), _directoryName(std::move(directoryName)),
          _name(std::move(name)) {}
    ApplicationRecord(ApplicationRecord&&) noexcept = default;
    ApplicationRecord& operator=(ApplicationRecord&&) = delete;
    ~ApplicationRecord();

private:
    FileDescriptor _parent, _directory; ///< empty once moved from
    std::string _directoryName, _name;
};

/// Records that a process runs as the application. The record must go before the process is waited for, because then
/// its number is free for another one. Records that killed launchers left behind are removed.
[[nodiscard]] std::expected<ApplicationRecord, Errno>
registerApplication(std::string_view identifier, const ProcessInstance& process, const std::string& image = "");

/// The processes that run as the application; records of others are passed over.
[[nodiscard]] std::expected<std::vector<ProcessInstance>, Errno> applicationProcesses(std::string_view identifier,
                                                                                      const std::string& image = "");

/// Holds an assertion, for the calling process, that the application does not run. `reason` is one line. Those that
/// ended holders left behind are removed.
[[nodiscard]] std::expected<ApplicationRecord, Errno>
recordTerminationAssertion(std::string_view identifier, std::string_view reason, const std::string& image = "");

/// The reason of an assertion that is held for the application, absent when there is none. One whose holder cannot be
/// told counts as held.
[[nodiscard]] std::expected<std::optional<std::string>, Errno> terminationAssertion(std::string_view identifier,
                                                                                    const std::string& image = "");

} // namespace ost::platform
