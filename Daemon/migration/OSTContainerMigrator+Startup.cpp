#include "codesigning/OSTWhitelist.h"
#include "files/OSTFileManager.h"
#include "migration/OSTContainerMigrator.h"
#include "model/OSTGlobalConfiguration.h"
#include "model/OSTMigrationMarker.h"
#include "platform/base/DirectoryNames.h"
#include "platform/base/Log.h"
#include "platform/base/PassingReason.h"
#include "platform/base/Path.h"
#include "store/OSTContainerCache.h"

#include <cerrno>
#include <string>

namespace ost {

using platform::lastPathComponent;
using platform::logError;
using platform::logNotice;
using platform::pathByAppending;

namespace {

constexpr std::string_view oldBundleDirectory = "/private/var/mobile/Containers/Bundle";

/// The name that the lines about a single container carry.
constexpr const char* migrationName = "_performWhitelistMigration";

/// The names that a file may get when its own is taken.
constexpr unsigned otherNames = 1000;

/// A path in `directory` at which nothing is: that of `name`, or else of "NAME.1", "NAME.2" and so on.
OSTResult<std::string> freePath(std::string_view directory, std::string_view name) {
    const auto wanted = pathByAppending(directory, name);
    std::string path = wanted;
    for (unsigned number = 1; number <= otherNames; ++number) {
        if (OSTFileManager::defaultManager().itemDoesNotExistAtURL(path))
            return path;
        path = wanted + '.' + std::to_string(number);
    }
    return std::unexpected(OSTCreatePOSIXError(EEXIST, "No free name for %@", wanted));
}

/// Moves an old log away from the user. The daemon's own log lies in the same directory and is not replaced.
OSTResult<void> moveLog(const std::string& log) {
    const auto destination =
        OST_TRY(freePath(OSTGlobalConfiguration::sharedInstance().logDirectory(), lastPathComponent(log)));
    return OSTFileManager::defaultManager().moveItemAtURL(log, destination);
}

/// Moves all old logs away from the user. Answers whether none can be left: there is no such directory then, either.
bool moveLogs(const std::string& directory) {
    const auto items = OSTFileManager::defaultManager().urlsForItemsInDirectoryAtURL(directory);
    if (!items) {
        if (!items.error().isPOSIX(ENOENT))
            logError("Failed to get items for deletion: %@ : %@", directory, items.error());
        return !platform::isReasonThatPasses(items.error());
    }
    bool allMoved = true;
    for (const auto& item : *items) {
        const auto log = pathByAppending(directory, item.name);
        const auto moved = moveLog(log);
        allMoved = allMoved && moved;
        if (!moved)
            logError("Failed to move to new logging directory from %@ : %@", log, moved.error());
    }
    logNotice("Migrated log files on %@", OSTCurrentBuildVersion());
    return allMoved;
}

/// Whether both are the same container, of which an interrupted copy left two.
bool isSameContainer(const std::string& a, const std::string& b) {
    const auto read = [](const std::string& url) {
        return OSTMetadata::readAndValidateMetadataAtUrl(url, OSTInstallerUserId, OSTCheckClassPath::no);
    };
    const auto first = read(a);
    const auto second = first ? read(b) : first;
    return second && first->uuid == second->uuid && first->identifier == second->identifier;
}

/// What lies at a level of the bundle containers' tree.
enum class Holds : bool { containers, classes };

OSTResult<void> mergeDirectory(const std::string& from, const std::string& to, Holds holds);

OSTResult<void> moveIntoPlace(const std::string& from, const std::string& to, bool isDirectory, Holds holds) {
    const auto& files = OSTFileManager::defaultManager();
    if (!isDirectory && holds == Holds::classes) // A link would lead the installer astray.
        return std::unexpected(OSTCreatePOSIXError(ENOTDIR, "%@ is no directory", from));
    if (files.itemDoesNotExistAtURL(to))
        return files.moveItemAtURL(from, to);
    if (holds == Holds::classes)
        return mergeDirectory(from, to, Holds::containers);
    if (!isDirectory || !isSameContainer(from, to))
        return std::unexpected(OSTCreatePOSIXError(EEXIST, "%@ exists already, so %@ stays", to, from));
    // An interrupted copy may not have waited for what it put there.
    OST_TRY(files.makeDirectoryDurable(platform::pathByDeletingLastComponent(to)));
    return files.removeItemAtURL(from);
}

/// Moves what no listing shows, such as another program's notes, and discards what an interrupted copy left.
OSTResult<void> moveHiddenItems(const std::string& from, const std::string& to) {
    const auto& files = OSTFileManager::defaultManager();
    files.removeUnfinishedItemsInDirectoryURL(from);
    const auto directory = OST_TRY(files.openDirectoryAtURL(from));
    const auto names = platform::hiddenNames(directory);
    if (!names)
        return std::unexpected(OSTCreatePOSIXError(names.error(), "read of %@ failed: %s", from, names.error()));
    for (const auto& name : *names) {
        const auto place = OST_TRY(freePath(to, name));
        OST_TRY(files.moveItemAtURL(pathByAppending(from, name), place));
    }
    return {};
}

/// Moves the items of one directory into another and removes it when it is empty. Goes on after an item that cannot be
/// moved; the last reason is the result. What an interruption leaves is moved the next time.
OSTResult<void> mergeDirectory(const std::string& from, const std::string& to, Holds holds) {
    const auto& files = OSTFileManager::defaultManager();
    OSTResult<void> result;
    for (const auto& item : OST_TRY(files.urlsForItemsInDirectoryAtURL(from))) {
        auto moved =
            moveIntoPlace(pathByAppending(from, item.name), pathByAppending(to, item.name), item.isDirectory, holds);
        if (!moved)
            result = std::move(moved);
    }
    OST_TRY(std::move(result));
    OST_TRY(moveHiddenItems(from, to));
    OST_TRY(files.makeDirectoryDurable(to));
    if (const auto removed = files.removeItemAtURL(from); !removed) // a mount point stays, but all is moved
        logError("Failed to remove source %@ : %@", from, removed.error());
    return {};
}

} // namespace

std::expected<void, std::optional<OSTError>> OSTContainerMigrator::performSynchronousDaemonStartupMigration() const {
    _cleanUpOldUserLocations();
    if (const auto moved = _moveBundleContainers(); !moved) {
        logError("Failed to migrate to new bundle containers location : %@.  This is terrible.", moved.error());
        return std::unexpected(std::nullopt);
    }
    if (const auto migrated = _performWhitelistMigration(); !migrated) {
        logError("Failed to migrate whitelisted bundle containers : %@", migrated.error());
        return std::unexpected(migrated.error());
    }
    return {};
}

void OSTContainerMigrator::_cleanUpOldUserLocations() {
    const auto& files = OSTFileManager::defaultManager();
    const auto* const user =
        OSTGlobalConfiguration::sharedInstance().getPerUserConfigurationForUserId(OSTDefaultUserId);
    const auto library = user ? user->oldLibraryDirectoryPath() : std::nullopt;
    const auto logs = user ? user->oldLoggingPath() : std::nullopt;
    if (!library || !logs)
        return;
    if (const auto removed = files.removeItemAtURL(*library); !removed)
        logError("Failed to remove old Library directory: %@", removed.error());
    if (!moveLogs(*logs))
        return; // What stayed behind is moved at the next boot.
    if (const auto removed = files.removeItemAtURL(*logs); !removed)
        logError("Failed to remove old Log directory: %@", removed.error());
}

OSTResult<void> OSTContainerMigrator::_moveBundleContainers() {
    const std::string old(oldBundleDirectory);
    if (!OSTFileManager::defaultManager().itemExistsAtURL(old))
        return {};
    logNotice("Moving bundle containers from user to system location");
    return mergeDirectory(old, OSTGlobalConfiguration::sharedInstance().bundleDirectory(), Holds::classes);
}

OSTResult<void> OSTContainerMigrator::_performWhitelistMigration() {
    OST_TRY(_migrateWellknownContainersOfClass(OSTContainerClass::dataSystem));
    return _migrateWellknownContainersOfClass(OSTContainerClass::sharedSystemGroup);
}

OSTResult<void> OSTContainerMigrator::_migrateWellknownContainersOfClass(OSTContainerClass containerClass) {
    const auto directory =
        OSTGlobalConfiguration::sharedInstance().containerDirectoryURLForUser(OSTSystemUserId, containerClass, false);
    const auto containers =
        OSTContainerCache::sharedInstance().allContainersForUser(OSTSystemUserId, containerClass, false);
    if (!containers) {
        logError("Failed to get list of system containers for migration: (error= %@ : %lld)",
                 containers.error().domainName(), containers.error().code());
        return std::unexpected(containers.error());
    }
    OSTResult<void> result;
    for (const auto& container : *containers) {
        const auto name =
            OSTWhitelist::sharedWhitelist().wellknownContainerForId(container->identifier, containerClass);
        if (!name || !directory || container->url.empty())
            continue;
        auto migrated = _migrateWellknownContainer(*container, pathByAppending(*directory, *name));
        if (!migrated)
            result = std::move(migrated);
    }
    return result;
}

OSTResult<void> OSTContainerMigrator::_migrateWellknownContainer(const OSTMetadata& container,
                                                                 const std::string& expected) {
    if (container.url == expected)
        return {};
    logError("Migrating well-known container %@ from %@ to %@", container.identifier, container.url, expected);
    auto& cache = OSTContainerCache::sharedInstance();
    if (auto removed = cache.removeContainerForUser(container.name()); !removed) {
        logError("%s: Failed to remove cache for whitelisted container %@: (error= %@: %lld)", migrationName,
                 container.identifier, removed.error().domainName(), removed.error().code());
        return removed;
    }
    const auto moved = OSTFileManager::defaultManager().moveItemAtURL(container.url, expected);
    if (!moved)
        logError("%s: Failed to move system container %@ from %@ to whitelisted location %@: (error= %@: %lld)",
                 migrationName, container.identifier, container.url, expected, moved.error().domainName(),
                 moved.error().code());
    // One whose place is taken stays where it is, and is found there.
    OSTMetadata metadata = container;
    if (moved)
        metadata.url = expected;
    const auto added = cache.addContainerMetadata(metadata, moved ? OSTPlacement::pending : OSTPlacement::durable);
    if (!added) {
        logError("%s: Failed to update cache for whitelisted container %@: (error= %@: %lld)", migrationName,
                 container.identifier, added.error().domainName(), added.error().code());
        return std::unexpected(added.error());
    }
    return moved;
}

} // namespace ost
