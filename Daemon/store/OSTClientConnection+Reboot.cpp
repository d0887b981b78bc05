#include "files/OSTFileManager.h"
#include "model/OSTGlobalConfiguration.h"
#include "model/OSTUserIdentity.h"
#include "platform/base/Log.h"
#include "platform/base/Path.h"
#include "platform/base/UUID.h"
#include "platform/device/DeviceCapabilities.h"
#include "store/OSTClientConnection.h"
#include "store/OSTStoreDelegate.h"

#include <cerrno>

namespace ost {

using platform::logError;
using platform::pathByAppending;

namespace {

/// The one real user of a device.
constexpr std::uint32_t mobileUser = 501;

/// An orphan of any size may be reported without pushing everything else out of the log.
constexpr std::size_t reportedItems = 200;

template<typename Work>
void forEachClass(Work work) {
    for (auto number = std::uint64_t{1}; number < static_cast<std::uint64_t>(OSTContainerClass::max); ++number)
        work(static_cast<OSTContainerClass>(number));
}

bool isNameOfAContainer(std::string_view name, OSTContainerClass containerClass) {
    return platform::UUID::parse(name) || OSTStoreDelegate::shared().containerIdIsWellknown(name, containerClass);
}

/// Whether nothing but damage can be made of an item of a class directory. An item that cannot be looked at is none.
bool isOrphan(int classDirectory, const std::string& classURL, const OSTDirectoryItem& item,
              OSTContainerClass containerClass) {
    if (!isNameOfAContainer(item.name, containerClass))
        return true;
    const auto metadataFile = pathByAppending(item.name, OSTMetadataFileName);
    if (item.isDirectory && !OSTFileManager::defaultManager().itemDoesNotExist(classDirectory, metadataFile))
        return false;
    logError("Deleting orphaned data missing a metadata file at: %@", pathByAppending(classURL, item.name));
    return true;
}

void reportOrphan(const std::string& url) {
    logError(
        "***INTERNAL BUILD REQUEST: If you see this, file a Brindle in \"Ostrand | all\" with the following data:");
    logError("\tSomeone is writing invalid data to a container, which has now been orphaned. Here are the invalid "
             "files:");
    OSTFileManager::defaultManager().printDirectoryStructureAtURL(url, reportedItems);
    logError("***END INTERNAL BUILD REQUEST");
}

} // namespace

void OSTClientConnection::rebootContainerManagerSetup(const StartupMigration& migration) {
    if (const auto migrated = migration(); !migrated)
        logError("Failed to perform daemon startup migration : %@", migrated.error());
}

void OSTClientConnection::rebootContainerManagerCleanup() const {
    auto& layout = OSTGlobalConfiguration::sharedInstance();
    const auto transient = layout.transientDirectory();
    if (const auto moved = _moveTransientDirectoryToDeathRow(transient); !moved)
        logError("Failed to delete shared transient URL %@ : %@", transient, moved.error());
    const auto transientBundles = layout.transientBundleDirectory();
    if (const auto moved = _moveTransientDirectoryToDeathRow(transientBundles); !moved)
        logError("Failed to delete shared transient bundle URL %@ : %@", transientBundles, moved.error());
    _cleanUpMobileUser();
    forEachClass([&](OSTContainerClass containerClass) {
        if (!isPerUserClass(containerClass))
            _cleanupOrphanedDataForUser(isBundleClass(containerClass) ? OSTInstallerUserId : OSTSystemUserId,
                                        containerClass);
    });
}

OSTResult<void> OSTClientConnection::_moveTransientDirectoryToDeathRow(const std::string& url) const {
    OST_TRY(_settleReplacementsAt(url));
    return _moveItemAtURLToDeathRow(url, StartPass::no);
}

void OSTClientConnection::_cleanUpMobileUser() const {
    auto* const user = OSTGlobalConfiguration::sharedInstance().getPerUserConfigurationForUserId(mobileUser);
    if (user == nullptr || !user->existsUserBaseDirectory())
        return;
    if (const auto url = user->transientDirectory())
        if (const auto moved = _moveTransientDirectoryToDeathRow(*url); !moved)
            logError("Failed to delete per-user transient URL %@ : %@", *url, moved.error());
    forEachClass([&](OSTContainerClass containerClass) {
        if (isPerUserClass(containerClass))
            _cleanupOrphanedDataForUser(mobileUser, containerClass);
    });
}

void OSTClientConnection::_cleanupOrphanedDataForUser(std::uint32_t userId, OSTContainerClass containerClass) const {
    const auto& files = OSTFileManager::defaultManager();
    const auto url =
        OSTGlobalConfiguration::sharedInstance().containerDirectoryURLForUser(userId, containerClass, false);
    if (!url)
        return;
    const auto items = files.urlsForItemsInDirectoryAtURL(*url);
    const auto directory = items ? files.openDirectoryAtURL(*url) : std::unexpected(items.error());
    if (!directory) {
        if (!directory.error().isPOSIX(ENOENT))
            logError("Failed to get items at %@ : %@", *url, directory.error());
        return;
    }
    for (const auto& item : *items) {
        if (!isOrphan(directory->get(), *url, item, containerClass))
            continue;
        const auto orphan = pathByAppending(*url, item.name);
        if (platform::deviceCapability("InternalBuild"))
            reportOrphan(orphan);
        // What cannot be moved stays for the next boot; the reason is in the log.
        (void)_moveItemAtURLToDeathRow(orphan, StartPass::no);
    }
}

} // namespace ost
