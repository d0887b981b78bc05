#include "protection/OSTDataProtectionPass.h"

#include "model/OSTGlobalConfiguration.h"
#include "platform/base/Log.h"
#include "platform/base/Path.h"
#include "store/OSTContainerCache.h"

#include <sys/stat.h>

#include <cerrno>

namespace ost {

namespace {

// The bits of a change's type.
constexpr std::int32_t setsDirectories = 1;
constexpr std::int32_t setsFiles = 2;
constexpr std::int32_t neverRaisesFiles = 4;

/// Items of this class are never changed.
constexpr std::int32_t classLeftAlone = 2;

/// What a file gets when its container is to have no class.
constexpr std::int32_t classOfFilesForNone = 3;

/// Whether a walk that meets the error says nothing about the tree: another one may get further.
bool meansTooFewResources(int error) { return error == EMFILE || error == ENFILE || error == ENOMEM; }

void logChange(const OSTTreeEntry& entry, std::int32_t toClass) {
    platform::logDebug("Setting protection class of %s to %d", entry.path, toClass);
}

} // namespace

OSTDataProtectionPass::OSTDataProtectionPass(const OSTDataProtectionChange& change,
                                             const std::optional<OSTItemIdentity>& directory)
    : _change(change), _directory(directory),
      _lock({change.dataContainerMetadata->uuid.string()}, OSTLockKind::reading) {}

OSTResult<void> OSTDataProtectionPass::run() {
    OST_TRY(_checkContainer());
    for (const auto name : OSTGlobalConfiguration::appUserDataItemNames()) {
        const auto item = platform::pathByAppending(_live->url, name);
        // One of which it cannot be said is walked, which says why it cannot be.
        if (!OSTFileManager::defaultManager().itemDoesNotExistAtURL(item))
            OST_TRY(_walk(item));
    }
    if (const auto others = _ownFiles.others(); !others.empty())
        platform::logNotice("Left the protection class of %llu files alone that have names elsewhere: %s",
                            others.size(), others.front());
    return {};
}

OSTResult<void> OSTDataProtectionPass::_checkContainer() {
    const auto& meant = *_change.dataContainerMetadata;
    const auto found = OSTContainerCache::sharedInstance().containerForUser(meant.name());
    if (!found)
        return std::unexpected(OSTCreateError(
            OSTErrorCode::notFound, found.error(),
            "Failed to lookup container to set data protection for userId: %u, identifier: %@, Class: %llu", meant.uid,
            meant.identifier, meant.containerClass));
    if (*found == _live) // Records never change.
        return {};
    const auto& url = (*found)->url;
    const bool isSame =
        url == meant.url &&
        (!_directory || OST_TRY(OSTFileManager::defaultManager().identityOfItemAtURL(url)) == *_directory);
    if (!isSame)
        return std::unexpected(OSTCreateError(
            OSTErrorCode::unexpectedPath,
            "Cancelling data protection operation because container path changed on disk. This indicates the app may "
            "have been updated and changed its protection level."));
    _live = *found;
    return {};
}

OSTResult<void> OSTDataProtectionPass::_walk(const std::string& item) {
    OSTResult<void> result;
    platform::Errno failure = 0;
    const auto visit = [&](const OSTTreeEntry& entry) {
        if (entry.visit == OSTTreeEntry::Visit::failure)
            failure = entry.error;
        result = _visit(entry);
        return result.has_value();
    };
    const bool reachedEnd = OSTWalkTree(item, visit, OSTItemStatus::kindAlone);
    if (reachedEnd || !result)
        return result;
    return std::unexpected(OSTCreatePOSIXError(failure, "FTS returned error for %s : %s", item, failure));
}

OSTResult<void> OSTDataProtectionPass::_visit(const OSTTreeEntry& entry) {
    if (_lock.giveWay())
        OST_TRY(_checkContainer());
    switch (entry.visit) {
    case OSTTreeEntry::Visit::directoryBefore:
        return {};
    case OSTTreeEntry::Visit::directoryAfter:
        return _changes(setsDirectories) ? _changeDirectory(entry) : OSTResult<void>();
    case OSTTreeEntry::Visit::item:
        return _changes(setsFiles) && S_ISREG(entry.status.mode) ? _changeFile(entry) : OSTResult<void>();
    case OSTTreeEntry::Visit::failure:
        break;
    }
    if (meansTooFewResources(entry.error))
        return std::unexpected(
            OSTCreatePOSIXError(entry.error, "FTS returned error for %s : %s", entry.path, entry.error));
    platform::logError("FTS returned error for %s : %s", entry.path, entry.error);
    return {};
}

OSTResult<void> OSTDataProtectionPass::_changeDirectory(const OSTTreeEntry& entry) {
    const auto toClass = _change.newDataProtectionClass;
    return _setClass(entry, toClass, [&](std::int32_t itemClass) {
        if (itemClass == classLeftAlone)
            return false;
        logChange(entry, toClass);
        return true;
    });
}

OSTResult<void> OSTDataProtectionPass::_changeFile(const OSTTreeEntry& entry) {
    const auto toClass = _change.newDataProtectionClass == 0 ? classOfFilesForNone : _change.newDataProtectionClass;
    return _setClass(entry, toClass, [&](std::int32_t itemClass) {
        if (itemClass == classLeftAlone || itemClass == toClass || (toClass > itemClass && _changes(neverRaisesFiles)))
            return false;
        logChange(entry, toClass);
        return true;
    });
}

OSTResult<void> OSTDataProtectionPass::_setClass(const OSTTreeEntry& entry, std::int32_t toClass,
                                                 const OSTClassPredicate& ifPredicate) {
    auto set = OSTFileManager::defaultManager().setDataProtectionClassOfItem(entry, _ownFiles, toClass, ifPredicate);
    if (set)
        return set;
    if (set.error().isPOSIX(EBADF)) {
        platform::logError("Ignoring failure to set protection class to %d on %@ (mode 0%o): %@", toClass, entry.path,
                           OSTFileManager::defaultManager().modeOfItem(entry), set.error());
        return {};
    }
    _metFixedItem = OSTFileManager::defaultManager().itemIsFixed(entry);
    return set;
}

bool OSTDataProtectionPass::_changes(std::int32_t bit) const {
    return (static_cast<std::int32_t>(_change.operationType) & bit) != 0;
}

} // namespace ost
