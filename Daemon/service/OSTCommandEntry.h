#pragma once

#include "Protocol/OSTCommand.h"
#include "Protocol/OSTErrorCode.h"
#include "platform/ipc/IPCMessage.h"
#include "store/OSTClientConnection.h"

#include <cstdint>
#include <expected>
#include <string_view>

namespace ost {

/// How a command ended: with the reply's code unless it succeeded.
using OSTCommandResult = std::expected<void, OSTErrorCode>;

/// Carries a command out: reads its keys from the request, acts for the client, puts the results into the reply.
using OSTCommandHandler = OSTCommandResult (*)(const platform::IPCRequest& request, platform::IPCReply& reply,
                                               OSTClientConnection& client);

/// Who sends the reply of a command.
enum class OSTReplyBy : std::uint32_t {
    handler = 0,    ///< the handler, when its work has finished on another queue
    dispatcher = 1, ///< the dispatcher, when the handler returns
};

struct OSTCommandEntry {
    OSTCommand command;           ///< equal to the entry's place in the table
    OSTCommandHandler handler;    ///< null while there is none: the command is then refused
    std::string_view entitlement; ///< what the client must hold
    OSTReplyBy replyBy;
};

} // namespace ost
