#pragma once

#include "Client/Connection.h"
#include "Client/Containers.h"

#include <cstdint>

namespace ostrand {

/// Replaces the content of a data container by that of a new one; UUID and path stay. Fails with 11 for a class that
/// holds no data, with 21 when there is no such container.
[[nodiscard]] Result<void> wipe(Connection& connection, const ContainerRequest& container);

/// The same with the plug-in data of an identifier that the caller's entitlement lists, which takes no other right.
/// Fails with 55 for one that it does not list.
[[nodiscard]] Result<void> wipePlugIn(Connection& connection, const std::string& identifier, std::uint64_t user);

/// The bytes that a container takes on disk. Fails with 21 when it is not there under that UUID.
[[nodiscard]] Result<std::uint64_t> diskUsage(Connection& connection, const ContainerReference& container);

/// Changes what older releases left behind, and returns when that is done. Takes an entitlement of its own.
[[nodiscard]] Result<void> migrate(Connection& connection);
/// Only sends it; the reply to the number, which has nothing but its code, is to be received.
[[nodiscard]] Result<std::uint32_t> beginMigration(Connection& connection);

/// Lets the daemon of an internal build end, so that a client can test what it does then; fails with a lost connection
/// each time it does, `crashes` times in all. Other builds do nothing.
[[nodiscard]] Result<void> retryTest(Connection& connection, std::uint64_t user, std::uint64_t crashes);

} // namespace ostrand
