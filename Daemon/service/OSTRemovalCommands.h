#pragma once

#include "service/OSTCommandEntry.h"

namespace ost {

/// Command 2: puts one container in another's place. Reads "OldContainerUUID" (none: there is no old one),
/// "OldContainerClass", "OldContainerUserID", "OldIdentifier" and the same four with "New".
[[nodiscard]] OSTCommandResult OSTReplaceCommand(const platform::IPCRequest& request, platform::IPCReply& reply,
                                                 OSTClientConnection& client);

/// Command 3: stages containers for deletion. Reads "ContainerClassesArray", "UUIDsArray", "UserIDsArray",
/// "IdentifiersArray", one container for each index.
[[nodiscard]] OSTCommandResult OSTStageForDeleteCommand(const platform::IPCRequest& request, platform::IPCReply& reply,
                                                        OSTClientConnection& client);

/// Command 4: destroys everything on death row. The reply comes when that is done.
[[nodiscard]] OSTCommandResult OSTDestroyDeathRowCommand(const platform::IPCRequest& request, platform::IPCReply& reply,
                                                         OSTClientConnection& client);

/// Command 10: deletes one container. Reads "ContainerClass", "UserID", "Identifier", "Transient".
[[nodiscard]] OSTCommandResult OSTDeleteCommand(const platform::IPCRequest& request, platform::IPCReply& reply,
                                                OSTClientConnection& client);

} // namespace ost
