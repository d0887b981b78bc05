#pragma once

#include "Protocol/OSTContainerClass.h"
#include "files/OSTFileManager.h"
#include "platform/base/Mutex.h"

#include <cstdint>
#include <expected>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

namespace ost {

/// Where a user's containers lie inside the home directory, and the transient ones.
inline constexpr std::string_view OSTUserBaseDirectoryName = "Containers";
inline constexpr std::string_view OSTUserTransientDirectoryName = "Library/Caches/com.tamarok.ostrandd/Temp";

/// Names the directories inside one real user's home, and makes each at every access. What cannot be made is logged,
/// and the operation that then uses the directory fails.
///
/// A user without a home directory has no paths. The home is looked for at every access until it is found, so a user
/// is served as soon as the account or the home is there.
///
/// Threads: any. Owned by `OSTGlobalConfiguration`, never dropped.
class OSTPerUserConfiguration {
public:
    /// Null, with a log line, for a user id of 500 or less.
    [[nodiscard]] static std::unique_ptr<OSTPerUserConfiguration> withUserId(std::uint32_t userId);

    [[nodiscard]] std::uint32_t userId() const { return _userId; }
    /// The real path of the home directory in the password database; none while there is none or nobody can tell.
    [[nodiscard]] std::optional<std::string> userHomeDirectory() const;
    /// Whether the home directory exists.
    [[nodiscard]] bool existsUserBaseDirectory() const;

    /// Fails with ENOENT or ENOTDIR while the user has no home, with another errno while nobody can tell.
    [[nodiscard]] std::expected<std::string, platform::Errno> userBaseDirectory();
    [[nodiscard]] std::expected<std::string, platform::Errno> transientDirectory();
    /// Where older releases kept their library and their log. Never made.
    [[nodiscard]] std::optional<std::string> oldLibraryDirectoryPath() const;
    [[nodiscard]] std::optional<std::string> oldLoggingPath() const;

    /// The directory of a per-user class. Fails as above, and with EINVAL and a log line for any other class.
    [[nodiscard]] std::expected<std::string, platform::Errno>
    containerDirectoryURLForContentClass(OSTContainerClass contentClass, bool transient);

private:
    explicit OSTPerUserConfiguration(std::uint32_t userId) : _userId(userId) {}

    [[nodiscard]] std::expected<std::string, platform::Errno> _home() const;
    [[nodiscard]] std::expected<std::string, platform::Errno> _inHome(std::string_view component) const;
    [[nodiscard]] OSTDirectoryAttributes _ownedByUser() const;

    // Constant after construction.
    const std::uint32_t _userId;

    // Serialises the making of the directories, and guards the home.
    mutable platform::Mutex _mutex;
    mutable std::optional<std::string> _userHomeDirectory OST_GUARDED_BY(_mutex); ///< kept once it was found
};

} // namespace ost
