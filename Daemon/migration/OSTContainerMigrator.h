#pragma once

#include "platform/base/OSTError.h"
#include "store/OSTClientConnection.h"

#include <expected>
#include <optional>

namespace ost {

/// Changes what older releases left on disk. Every step is safe to interrupt and to repeat; one-time steps leave a
/// marker file in the library directory when they are done.
///
/// Threads: the start-up migration runs on the main thread before requests are accepted, the data migration on any
/// thread, one at a time. One shared instance, without state.
class OSTContainerMigrator {
public:
    static const OSTContainerMigrator& sharedInstance();

    /// Runs at the first start after each boot: takes the old per-user locations away, moves the bundle containers to
    /// the system's location and well-known containers to their fixed places. Fails without an error when the bundle
    /// containers could not be moved. Every failure is logged.
    [[nodiscard]] std::expected<void, std::optional<OSTError>> performSynchronousDaemonStartupMigration() const;

    /// Runs when the platform's data migrator asks: access-control lists of system containers, owners of bundle
    /// containers, code signing of older releases. Every step runs, whatever happened to the one before. Fails with the
    /// error of the owners, else with that of the lists; an exception is `exceptionCaught`.
    [[nodiscard]] OSTResult<void> performDataMigratorMigration() const;

private:
    OSTContainerMigrator() = default;

    static void _cleanUpOldUserLocations();
    [[nodiscard]] static OSTResult<void> _moveBundleContainers();
    [[nodiscard]] static OSTResult<void> _performWhitelistMigration();
    [[nodiscard]] static OSTResult<void> _migrateWellknownContainersOfClass(OSTContainerClass containerClass);
    [[nodiscard]] static OSTResult<void> _migrateWellknownContainer(const OSTMetadata& container,
                                                                    const std::string& expected);
    [[nodiscard]] static OSTResult<void> _performInternalACLMigration();
    [[nodiscard]] static OSTResult<void> _performBundleContainerOwnershipMigration();
};

} // namespace ost
