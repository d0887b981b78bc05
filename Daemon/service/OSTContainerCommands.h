#pragma once

#include "service/OSTCommandEntry.h"

namespace ost {

/// Command 0: creates or looks up a container. Reads "ContainerClass", "UserID", "Identifier" (the client's own when
/// missing), "CreateIfNecessary", "Transient"; sets "ReplyUUID", "ReplyExisted", "ReplyPath", "ReplyIdentifier".
[[nodiscard]] OSTCommandResult OSTCreateOrLookupCommand(const platform::IPCRequest& request, platform::IPCReply& reply,
                                                        OSTClientConnection& client);

/// Command 1: lists the containers of a user and class. Reads "ContainerClass", "UserID", "Transient"; sets
/// "ReplyIdsArray" and "ReplyUUIDsArray", in the same order.
[[nodiscard]] OSTCommandResult OSTListCommand(const platform::IPCRequest& request, platform::IPCReply& reply,
                                              OSTClientConnection& client);

} // namespace ost
