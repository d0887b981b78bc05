#include "migration/OSTContainerMigrator.h"

#include "codesigning/OSTCodeSigningMapping.h"
#include "files/OSTFileManager.h"
#include "model/OSTFailureReport.h"
#include "model/OSTGlobalConfiguration.h"
#include "model/OSTMigrationMarker.h"
#include "platform/base/Log.h"

namespace ost {

using platform::logError;
using platform::logNotice;

namespace {

constexpr std::string_view aclMarker = "ost_acl2_migration_complete.plist";
constexpr std::string_view bundleMarker = "ost_bundle_migration_complete.plist";

/// Sets the access-control lists of all system containers of a class; without its directory there are none.
OSTResult<void> standardizeACLsOfClass(OSTContainerClass containerClass) {
    const auto directory =
        OSTGlobalConfiguration::sharedInstance().containerDirectoryURLForUser(OSTSystemUserId, containerClass, false);
    if (!directory)
        return {};
    const auto& files = OSTFileManager::defaultManager();
    OST_TRY(files.standardizeAllSystemContainerACLsAtURL(*directory));
    return files.makeFileSystemDurable(*directory); // before the marker, which ends the migration for good
}

} // namespace

const OSTContainerMigrator& OSTContainerMigrator::sharedInstance() {
    static const OSTContainerMigrator migrator;
    return migrator;
}

OSTResult<void> OSTContainerMigrator::performDataMigratorMigration() const {
    return OSTGuarded([]() -> OSTResult<void> {
        logNotice("Performing Data Migration on %@", OSTCurrentBuildVersion());
        auto result = _performInternalACLMigration();
        if (!result)
            logError("Failed to migrate ACLs on system containers : %@", result.error());
        if (auto owners = _performBundleContainerOwnershipMigration(); !owners) {
            logError("Failed to migrate bundle containers to system location : %@", owners.error());
            result = std::move(owners);
        }
        OSTCodeSigningMapping::sharedInstance().performAllCodeSigningMigrationAndReconciliation();
        return result;
    });
}

OSTResult<void> OSTContainerMigrator::_performInternalACLMigration() {
    if (OSTGlobalConfiguration::sharedInstance().migrationFileExistsWithName(aclMarker))
        return {};
    const auto containers = standardizeACLsOfClass(OSTContainerClass::dataSystem);
    if (!containers)
        logError("Failed to set ACLs on system containers : %@", containers.error());
    const auto groups = standardizeACLsOfClass(OSTContainerClass::sharedSystemGroup);
    if (!groups)
        logError("Failed to set ACLs on system group containers : %@", groups.error());
    if (!groups || !containers)
        return groups ? containers : groups;
    logNotice("Successful acl migration. Writing marker file.");
    writeMigrationFileToDiskWithName(aclMarker);
    return {};
}

OSTResult<void> OSTContainerMigrator::_performBundleContainerOwnershipMigration() {
    auto& layout = OSTGlobalConfiguration::sharedInstance();
    if (layout.migrationFileExistsWithName(bundleMarker))
        return {};
    logNotice("Changing ownership of bundle container content.");
    const auto directory = layout.bundleDirectory();
    const auto& files = OSTFileManager::defaultManager();
    auto changed = files.standardizeOwnershipAtURL(directory, OSTInstallerUserId, OSTInstallerUserId);
    if (changed) // before the marker, which ends the migration for good
        changed = files.makeFileSystemDurable(directory);
    if (!changed)
        return std::unexpected(OSTCreateError(OSTErrorCode::ownerChangeFailed, changed.error(),
                                              "Failed to change owner of %@: %@", directory, changed.error()));
    logNotice("Successful bundle migration. Writing marker file.");
    writeMigrationFileToDiskWithName(bundleMarker);
    return {};
}

} // namespace ost
