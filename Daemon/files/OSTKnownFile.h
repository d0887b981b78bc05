#pragma once

#include "platform/base/Errno.h"

#include <sys/types.h>

#include <ctime>
#include <expected>
#include <optional>
#include <string>

namespace ost {

/// What is known of a file that lies directly in a directory, so that looking again takes one system call and no
/// descriptor.
///
/// A directory holds what it held as long as it is the same one and its status has not changed, since every name that
/// comes or goes changes it. A change too shortly before the look proves nothing: a later one could bear the same time.
///
/// A value; the paths are the caller's.
class OSTKnownFile {
public:
    /// Whether an item of that name is in the directory at `path`. A link counts as nothing, in both places and on the
    /// way. Fails with the errno of looking.
    [[nodiscard]] std::expected<bool, platform::Errno> look(const std::string& path, const char* name);
    friend bool operator==(const OSTKnownFile&, const OSTKnownFile&) = default;

private:
    /// What tells a directory and its states apart.
    struct Status {
        dev_t device;
        ino_t inode;
        std::time_t changedSeconds;
        long changedNanoseconds;

        friend bool operator==(const Status&, const Status&) = default;
    };
    [[nodiscard]] static std::optional<Status> _statusOf(int directory, const char* path);
    [[nodiscard]] static bool _isSettled(const Status& status);
    [[nodiscard]] std::expected<bool, platform::Errno> _lookInside(const std::string& path, const char* name);

    std::optional<Status> _seen;
};

} // namespace ost
