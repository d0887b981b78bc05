#pragma once

#include "Protocol/OSTContainerClass.h"
#include "model/OSTPerUserConfiguration.h"
#include "platform/base/Errno.h"
#include "platform/base/Mutex.h"

#include <array>
#include <cstdint>
#include <expected>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace ost {

/// Names every directory that all users share and makes each at every access, so one that was removed reappears at its
/// next use. All other code asks here and never builds a root of the layout itself. No accessor fails: what cannot be
/// made is logged, and the operation that then uses the directory fails.
///
/// Threads: any. One shared instance for the life of the process.
class OSTGlobalConfiguration {
public:
    static OSTGlobalConfiguration& sharedInstance();

    /// Holds every class directory of the bundle and system classes.
    [[nodiscard]] std::string sharedContainersDirectory();
    [[nodiscard]] std::string logDirectory();
    [[nodiscard]] std::string cachesDirectory();
    [[nodiscard]] std::string libraryDirectory();
    /// Transient containers of the system classes.
    [[nodiscard]] std::string transientDirectory();
    /// Containers that are being built, or put aside during a replacement.
    [[nodiscard]] std::string stagingDirectory();
    /// What waits to be destroyed.
    [[nodiscard]] std::string deathrowDirectory();
    [[nodiscard]] std::string replaceDirectory();
    /// The same without making it.
    [[nodiscard]] std::string replaceDirectoryPath() const;
    [[nodiscard]] std::string bundleDirectory();
    /// Transient containers of the bundle classes, inside the installer's home.
    [[nodiscard]] std::string transientBundleDirectory();

    /// The directories of one real user; null for a user id of 500 or less.
    [[nodiscard]] OSTPerUserConfiguration* getPerUserConfigurationForUserId(std::uint32_t userId);

    /// The directory that holds all containers of the class for the user. Fails with ENOENT or ENOTDIR while the user
    /// has no home, with EINVAL when the class has no directory for the user, with another errno while nobody can tell.
    [[nodiscard]] std::expected<std::string, platform::Errno>
    containerDirectoryURLForUser(std::uint32_t userId, OSTContainerClass contentClass, bool transient);

    /// The class directories of all users that have an account now, whether or not they exist. Makes none.
    [[nodiscard]] std::vector<std::string> classDirectories() const;

    /// Whether `url` could be the path of a container: a name directly inside the class directory of a class and user.
    /// Makes no directory. Fails with the errno of reading the accounts.
    [[nodiscard]] std::expected<bool, platform::Errno> isContainerURL(std::string_view url) const;

    /// The items at the top of an application's data container that belong to the user's data.
    [[nodiscard]] static const std::array<std::string_view, 4>& appUserDataItemNames();

    /// Whether an item of that name exists directly in `libraryDirectory`.
    [[nodiscard]] bool migrationFileExistsWithName(std::string_view name);

private:
    using Accessor = std::string (OSTGlobalConfiguration::*)();

    OSTGlobalConfiguration();

    /// Makes the directory `name` in the home directory's `parent`. The parent is made with the rest only when the
    /// directory is missing, since one that is there has its parent.
    [[nodiscard]] std::string _directoryIn(std::string_view parent, Accessor makeParent, std::string_view name,
                                           platform::Message<std::string, OSTError> failure);

    // Constant after construction. Roots of the layout are made canonical here, once; no path below them may pass a
    // link.
    const std::string _homeDirectory;
    const std::string _tessalydHomeDirectory;
    const std::string _sharedContainersDirectory;

    // Serialises the accessors. Recursive: directories lie inside each other.
    platform::RecursiveMutex _mutex;
    std::map<std::uint32_t, std::unique_ptr<OSTPerUserConfiguration>> _perUserConfigurations OST_GUARDED_BY(_mutex);
};

} // namespace ost
