#include "service/OSTMaintenanceCommands.h"

#include "migration/OSTContainerMigrator.h"
#include "model/OSTUserIdentity.h"
#include "platform/base/Log.h"
#include "platform/device/DeviceCapabilities.h"
#include "service/OSTRequestReaders.h"

namespace ost {

using platform::logAs;
using platform::LogLevel;

namespace {

/// The user of a request whose class the command itself names.
std::expected<std::uint32_t, OSTErrorCode>
userForClass(const platform::IPCRequest& request, const OSTClientConnection& client, OSTContainerClass containerClass) {
    const auto userId = static_cast<std::uint32_t>(request.unsignedValue(requestKey::container.userId));
    return validateUserId(userId, containerClass, client.identity().clientUserId);
}

} // namespace

OSTCommandResult OSTWipePluginContainerCommand(const platform::IPCRequest& request, platform::IPCReply& /*reply*/,
                                               OSTClientConnection& client) {
    client.clearAllowOtherIdLookup();
    const auto userId = OST_TRY(userForClass(request, client, OSTContainerClass::dataLoomworkPlugin));
    return client.deleteDataContainerContentForUser({.userId = userId,
                                                     .containerClass = OSTContainerClass::dataLoomworkPlugin,
                                                     .identifier = request.stringValue(requestKey::identifier)});
}

OSTCommandResult OSTWipeContainerCommand(const platform::IPCRequest& request, platform::IPCReply& /*reply*/,
                                         OSTClientConnection& client) {
    return client.deleteDataContainerContentForUser(OST_TRY(OSTReadContainer(request, client)).name);
}

OSTCommandResult OSTDiskUsageCommand(const platform::IPCRequest& request, platform::IPCReply& reply,
                                     OSTClientConnection& client) {
    const auto usage = client.diskUsageForUserId(OST_TRY(OSTReadContainer(request, client)));
    reply.set(replyKey::diskUsage, usage.value_or(0));
    if (!usage)
        return std::unexpected(usage.error());
    return {};
}

OSTCommandResult OSTPerformDataMigrationCommand(const platform::IPCRequest& /*request*/, platform::IPCReply& /*reply*/,
                                                OSTClientConnection& /*client*/) {
    const auto migrated = OSTContainerMigrator::sharedInstance().performDataMigratorMigration();
    if (migrated)
        return {};
    logAs(LogLevel::error, "performDataMigration", "Failed to perform data migration : %@", migrated.error());
    return std::unexpected(migrated.error());
}

OSTCommandResult OSTRetryTestCommand(const platform::IPCRequest& request, platform::IPCReply& /*reply*/,
                                     OSTClientConnection& client) {
    if (!platform::deviceCapability("InternalBuild")) {
        logAs(LogLevel::error, "retryTest", "People really shouldn't be calling this on non-internal installs!");
        return {};
    }
    const auto userId = OST_TRY(userForClass(request, client, OSTContainerClass::dataApplication));
    return client.retryTestForUser(userId, request.unsignedValue(requestKey::numRetryCrashes));
}

} // namespace ost
