#pragma once

#include "Protocol/OSTContainerClass.h"
#include "platform/base/OSTError.h"

#include <cstdint>
#include <expected>

namespace ost {

/// The uid of the account "mobile", looked up once per process; 0 when there is no such account. Any thread.
[[nodiscard]] std::uint32_t getCurrentMobileUserId();

/// Decides whether a client may act for `userId` on containers of a class, and whom it means: the placeholder 1 becomes
/// the client's own user, or for a system client the mobile user.
///
/// Fails with `invalidParameter`, which is logged unless `logging` is silent.
[[nodiscard]] std::expected<std::uint32_t, OSTErrorCode> validateUserId(std::uint32_t userId,
                                                                        OSTContainerClass containerClass,
                                                                        std::uint32_t clientUserId,
                                                                        OSTLogging logging = OSTLogging::logged);

} // namespace ost
