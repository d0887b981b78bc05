#include "files/OSTFileManager.h"

#include "files/OSTPathResolution.h"
#include "files/OSTTreeCursor.h"
#include "platform/base/Log.h"
#include "platform/base/Path.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <sys/sysmacros.h>

#include <cerrno>

namespace ost {

namespace {

bool isDirectory(const OSTTreeCursor& item) {
    if (item.type() != DT_UNKNOWN)
        return item.type() == DT_DIR;
    struct stat status{};
    return ::fstatat(item.directory(), item.name(), &status, AT_SYMLINK_NOFOLLOW) == 0 && S_ISDIR(status.st_mode);
}

std::expected<std::vector<OSTDirectoryItem>, platform::Errno> listing(std::string_view path) {
    auto directory = OSTOpenItem(AT_FDCWD, path, O_RDONLY | O_DIRECTORY);
    if (!directory && directory.error() != ENOENT)
        platform::logAs(platform::LogLevel::error, "_IterateDirectory", "opendir of %s failed: %s", path,
                        directory.error());
    OSTTreeCursor cursor(OST_TRY(std::move(directory)), std::string());
    std::vector<OSTDirectoryItem> items;
    while (OST_TRY(cursor.next()))
        if (cursor.name()[0] != '.')
            items.push_back({.name = cursor.name(), .isDirectory = isDirectory(cursor)});
    return items;
}

/// 0 when an item is at `path`, else why it cannot be seen.
platform::Errno errorOfLooking(std::string_view path) {
    const auto item = OSTOpenItem(AT_FDCWD, path, O_PATH);
    return item ? platform::Errno(0) : item.error();
}

OSTResult<struct statx> statusOfItem(std::string_view path, unsigned mask) {
    const auto item = OSTOpenItem(AT_FDCWD, path, O_PATH);
    struct statx status{};
    platform::Errno error = item ? platform::Errno(0) : item.error();
    if (item && ::statx(item->get(), "", AT_EMPTY_PATH, mask, &status) != 0)
        error = errno;
    if (error != 0)
        return std::unexpected(OSTCreatePOSIXError(error, "stat of %@ failed: %s", path, error));
    return status;
}

} // namespace

OSTResult<std::vector<OSTDirectoryItem>> OSTFileManager::urlsForItemsInDirectoryAtURL(std::string_view path) const {
    auto items = listing(path);
    if (!items)
        return std::unexpected(
            OSTCreatePOSIXError(items.error(), "_IterateDirectory for %@ returned %s", path, items.error()));
    return *std::move(items);
}

OSTResult<OSTItemIdentity> OSTFileManager::identityOfItemAtURL(std::string_view path) const {
    const auto status = OST_TRY(statusOfItem(path, STATX_INO | STATX_BTIME));
    return OSTItemIdentity{.device = ::makedev(status.stx_dev_major, status.stx_dev_minor),
                           .inode = status.stx_ino,
                           .made = std::chrono::seconds(status.stx_btime.tv_sec) +
                                   std::chrono::nanoseconds(status.stx_btime.tv_nsec)};
}

OSTResult<uid_t> OSTFileManager::ownerOfItemAtURL(std::string_view path) const {
    return OST_TRY(statusOfItem(path, STATX_UID)).stx_uid;
}

bool OSTFileManager::itemExistsAtURL(std::string_view path) const {
    const platform::Errno error = errorOfLooking(path);
    if (error != 0 && error != ENOENT)
        platform::logError("Failed to determine if %@ exists: %s", path, error);
    return error == 0;
}

bool OSTFileManager::itemDoesNotExistAtURL(std::string_view path) const {
    const platform::Errno error = errorOfLooking(path);
    if (error != 0 && error != ENOENT)
        platform::logError("Failed to determine if %@ exists: %s", path, error);
    return error == ENOENT;
}

bool OSTFileManager::itemDoesNotExist(int directory, std::string_view relativePath) const {
    const auto item = OSTOpenItem(directory, relativePath, O_PATH);
    const platform::Errno error = item ? platform::Errno(0) : item.error();
    const bool absent = error == ENOENT || error == ENOTDIR || error == ELOOP;
    if (error != 0 && !absent)
        platform::logError("Failed to determine if %@ exists: %s", relativePath, error);
    return absent;
}

} // namespace ost
