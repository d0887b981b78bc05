#include "model/OSTGlobalConfiguration.h"

#include "files/OSTPathResolution.h"
#include "model/OSTLayoutDirectory.h"
#include "platform/base/Immortal.h"
#include "platform/base/Log.h"
#include "platform/base/PassingReason.h"
#include "platform/base/Path.h"
#include "platform/device/Accounts.h"

#include <fcntl.h>
#include <sys/stat.h>

#include <cerrno>
#include <climits>
#include <cstdlib>
#include <utility>

namespace ost {

using platform::pathByAppending;

namespace {

constexpr OSTDirectoryAttributes withIntermediates{.withIntermediateDirectories = true, .mode = 0755};
constexpr OSTDirectoryAttributes unprotected{
    .withIntermediateDirectories = true, .mode = 0755, .protectionClass = OSTNoProtectionClass};

/// `path` without symbolic links, or `path` itself when it does not exist yet.
std::string canonical(const char* path) {
    char buffer[PATH_MAX];
    return ::realpath(path, buffer) ? buffer : path;
}

constexpr std::string_view cachesName = "Library/Caches/com.tamarok.ostrandd";
constexpr std::string_view libraryName = "Library/Ostrand";
constexpr std::string_view replaceName = "Replace";
constexpr std::string_view transientName = "Temp";

/// `path` without symbolic links, whose end may be missing. Fails with EAGAIN when a link leads nowhere: where the rest
/// is shows when what it leads to is there again.
std::expected<std::string, platform::Errno> canonicalWhereMissing(std::string path) {
    char buffer[PATH_MAX] = "";
    std::string missing;
    while (!path.empty() && !::realpath(path.c_str(), buffer)) {
        const platform::Errno error = errno;
        struct stat item{};
        if (error != ENOENT)
            return std::unexpected(error);
        if (::lstat(path.c_str(), &item) == 0)
            return std::unexpected(EAGAIN);
        missing = pathByAppending(platform::lastPathComponent(path), missing);
        path = platform::pathByDeletingLastComponent(path);
    }
    return pathByAppending(path.empty() ? "" : buffer, missing);
}

/// Whether `base` holds class directories of real users. Fails with the errno of reading the accounts, or of looking
/// for a home that might be the one.
std::expected<bool, platform::Errno> isBaseOfAUser(std::string_view base) {
    platform::Errno unknownHome = 0;
    const auto user = platform::accountMatching([&](const platform::Account& account) {
        if (account.uid <= OSTHighestSystemUserId)
            return false;
        const auto home = canonicalWhereMissing(account.home);
        if (!home && !platform::speaksOfTheItem(home.error()))
            unknownHome = home.error();
        return home && (base == pathByAppending(*home, OSTUserBaseDirectoryName) ||
                        base == pathByAppending(*home, OSTUserTransientDirectoryName));
    });
    if (!user && user.error() != ENOENT)
        return std::unexpected(user.error());
    if (!user && unknownHome != 0)
        return std::unexpected(unknownHome);
    return user.has_value();
}

/// The directories that hold class directories of real users.
std::vector<std::string> basesOfUsers() {
    std::vector<std::string> bases;
    (void)platform::accountMatching([&](const platform::Account& account) {
        if (account.uid > OSTHighestSystemUserId)
            for (const auto name : {OSTUserBaseDirectoryName, OSTUserTransientDirectoryName})
                bases.push_back(pathByAppending(canonical(account.home.c_str()), name));
        return false;
    });
    return bases;
}

} // namespace

OSTGlobalConfiguration& OSTGlobalConfiguration::sharedInstance() {
    static platform::Immortal configuration([] { return OSTGlobalConfiguration(); });
    return *configuration;
}

OSTGlobalConfiguration::OSTGlobalConfiguration()
    : _homeDirectory(canonical("/private/var/root")), _tessalydHomeDirectory(canonical("/private/var/tessalyd")),
      _sharedContainersDirectory(pathByAppending(canonical("/private/var"), "containers")) {}

std::string OSTGlobalConfiguration::sharedContainersDirectory() {
    const platform::BasicMutexLock lock(_mutex);
    return OSTMakeLayoutDirectory(_sharedContainersDirectory, withIntermediates,
                                  "Failed to create shared container dir at \"%@\": %@");
}

std::string OSTGlobalConfiguration::logDirectory() {
    return OSTMakeLayoutDirectory(pathByAppending(_homeDirectory, "Library/Logs/Ostrand"), unprotected,
                                  "Failed to create log directory at \"%@\": %@");
}

std::string OSTGlobalConfiguration::cachesDirectory() {
    const platform::BasicMutexLock lock(_mutex);
    return OSTMakeLayoutDirectory(pathByAppending(_homeDirectory, cachesName), unprotected,
                                  "Failed to create cache dir at \"%@\": %@");
}

std::string OSTGlobalConfiguration::libraryDirectory() {
    const platform::BasicMutexLock lock(_mutex);
    return OSTMakeLayoutDirectory(pathByAppending(_homeDirectory, libraryName), unprotected,
                                  "Failed to create library dir at \"%@\": %@");
}

std::string OSTGlobalConfiguration::transientDirectory() {
    return _directoryIn(cachesName, &OSTGlobalConfiguration::cachesDirectory, transientName,
                        "Failed to create transient dir at \"%@\": %@");
}

std::string OSTGlobalConfiguration::stagingDirectory() {
    return _directoryIn(cachesName, &OSTGlobalConfiguration::cachesDirectory, "Staging",
                        "Failed to create staging dir at \"%@\": %@");
}

std::string OSTGlobalConfiguration::deathrowDirectory() {
    return _directoryIn(cachesName, &OSTGlobalConfiguration::cachesDirectory, "Dead",
                        "Failed to create deathrow dir at \"%@\": %@");
}

std::string OSTGlobalConfiguration::replaceDirectory() {
    return _directoryIn(libraryName, &OSTGlobalConfiguration::libraryDirectory, replaceName,
                        "Failed to create replace dir at \"%@\": %@");
}

std::string OSTGlobalConfiguration::replaceDirectoryPath() const {
    return pathByAppending(pathByAppending(_homeDirectory, libraryName), replaceName);
}

std::string OSTGlobalConfiguration::_directoryIn(std::string_view parent, Accessor makeParent, std::string_view name,
                                                 platform::Message<std::string, OSTError> failure) {
    const platform::BasicMutexLock lock(_mutex);
    auto path = pathByAppending(pathByAppending(_homeDirectory, parent), name);
    if (OSTOpenItem(AT_FDCWD, path, O_PATH | O_DIRECTORY))
        return path;
    (this->*makeParent)();
    return OSTMakeLayoutDirectory(std::move(path), withIntermediates, failure);
}

std::string OSTGlobalConfiguration::bundleDirectory() {
    const platform::BasicMutexLock lock(_mutex);
    return OSTMakeLayoutDirectory(pathByAppending(sharedContainersDirectory(), "Bundle"), withIntermediates,
                                  "Failed to create bundle dir at \"%@\": %@");
}

std::string OSTGlobalConfiguration::transientBundleDirectory() {
    const platform::BasicMutexLock lock(_mutex);
    std::string path = _tessalydHomeDirectory;
    for (const auto component : {"Library", "Caches", "com.tamarok.ostrandd"})
        path = OSTMakeLayoutDirectory(pathByAppending(path, component), {.mode = 0755, .owner = OSTInstallerUserId},
                                      "Failed to create transient bundle dir at \"%@\": %@");
    return path;
}

OSTPerUserConfiguration* OSTGlobalConfiguration::getPerUserConfigurationForUserId(std::uint32_t userId) {
    const platform::BasicMutexLock lock(_mutex);
    auto found = _perUserConfigurations.find(userId);
    if (found == _perUserConfigurations.end()) {
        auto configuration = OSTPerUserConfiguration::withUserId(userId);
        if (!configuration)
            return nullptr;
        found = _perUserConfigurations.emplace(userId, std::move(configuration)).first;
    }
    return found->second.get();
}

std::expected<std::string, platform::Errno>
OSTGlobalConfiguration::containerDirectoryURLForUser(std::uint32_t userId, OSTContainerClass contentClass,
                                                     bool transient) {
    const platform::BasicMutexLock lock(_mutex);
    std::string base;
    std::uint32_t owner = OSTRootUserId;
    if (isSystemClass(contentClass)) {
        base = transient ? transientDirectory() : sharedContainersDirectory();
    } else if (isBundleClass(contentClass)) {
        base = transient ? transientBundleDirectory() : sharedContainersDirectory();
        owner = OSTInstallerUserId;
    } else {
        auto* const configuration = getPerUserConfigurationForUserId(userId);
        return configuration ? configuration->containerDirectoryURLForContentClass(contentClass, transient)
                             : std::unexpected(EINVAL);
    }
    return OSTMakeLayoutDirectory(pathByAppending(base, pathComponentForContainerClass(contentClass)),
                                  {.withIntermediateDirectories = true, .mode = 0755, .owner = owner},
                                  "Failed to create container dir at \"%@\": %@");
}

std::vector<std::string> OSTGlobalConfiguration::classDirectories() const {
    const std::vector<std::string> bundleBases{_sharedContainersDirectory,
                                               pathByAppending(_tessalydHomeDirectory, cachesName)};
    const std::vector<std::string> systemBases{
        _sharedContainersDirectory, pathByAppending(pathByAppending(_homeDirectory, cachesName), transientName)};
    const auto userBases = basesOfUsers();
    std::vector<std::string> directories;
    for (auto number = std::uint64_t{1}; number < static_cast<std::uint64_t>(OSTContainerClass::max); ++number) {
        const auto containerClass = static_cast<OSTContainerClass>(number);
        for (const auto& base : isBundleClass(containerClass)   ? bundleBases
                                : isSystemClass(containerClass) ? systemBases
                                                                : userBases)
            directories.push_back(pathByAppending(base, pathComponentForContainerClass(containerClass)));
    }
    return directories;
}

std::expected<bool, platform::Errno> OSTGlobalConfiguration::isContainerURL(std::string_view url) const {
    const auto name = platform::lastPathComponent(url);
    if (!url.starts_with('/') || name.empty() || name == "." || name == "..")
        return false;
    const auto holder = platform::pathByDeletingLastComponent(url);
    for (auto number = std::uint64_t{1}; number < static_cast<std::uint64_t>(OSTContainerClass::max); ++number) {
        const auto containerClass = static_cast<OSTContainerClass>(number);
        const auto component = pathComponentForContainerClass(containerClass);
        if (!holder.ends_with(component) || !holder.substr(0, holder.size() - component.size()).ends_with('/'))
            continue;
        const auto base = holder.substr(0, holder.size() - component.size() - 1);
        if (isPerUserClass(containerClass))
            return isBaseOfAUser(base);
        if (base == _sharedContainersDirectory)
            return true;
        const auto& home = isBundleClass(containerClass) ? _tessalydHomeDirectory : _homeDirectory;
        const auto caches = pathByAppending(home, cachesName);
        return base == (isBundleClass(containerClass) ? caches : pathByAppending(caches, transientName));
    }
    return false;
}

const std::array<std::string_view, 4>& OSTGlobalConfiguration::appUserDataItemNames() {
    static constexpr std::array<std::string_view, 4> names = {"Documents", "Library", "tmp", "Quibbet"};
    return names;
}

bool OSTGlobalConfiguration::migrationFileExistsWithName(std::string_view name) {
    return OSTFileManager::defaultManager().itemExistsAtURL(pathByAppending(libraryDirectory(), name));
}

} // namespace ost
