#include "model/OSTPerUserConfiguration.h"

#include "model/OSTLayoutDirectory.h"
#include "platform/base/Log.h"
#include "platform/base/Path.h"
#include "platform/device/Accounts.h"

#include <cerrno>
#include <climits>
#include <cstdlib>

namespace ost {

using platform::pathByAppending;

namespace {

std::optional<std::string> realPath(const std::string& path) {
    char buffer[PATH_MAX];
    return ::realpath(path.c_str(), buffer) ? std::optional<std::string>(buffer) : std::nullopt;
}

} // namespace

std::unique_ptr<OSTPerUserConfiguration> OSTPerUserConfiguration::withUserId(std::uint32_t userId) {
    if (userId <= OSTHighestSystemUserId) {
        platform::logError("userId: %u must be in range", userId);
        return nullptr;
    }
    std::optional<std::string> home;
    if (const auto account = platform::accountForUserId(userId)) {
        home = realPath(account->home);
    } else {
        platform::logError("Failed to getpwuid for uid: %u", userId);
        // Accounts that cannot be read now, for want of a descriptor, say nothing for good.
        if (account.error() != ENOENT)
            return nullptr;
    }
    return std::unique_ptr<OSTPerUserConfiguration>(new OSTPerUserConfiguration(userId, std::move(home)));
}

bool OSTPerUserConfiguration::existsUserBaseDirectory() const {
    return _userHomeDirectory && OSTFileManager::defaultManager().itemExistsAtURL(*_userHomeDirectory);
}

std::optional<std::string> OSTPerUserConfiguration::_inHome(std::string_view component) const {
    if (!_userHomeDirectory)
        return std::nullopt;
    return pathByAppending(*_userHomeDirectory, component);
}

OSTDirectoryAttributes OSTPerUserConfiguration::_ownedByUser() const {
    return {.withIntermediateDirectories = true, .mode = 0755, .owner = _userId};
}

std::optional<std::string> OSTPerUserConfiguration::userBaseDirectory() {
    auto path = _inHome(OSTUserBaseDirectoryName);
    if (!path)
        return std::nullopt;
    const platform::MutexLock lock(_mutex);
    return OSTMakeLayoutDirectory(*std::move(path), _ownedByUser(), "Failed to create user base dir at \"%@\": %@");
}

std::optional<std::string> OSTPerUserConfiguration::transientDirectory() {
    auto path = _inHome(OSTUserTransientDirectoryName);
    if (!path)
        return std::nullopt;
    const platform::MutexLock lock(_mutex);
    return OSTMakeLayoutDirectory(*std::move(path), _ownedByUser(), "Failed to create transient dir at \"%@\": %@");
}

std::optional<std::string> OSTPerUserConfiguration::oldLibraryDirectoryPath() const {
    return _inHome("Library/Ostrand");
}

std::optional<std::string> OSTPerUserConfiguration::oldLoggingPath() const { return _inHome("Library/Logs/Ostrand"); }

std::optional<std::string> OSTPerUserConfiguration::containerDirectoryURLForContentClass(OSTContainerClass contentClass,
                                                                                         bool transient) {
    if (!isPerUserClass(contentClass)) {
        platform::logError("Invalid class for a per user container directory: %llu", contentClass);
        return std::nullopt;
    }
    const auto base = transient ? transientDirectory() : userBaseDirectory();
    if (!base)
        return std::nullopt;
    const platform::MutexLock lock(_mutex);
    return OSTMakeLayoutDirectory(pathByAppending(*base, pathComponentForContainerClass(contentClass)), _ownedByUser(),
                                  "Failed to create container dir at \"%@\": %@");
}

} // namespace ost
