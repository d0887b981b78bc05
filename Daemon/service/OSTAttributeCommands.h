#pragma once

#include "service/OSTCommandEntry.h"

namespace ost {

// All of these read "ContainerClass" and "UserID", and those up to command 9 "UUID" and "Identifier" too, which has no
// default.

/// Command 5: sets an info value. Reads "Key" and "Value" (none: the key is removed).
[[nodiscard]] OSTCommandResult OSTSetInfoValueCommand(const platform::IPCRequest& request, platform::IPCReply& reply,
                                                      OSTClientConnection& client);

/// Command 6: an info value. Reads "Key"; sets "ReplyInfoValue".
[[nodiscard]] OSTCommandResult OSTInfoValueCommand(const platform::IPCRequest& request, platform::IPCReply& reply,
                                                   OSTClientConnection& client);

/// Command 7: what the daemon knows of a container. Reads "InfoDictRequested"; sets "ReplyPath", "ReplyTransient" and,
/// when it is asked for and there is one, "ReplyInfoDictionary".
[[nodiscard]] OSTCommandResult OSTMetadataCommand(const platform::IPCRequest& request, platform::IPCReply& reply,
                                                  OSTClientConnection& client);

/// Commands 8 and 22: makes the default directories again.
[[nodiscard]] OSTCommandResult OSTRecreateDefaultStructureCommand(const platform::IPCRequest& request,
                                                                  platform::IPCReply& reply,
                                                                  OSTClientConnection& client);

/// Command 9: gives the container's directory a new name.
[[nodiscard]] OSTCommandResult OSTRegenerateDirectoryUUIDCommand(const platform::IPCRequest& request,
                                                                 platform::IPCReply& reply,
                                                                 OSTClientConnection& client);

/// Command 21: gives a data container another protection class. Reads "Identifier", "DataProtectionClass",
/// "IsThirdParty", "RetryIfLocked". The reply comes when that is done, which may take an unlock of the device.
[[nodiscard]] OSTCommandResult OSTSetDataProtectionCommand(const platform::IPCRequest& request,
                                                           platform::IPCReply& reply, OSTClientConnection& client);

} // namespace ost
