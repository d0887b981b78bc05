#include "files/OSTFileManager.h"
#include "model/OSTGlobalConfiguration.h"
#include "platform/base/Immortal.h"
#include "platform/base/Path.h"
#include "platform/threads/Transactions.h"
#include "store/OSTClientConnection.h"
#include "store/OSTReplaceFile.h"

#include <cerrno>

namespace ost {

namespace {

/// Removes what interrupted moves between file systems left beside containers, which may be on another file system than
/// death row.
void removeUnfinishedCopies() {
    for (const auto& directory : OSTGlobalConfiguration::sharedInstance().classDirectories())
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
    async_with_transaction(OSTDeathRowQueue(), removeUnfinishedCopies);
    deleteContainersOnDeathRowWithCompletion();
}

} // namespace ost
