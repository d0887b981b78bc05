#include "model/OSTGlobalConfiguration.h"
#include "platform/Path.h"
#include "platform/Transactions.h"
#include "store/OSTClientConnection.h"
#include "store/OSTFileManager.h"

#include <cerrno>

namespace ost {

using platform::lastPathComponent;
using platform::pathByAppending;

namespace {

/// Where items go that cannot be removed.
constexpr std::string_view parkingDirectory = "/tmp";

/// How often a move to death row is tried again when a pass removed the unique directory that was made for it. A pass removes
/// what it has listed, once, so more than a few losses in a row have another cause.
constexpr int movesToDeathRow = 16;

} // namespace

platform::WorkQueue& OSTDeathRowQueue() {
    // Never destroyed: the process may end while a pass runs.
    static platform::WorkQueue& queue = *new platform::WorkQueue("com.tamarok.ostrandd.deathrow");
    return queue;
}

OSTResult<void> OSTClientConnection::_moveItemAtURLToDeathRow(const std::string& url,
                                                              StartPass startDeletionThread) const {
    const auto& files = OSTFileManager::defaultManager();
    for (int attempt = 1;; ++attempt) {
        // A directory of its own keeps two items of the same name from colliding.
        const auto unique = files.createTemporaryDirectoryInDirectoryURL(
            OSTGlobalConfiguration::sharedInstance().deathrowDirectory());
        if (!unique)
            return std::unexpected(OSTCreateError(OSTErrorCode::moveToDeathRowFailed, unique.error(),
                                                  "Failed to create unique directory at: %@", url));
        const auto destination = pathByAppending(*unique, lastPathComponent(url));
        const auto moved = files.moveItemAtURL(url, destination);
        if (moved)
            break;
        if (moved.error().isPOSIX(ENOENT)) {
            if (files.itemDoesNotExistAtURL(url))
                return {};
            if (attempt < movesToDeathRow)
                continue;
        }
        return std::unexpected(OSTCreateError(OSTErrorCode::moveToDeathRowFailed, moved.error(),
                                              "Failed to move item at: %@ to: %@", url, destination));
    }
    if (startDeletionThread == StartPass::yes)
        deleteContainersOnDeathRowWithCompletion();
    return {};
}

void OSTClientConnection::deleteContainersOnDeathRowWithCompletion(DeathRowCompletion completion) const {
    async_with_transaction(OSTDeathRowQueue(), [completion = std::move(completion)]() mutable {
        const auto error = _emptyDeathRow();
        if (completion)
            completion(static_cast<std::int64_t>(error ? error->code() : OSTErrorCode::success));
    });
}

std::optional<OSTError> OSTClientConnection::_emptyDeathRow() {
    const auto deathRow = OSTGlobalConfiguration::sharedInstance().deathrowDirectory();
    const auto items = OSTFileManager::defaultManager().urlsForItemsInDirectoryAtURL(deathRow);
    if (!items) {
        if (items.error().isPOSIX(ENOENT))
            return items.error();
        return OSTCreateError(OSTErrorCode::deletionFailed, items.error(), "Failed to get items for deletion: %@ : %@",
                              deathRow, items.error());
    }
    std::optional<OSTError> passError;
    for (const auto& item : *items) {
        const auto path = pathByAppending(deathRow, item.name);
        const auto removed = _removeItemOrMoveToTempAtURL(path);
        if (!removed)
            passError = OSTCreateError(OSTErrorCode::destructionFailed, removed.error(),
                                       "Failed to destroy item at: %@", path);
        else if (*removed)
            passError = *removed;
    }
    return passError;
}

OSTResult<std::optional<OSTError>> OSTClientConnection::_removeItemOrMoveToTempAtURL(const std::string& url) {
    const auto& files = OSTFileManager::defaultManager();
    const auto removed = files.removeItemAtURL(url);
    if (removed || removed.error().isPOSIX(ENOENT))
        return std::nullopt;
    platform::logDebug("Couldn't remove, so moving item to /tmp: %@ : %@", url, removed.error());
    const auto parked = files.moveItemAtURL(url, pathByAppending(parkingDirectory, lastPathComponent(url)));
    if (!parked)
        return std::unexpected(OSTCreateError(OSTErrorCode::moveAsideFailed, parked.error(),
                                              "Failed to move dir: %@ to: %@", url, parkingDirectory));
    return removed.error();
}

} // namespace ost
