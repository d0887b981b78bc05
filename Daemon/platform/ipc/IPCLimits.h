#pragma once

#include "platform/ipc/IPCFrame.h"

#include <chrono>
#include <cstddef>
#include <cstdint>

namespace ost::platform {

/// What a client may cost before it loses its connection.
struct IPCLimits {
    std::size_t connections = 4096;           ///< in all
    std::size_t connectionsKeptForRoot = 256; ///< of these; so the others can never lock root out
    std::size_t connectionsOfOneUser = 256;   ///< of a user id above 0, so that no user can take them all
    unsigned turnsOfOneUser = 2;              ///< connections of a user id above 0 that are served at a time
    std::uint32_t payload = IPCFrameHeader::maximumPayload;
    std::uint32_t payloadWithoutEntitlements = 64 * 1024; ///< of a program that may run no command anyway
    std::size_t unreadReplies = 64 * 1024 * 1024;         ///< bytes kept for a client that does not read
    std::size_t memoryOfOneUser =
        64 * 1024 * 1024; ///< of a user id above 0: unfinished frames, queued requests, replies
    std::size_t memoryOfUsers = 512 * 1024 * 1024;                  ///< of all of them
    std::chrono::milliseconds takeReply = std::chrono::seconds(30); ///< to take a reply that the socket cannot hold
    std::chrono::milliseconds completeFrame =
        std::chrono::seconds(30);                                    ///< to send a frame whose first byte has arrived
    std::chrono::milliseconds acceptAgain = std::chrono::seconds(1); ///< pause when the process is out of descriptors

    /// The same, with fewer connections where that many open descriptors do not suffice for them and for the requests
    /// they bring.
    [[nodiscard]] IPCLimits withDescriptors(std::size_t descriptors) const;
};

} // namespace ost::platform
