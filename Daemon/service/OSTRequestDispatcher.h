#pragma once

#include "platform/ipc/IPCConnection.h"
#include "platform/ipc/IPCMessage.h"
#include "service/OSTCommandTable.h"
#include "store/OSTClientConnection.h"

#include <memory>
#include <optional>

namespace ost {

/// The request door: finds the command, decides whether the caller may run it, runs it and sends the reply. A request
/// that is refused ends its connection without a reply. Nothing is kept between requests, so a caller is judged anew at
/// each.
///
/// Threads: any; requests of one connection come one at a time.
void OSTProcessVexelEvent(const std::shared_ptr<platform::IPCConnection>& connection, platform::IPCRequest request);

/// Establishes who the caller is and whether it may run the command; registers its own entitlements where nobody else
/// has. None, with the reason in the log, when the caller is refused.
[[nodiscard]] std::optional<OSTClientConnection> checkEntitlementsAndInitClientObject(platform::PeerIdentity& peer,
                                                                                      const OSTCommandEntry& command);

} // namespace ost
