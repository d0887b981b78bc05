#pragma once

#include "Protocol/OSTContainerClass.h"
#include "files/OSTFileManager.h"
#include "platform/base/Mutex.h"

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

namespace ost {

/// Where a user's containers lie inside the home directory, and the transient ones.
inline constexpr std::string_view OSTUserBaseDirectoryName = "Containers";
inline constexpr std::string_view OSTUserTransientDirectoryName = "Library/Caches/com.tamarok.ostrandd/Temp";

/// Names the directories inside one real user's home, and makes each at every access. A user without a home directory
/// has no paths. No accessor fails: what cannot be made is logged, and the operation that then uses the directory
/// fails.
///
/// Threads: any. Owned by `OSTGlobalConfiguration`, never dropped.
class OSTPerUserConfiguration {
public:
    /// Null, with a log line, for a user id of 500 or less.
    [[nodiscard]] static std::unique_ptr<OSTPerUserConfiguration> withUserId(std::uint32_t userId);

    [[nodiscard]] std::uint32_t userId() const { return _userId; }
    /// The real path of the home directory in the password database.
    [[nodiscard]] const std::optional<std::string>& userHomeDirectory() const { return _userHomeDirectory; }
    /// Whether the home directory exists.
    [[nodiscard]] bool existsUserBaseDirectory() const;

    [[nodiscard]] std::optional<std::string> userBaseDirectory();
    [[nodiscard]] std::optional<std::string> transientDirectory();
    /// Where older releases kept their library and their log. Never made.
    [[nodiscard]] std::optional<std::string> oldLibraryDirectoryPath() const;
    [[nodiscard]] std::optional<std::string> oldLoggingPath() const;

    /// The directory of a per-user class; none, with a log line, for any other class.
    [[nodiscard]] std::optional<std::string> containerDirectoryURLForContentClass(OSTContainerClass contentClass,
                                                                                  bool transient);

private:
    OSTPerUserConfiguration(std::uint32_t userId, std::optional<std::string> home)
        : _userId(userId), _userHomeDirectory(std::move(home)) {}

    [[nodiscard]] std::optional<std::string> _inHome(std::string_view component) const;
    [[nodiscard]] OSTDirectoryAttributes _ownedByUser() const;

    // Constant after construction.
    const std::uint32_t _userId;
    const std::optional<std::string> _userHomeDirectory;

    // Serialises the making of the directories.
    platform::Mutex _mutex;
};

} // namespace ost
