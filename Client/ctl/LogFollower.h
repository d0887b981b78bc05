#pragma once

#include "platform/base/Errno.h"
#include "platform/base/FileDescriptor.h"

#include <expected>
#include <string>
#include <sys/types.h>
#include <vector>

namespace ostrand::ctl {

/// Reads the log of a device's daemon as it grows, also when it begins anew or is replaced. Lines that come and go
/// between two calls, which takes a whole log, are missed. Threads: one at a time.
class LogFollower {
public:
    /// Begins before the first line. Fails when the log's directory cannot be opened; the file itself may come later.
    [[nodiscard]] static std::expected<LogFollower, ost::platform::Errno> open(const std::string& device);

    /// Whole lines that were not read yet; none when there are none now.
    [[nodiscard]] std::vector<std::string> read();

    /// Waits until something in the log's directory changes.
    [[nodiscard]] std::expected<void, ost::platform::Errno> wait();

private:
    LogFollower(ost::platform::FileDescriptor directory, ost::platform::FileDescriptor changes)
        : _directory(std::move(directory)), _changes(std::move(changes)) {}

    void _readOn(std::vector<std::string>& lines);
    [[nodiscard]] bool _isReplaced() const;

    ost::platform::FileDescriptor _directory, _changes, _file;
    off_t _offset = 0;
    std::string _begun; ///< of a line whose end is not there yet
};

} // namespace ostrand::ctl
