#include "model/OSTUserIdentity.h"

#include "platform/base/Log.h"
#include "platform/base/Mutex.h"
#include "platform/device/Accounts.h"

#include <cerrno>
#include <optional>

namespace ost {

namespace {

std::optional<std::uint32_t> resolvedUserId(std::uint32_t userId, OSTContainerClass containerClass,
                                            std::uint32_t clientUserId) {
    const auto when = [&](bool valid) { return valid ? std::optional(userId) : std::nullopt; };
    if (isBundleClass(containerClass))
        return when(userId == OSTInstallerUserId);
    if (isSystemClass(containerClass))
        return when(userId == OSTSystemUserId);
    // A user process acts for itself alone, whatever the class: the store refuses a class that does not exist.
    if (clientUserId > OSTHighestSystemUserId) {
        const bool valid = userId == clientUserId || userId == OSTCurrentUserPlaceholder;
        return valid ? std::optional(clientUserId) : std::nullopt;
    }
    if (userId == OSTCurrentUserPlaceholder)
        return getCurrentMobileUserId();
    return when(OSTUserIdFitsClass(containerClass, userId));
}

} // namespace

std::uint32_t getCurrentMobileUserId() {
    static platform::Mutex mutex;
    static std::optional<std::uint32_t> mobileUserId OST_GUARDED_BY(mutex);
    const platform::MutexLock lock(mutex);
    if (mobileUserId)
        return *mobileUserId;
    const auto account = platform::accountForName("mobile");
    if (account) {
        platform::logAs(platform::LogLevel::error, "getCurrentMobileUserId", "Current mobile user ID is %u",
                        account->uid);
    } else {
        platform::logAs(platform::LogLevel::error, "getCurrentMobileUserId", "Failed to get mobile uid. This is bad");
        // Accounts that cannot be read now, for want of a descriptor, say nothing for good.
        if (account.error() != ENOENT)
            return 0;
    }
    return mobileUserId.emplace(account ? account->uid : 0);
}

std::expected<std::uint32_t, OSTErrorCode> validateUserId(std::uint32_t userId, OSTContainerClass containerClass,
                                                          std::uint32_t clientUserId, OSTLogging logging) {
    if (const auto resolved = resolvedUserId(userId, containerClass, clientUserId))
        return *resolved;
    if (logging == OSTLogging::logged)
        platform::logError("Invalid userId %u for class %llu from client %u", userId, containerClass, clientUserId);
    return std::unexpected(OSTErrorCode::invalidParameter);
}

} // namespace ost
