#pragma once

#include "service/OSTCommandEntry.h"

namespace ost {

/// Command 13: paths of the identifier's application group containers. Reads "UserID", "Identifier" (the client's own
/// when missing); sets "ReplyGroupContainerDict".
[[nodiscard]] OSTCommandResult OSTGroupContainerPathsCommand(const platform::IPCRequest& request,
                                                             platform::IPCReply& reply, OSTClientConnection& client);

/// Command 14: the identifier's application groups. Reads as 13; sets "ReplyGroupIdentifiersArray".
[[nodiscard]] OSTCommandResult OSTGroupIdentifiersCommand(const platform::IPCRequest& request,
                                                          platform::IPCReply& reply, OSTClientConnection& client);

/// Command 15: path of a system container. Reads "Identifier"; sets "ReplyPath".
[[nodiscard]] OSTCommandResult OSTSystemContainerPathCommand(const platform::IPCRequest& request,
                                                             platform::IPCReply& reply, OSTClientConnection& client);

/// Command 16: paths of the identifier's system group containers. Reads "Identifier"; sets "ReplyGroupContainerDict".
[[nodiscard]] OSTCommandResult OSTSystemGroupContainerPathsCommand(const platform::IPCRequest& request,
                                                                   platform::IPCReply& reply,
                                                                   OSTClientConnection& client);

/// Command 17: path of one system group container. Reads "Identifier", "GroupIdentifier"; sets "ReplyPath".
[[nodiscard]] OSTCommandResult OSTSystemGroupContainerPathCommand(const platform::IPCRequest& request,
                                                                  platform::IPCReply& reply,
                                                                  OSTClientConnection& client);

/// Command 18: registers code-signing information. Reads "CodeSigningInfo" (none: the identifier is removed),
/// "Identifier", "OptionsDictionary".
[[nodiscard]] OSTCommandResult OSTRegisterCodeSigningCommand(const platform::IPCRequest& request,
                                                             platform::IPCReply& reply, OSTClientConnection& client);

/// Command 19: an identifier's code-signing information. Reads "Identifier"; sets "ReplyInfoDictionary".
[[nodiscard]] OSTCommandResult OSTCodeSigningInfoCommand(const platform::IPCRequest& request, platform::IPCReply& reply,
                                                         OSTClientConnection& client);

/// Command 20: invalidates the code-signing information of applications without a bundle container.
[[nodiscard]] OSTCommandResult OSTInvalidateCodeSigningCommand(const platform::IPCRequest& request,
                                                               platform::IPCReply& reply, OSTClientConnection& client);

} // namespace ost
