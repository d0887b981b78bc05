#include "files/OSTFileManager.h"
#include "model/OSTGlobalConfiguration.h"
#include "platform/base/Immortal.h"
#include "platform/base/MountPoints.h"
#include "platform/base/Path.h"
#include "platform/threads/Transactions.h"
#include "store/OSTClientConnection.h"
#include "store/OSTReplaceFile.h"

#include <cerrno>
#include <set>
#include <string>

namespace ost {

using platform::pathByDeletingLastComponent;

namespace {

/// Where an interrupted process may have left something unfinished: beside what it wrote, or moved between file
/// systems.
std::set<std::string> workshops() {
    auto& layout = OSTGlobalConfiguration::sharedInstance();
    std::set<std::string> directories{layout.bundleDirectory(), layout.logDirectory(),
                                      std::string(OSTParkingDirectory)};
    for (const auto& directory : layout.classDirectories()) {
        directories.insert(directory);
        // Beside the base, because those of transient containers are moved whole.
        const auto base = pathByDeletingLastComponent(pathByDeletingLastComponent(directory));
        directories.emplace(pathByDeletingLastComponent(base));
    }
    for (auto& path : platform::mountPoints())
        if (directories.contains(std::string(pathByDeletingLastComponent(path))))
            directories.insert(std::move(path)); // a container that is a file system of its own
    return directories;
}

void removeUnfinishedItems() {
    for (const auto& directory : workshops())
        OSTFileManager::defaultManager().removeUnfinishedItemsInDirectoryURL(directory);
}

} // namespace

OSTClientConnection& OSTClientConnection::sharedClientConnection() {
    static platform::Immortal connection([] {
        return OSTClientConnection({.clientBundleIdentifier = "com.tamarok.ostrandd.internal",
                                    .clientUserId = 0,
                                    .allowOtherIdLookup = true,
                                    .allowGroupIdLookup = true});
    });
    return *connection;
}

void OSTClientConnection::containerManagerSetup() const {
    OSTFileManager::defaultManager().removeUnfinishedItemsInDirectoryURL(
        OSTGlobalConfiguration::sharedInstance().libraryDirectory());
    if (!_recoverFromReplaceOperations())
        platform::logError("Failed recovering from replace operations");
    _repairSandboxContainerMappings();
}

void OSTClientConnection::containerManagerCleanup() const {
    const auto staging = OSTGlobalConfiguration::sharedInstance().stagingDirectory();
    const auto& files = OSTFileManager::defaultManager();
    for (const auto& directory : {staging, OSTGlobalConfiguration::sharedInstance().deathrowDirectory()})
        for (const auto& unfinished : files.unfinishedItemsInDirectoryURL(directory))
            (void)_moveItemAtURLToDeathRow(unfinished, StartPass::no);
    const auto items = files.urlsForItemsInDirectoryAtURL(staging);
    if (items) {
        // What cannot be moved stays for the next start, and so does a container that could not be put back in its
        // place.
        for (const auto& item : *items)
            if (files.itemDoesNotExistAtURL(OSTReplaceFile::urlOfToken(item.name)))
                (void)_moveItemAtURLToDeathRow(platform::pathByAppending(staging, item.name), StartPass::no);
    } else if (!items.error().isPOSIX(ENOENT)) {
        platform::logError("Failed to get items at staging URL%@ : %@", staging, items.error());
    }
    async_with_transaction(OSTDeathRowQueue(), removeUnfinishedItems);
    deleteContainersOnDeathRowWithCompletion();
}

} // namespace ost
