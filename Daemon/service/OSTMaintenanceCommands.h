#pragma once

#include "service/OSTCommandEntry.h"

namespace ost {

/// Wipes the plug-in data container of an identifier that the client's entitlement lists.
OSTCommandResult OSTWipePluginContainerCommand(const platform::IPCRequest& request, platform::IPCReply& reply,
                                               OSTClientConnection& client);
OSTCommandResult OSTWipeContainerCommand(const platform::IPCRequest& request, platform::IPCReply& reply,
                                         OSTClientConnection& client);
OSTCommandResult OSTDiskUsageCommand(const platform::IPCRequest& request, platform::IPCReply& reply,
                                     OSTClientConnection& client);
OSTCommandResult OSTPerformDataMigrationCommand(const platform::IPCRequest& request, platform::IPCReply& reply,
                                                OSTClientConnection& client);
OSTCommandResult OSTRetryTestCommand(const platform::IPCRequest& request, platform::IPCReply& reply,
                                     OSTClientConnection& client);

} // namespace ost
