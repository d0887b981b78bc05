#include "model/OSTPerUserConfiguration.h"

#include "model/OSTLayoutDirectory.h"
#include "platform/base/Log.h"
#include "platform/base/Path.h"
#include "platform/base/Try.h"
#include "platform/device/Accounts.h"

#include <cerrno>
#include <climits>
#include <cstdlib>

namespace ost {

using platform::pathByAppending;

namespace {

std::expected<std::string, platform::Errno> realPath(const std::string& path) {
    char buffer[PATH_MAX];
    if (!::realpath(path.c_str(), buffer))
        return std::unexpected(errno);
    return buffer;
}

std::expected<std::string, platform::Errno> homeInDatabase(std::uint32_t userId) {
    auto account = platform::accountForUserId(userId);
    if (!account) {
        platform::logError("Failed to getpwuid for uid: %u", userId);
        return std::unexpected(account.error());
    }
    return account->home;
}

template<typename T>
std::optional<T> optionalOf(std::expected<T, platform::Errno> value) {
    return value ? std::optional<T>(*std::move(value)) : std::nullopt;
}

} // namespace

std::unique_ptr<OSTPerUserConfiguration> OSTPerUserConfiguration::withUserId(std::uint32_t userId) {
    if (userId <= OSTHighestSystemUserId) {
        platform::logError("userId: %u must be in range", userId);
        return nullptr;
    }
    return std::unique_ptr<OSTPerUserConfiguration>(new OSTPerUserConfiguration(userId));
}

std::expected<std::string, platform::Errno> OSTPerUserConfiguration::_home() const {
    const platform::MutexLock lock(_mutex);
    if (!_userHomeDirectory) {
        const auto named = OST_TRY(homeInDatabase(_userId));
        _userHomeDirectory = OST_TRY(realPath(named));
    }
    return *_userHomeDirectory;
}

std::optional<std::string> OSTPerUserConfiguration::userHomeDirectory() const { return optionalOf(_home()); }

bool OSTPerUserConfiguration::existsUserBaseDirectory() const {
    const auto home = _home();
    return home && OSTFileManager::defaultManager().itemExistsAtURL(*home);
}

std::expected<std::string, platform::Errno> OSTPerUserConfiguration::_inHome(std::string_view component) const {
    return pathByAppending(OST_TRY(_home()), component);
}

OSTDirectoryAttributes OSTPerUserConfiguration::_ownedByUser() const {
    return {.withIntermediateDirectories = true, .mode = 0755, .owner = _userId};
}

std::expected<std::string, platform::Errno> OSTPerUserConfiguration::userBaseDirectory() {
    auto path = OST_TRY(_inHome(OSTUserBaseDirectoryName));
    const platform::MutexLock lock(_mutex);
    return OSTMakeLayoutDirectory(std::move(path), _ownedByUser(), "Failed to create user base dir at \"%@\": %@");
}

std::expected<std::string, platform::Errno> OSTPerUserConfiguration::transientDirectory() {
    auto path = OST_TRY(_inHome(OSTUserTransientDirectoryName));
    const platform::MutexLock lock(_mutex);
    return OSTMakeLayoutDirectory(std::move(path), _ownedByUser(), "Failed to create transient dir at \"%@\": %@");
}

std::optional<std::string> OSTPerUserConfiguration::oldLibraryDirectoryPath() const {
    return optionalOf(_inHome("Library/Ostrand"));
}

std::optional<std::string> OSTPerUserConfiguration::oldLoggingPath() const {
    return optionalOf(_inHome("Library/Logs/Ostrand"));
}

std::expected<std::string, platform::Errno>
OSTPerUserConfiguration::containerDirectoryURLForContentClass(OSTContainerClass contentClass, bool transient) {
    if (!isPerUserClass(contentClass)) {
        platform::logError("Invalid class for a per user container directory: %llu", contentClass);
        return std::unexpected(EINVAL);
    }
    const auto base = OST_TRY(transient ? transientDirectory() : userBaseDirectory());
    const platform::MutexLock lock(_mutex);
    return OSTMakeLayoutDirectory(pathByAppending(base, pathComponentForContainerClass(contentClass)), _ownedByUser(),
                                  "Failed to create container dir at \"%@\": %@");
}

} // namespace ost
