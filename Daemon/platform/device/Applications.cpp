#include "platform/device/Applications.h"

#include "platform/base/DirectoryNames.h"
#include "platform/base/FileName.h"
#include "platform/base/Path.h"
#include "platform/base/SmallFile.h"
#include "platform/base/Text.h"
#include "platform/base/Try.h"

#include <fcntl.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>

namespace ost::platform {

namespace {

constexpr std::size_t recordLimit = 4096; // far above a reason and two numbers
constexpr int directoryFlags = O_RDONLY | O_DIRECTORY;
/// Of a launcher that was killed, until the next takes its place: one at a time registers in a directory.
constexpr const char* unfinishedApplication = ".unfinished";

/// The content of a record; absent when the record has gone meanwhile.
std::expected<std::optional<std::string>, Errno> contentOf(const FileDescriptor& directory, const std::string& name) {
    auto content = readSmallFile(directory.get(), name.c_str(), recordLimit, FinalLink::refuse);
    if (content)
        return *std::move(content);
    if (content.error() == ENOENT)
        return std::nullopt;
    return std::unexpected(content.error());
}

/// The record appears with its text: half of one would not tell of which process it is. `unfinished` is its name until
/// then.
std::expected<void, Errno> makeRecord(const FileDescriptor& directory, const std::string& name, std::string_view text,
                                      const std::string& unfinished) {
    const FileDescriptor file(
        ::openat(directory.get(), unfinished.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_NOFOLLOW | O_CLOEXEC, 0644));
    if (!file)
        return std::unexpected(errno);
    const auto written = ::write(file.get(), text.data(), text.size());
    const bool isWhole = written == static_cast<ssize_t>(text.size());
    if (isWhole && ::renameat(directory.get(), unfinished.c_str(), directory.get(), name.c_str()) == 0)
        return {};
    const int error = isWhole || written < 0 ? errno : ENOSPC;
    ::unlinkat(directory.get(), unfinished.c_str(), 0);
    return std::unexpected(error);
}

/// The process of an application's record, absent when it is not running.
std::expected<std::optional<ProcessInstance>, Errno> processOfRecord(const FileDescriptor& directory,
                                                                     const std::string& name) {
    const auto pid = numberIn<pid_t>(name);
    if (!pid || *pid <= 0)
        return std::nullopt;
    const auto content = OST_TRY(contentOf(directory, name));
    if (!content)
        return std::nullopt;
    const auto process = processInstance(*pid);
    if (!process && process.error() != ESRCH)
        return std::unexpected(process.error());
    std::string_view text = *content;
    const auto startTime = takeUntil(text, '\n');
    if (!process || (!startTime.empty() && numberIn<std::uint64_t>(startTime) != process->startTime))
        return std::nullopt;
    return *process;
}

/// What an assertion's record says; a holder that cannot be read is absent.
struct Assertion {
    std::string reason;
    std::optional<ProcessInstance> holder;
};

Assertion parseAssertion(std::string_view text) {
    Assertion assertion{.reason = std::string(takeUntil(text, '\n')), .holder = {}};
    auto line = takeUntil(text, '\n');
    const auto pid = numberIn<pid_t>(takeUntil(line, ' '));
    const auto startTime = numberIn<std::uint64_t>(line);
    if (pid && startTime)
        assertion.holder = ProcessInstance{*pid, *startTime};
    return assertion;
}

/// The assertion of a record when it is held, absent when its holder or the record itself has gone.
std::expected<std::optional<Assertion>, Errno> assertionOfRecord(const FileDescriptor& directory,
                                                                 const std::string& name) {
    const auto content = OST_TRY(contentOf(directory, name));
    if (!content)
        return std::nullopt;
    auto assertion = parseAssertion(*content);
    if (assertion.holder && !OST_TRY(isRunning(*assertion.holder)))
        return std::nullopt;
    return assertion;
}

/// The records of one identifier below one of the two directories.
class ApplicationRecords {
public:
    ApplicationRecords(const char* kind, std::string_view identifier, const std::string& image)
        : _path(image + kind), _name(fileNameForKey(identifier)) {}

    /// The directory of the records, absent when there is none.
    [[nodiscard]] std::expected<std::optional<FileDescriptor>, Errno> existing() const {
        auto directory = openWithoutLinks(AT_FDCWD, pathByAppending(_path, _name).c_str(), directoryFlags);
        if (directory)
            return *std::move(directory);
        if (directory.error() == ENOENT)
            return std::nullopt;
        return std::unexpected(directory.error());
    }

    /// Makes a record with the help of `make`, in a directory that may go and come at any time.
    std::expected<ApplicationRecord, Errno> add(const std::string& name, const auto& make) const {
        if (_name.empty())
            return std::unexpected(EINVAL);
        auto parent = OST_TRY(_openOrMake(AT_FDCWD, _path));
        for (int attempt = 1;; ++attempt) {
            auto directory = _openOrMake(parent.get(), _name);
            const auto made = directory ? make(*directory) : std::unexpected(directory.error());
            if (made)
                return ApplicationRecord(std::move(parent), _name, *std::move(directory), name);
            if (made.error() != ENOENT || attempt == attempts)
                return std::unexpected(made.error());
        }
    }

private:
    static constexpr int attempts = 100;

    static std::expected<FileDescriptor, Errno> _openOrMake(int parent, const std::string& path) {
        // Others must not open it: who does can lock it for as long as they like.
        if (::mkdirat(parent, path.c_str(), 0700) != 0 && errno != EEXIST)
            return std::unexpected(errno);
        return openWithoutLinks(parent, path.c_str(), directoryFlags);
    }

    std::string _path, _name;
};

/// Removes the records of which `read` says that there is nothing to them any more. What cannot be told stays.
void removeStale(const FileDescriptor& directory, const auto& read) {
    const auto names = plainNames(directory);
    if (!names)
        return;
    for (const auto& name : *names)
        if (const auto meaning = read(directory, name); meaning && !*meaning)
            ::unlinkat(directory.get(), name.c_str(), 0);
}

} // namespace

ApplicationRecord::~ApplicationRecord() {
    if (!_directory)
        return;
    // An assertion that stays would count until its holder ends. Most reasons for that pass.
    constexpr int attempts = 3;
    for (int attempt = 1; ::unlinkat(_directory.get(), _name.c_str(), 0) != 0 && attempt < attempts;)
        ++attempt;
    ::unlinkat(_parent.get(), _directoryName.c_str(), AT_REMOVEDIR);
}

std::expected<ApplicationRecord, Errno> registerApplication(std::string_view identifier, const ProcessInstance& process,
                                                            const std::string& image) {
    const auto name = std::to_string(process.pid);
    const auto make = [&](const FileDescriptor& directory) -> std::expected<void, Errno> {
        // A number that was free when its record was looked at may be taken and recorded before it is removed.
        if (::flock(directory.get(), LOCK_EX) != 0)
            return std::unexpected(errno);
        removeStale(directory, processOfRecord);
        auto made = makeRecord(directory, name, std::to_string(process.startTime), unfinishedApplication);
        ::flock(directory.get(), LOCK_UN);
        return made;
    };
    return ApplicationRecords(applicationsDirectory, identifier, image).add(name, make);
}

std::expected<std::vector<ProcessInstance>, Errno> applicationProcesses(std::string_view identifier,
                                                                        const std::string& image) {
    std::vector<ProcessInstance> processes;
    const auto directory = OST_TRY(ApplicationRecords(applicationsDirectory, identifier, image).existing());
    if (!directory)
        return processes;
    for (const auto& name : OST_TRY(plainNames(*directory)))
        if (const auto process = OST_TRY(processOfRecord(*directory, name)))
            processes.push_back(*process);
    return processes;
}

std::expected<ApplicationRecord, Errno> recordTerminationAssertion(std::string_view identifier, std::string_view reason,
                                                                   const std::string& image) {
    static std::atomic<unsigned> count = 0;
    const auto holder = OST_TRY(processInstance(::getpid()));
    const auto number = std::to_string(holder.pid), start = std::to_string(holder.startTime);
    const auto name = number + "-" + start + "-" + std::to_string(count++);
    const auto text = std::string(reason) + "\n" + number + " " + start + "\n";
    const auto make = [&](const FileDescriptor& directory) -> std::expected<void, Errno> {
        removeStale(directory, assertionOfRecord);
        return makeRecord(directory, name, text, "." + name);
    };
    return ApplicationRecords(assertionsDirectory, identifier, image).add(name, make);
}

std::expected<std::optional<std::string>, Errno> terminationAssertion(std::string_view identifier,
                                                                      const std::string& image) {
    const auto directory = OST_TRY(ApplicationRecords(assertionsDirectory, identifier, image).existing());
    if (!directory)
        return std::nullopt;
    for (const auto& name : OST_TRY(plainNames(*directory)))
        if (auto assertion = OST_TRY(assertionOfRecord(*directory, name)))
            return std::move(assertion->reason);
    return std::nullopt;
}

} // namespace ost::platform
