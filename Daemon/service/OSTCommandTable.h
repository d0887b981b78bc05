#pragma once

#include "platform/base/OSTError.h"
#include "platform/ipc/IPCMessage.h"
#include "store/OSTClientConnection.h"

#include <array>
#include <cstddef>
#include <cstdint>

namespace ost {

/// The entitlements that commands ask for and clients hold.
inline constexpr const char* OSTEntitlementAllowed = "com.tamarok.private.Ostrand.allowed";
inline constexpr const char* OSTEntitlementNone = "com.tamarok.private.Ostrand.none";
inline constexpr const char* OSTEntitlementOtherIdLookup = "com.tamarok.private.Ostrand.otherIdLookup";
inline constexpr const char* OSTEntitlementWipeContainer = "com.tamarok.private.Ostrand.wipeContainer";
inline constexpr const char* OSTEntitlementDataMigration = "com.tamarok.private.Ostrand.dataMigration";

/// Carries a command out: reads its keys from the request, acts for the client, puts the results into the reply. Gives
/// the reply's code.
using OSTCommandHandler = OSTErrorCode (*)(const platform::IPCRequest& request, platform::IPCReply& reply,
                                           OSTClientConnection& client);

/// Who sends the reply of a command.
enum class OSTReplyBy : std::uint32_t {
    handler = 0,    ///< the handler, when its work has finished on another queue
    dispatcher = 1, ///< the dispatcher, when the handler returns
};

struct OSTCommandEntry {
    std::uint64_t index;       ///< equal to the entry's place in the table
    OSTCommandHandler handler; ///< null while there is none: the command is then refused
    const char* entitlement;   ///< what the client must hold
    OSTReplyBy replyBy;
};

inline constexpr std::size_t OSTCommandCount = 26;

/// Every command that a request may name.
extern const std::array<OSTCommandEntry, OSTCommandCount> OSTCommandTable;

} // namespace ost
