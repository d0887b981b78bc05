#include "files/OSTFileManager.h"

#include "files/OSTOwnFiles.h"
#include "files/OSTPathResolution.h"
#include "platform/device/ProtectionClass.h"

#include <fcntl.h>
#include <sys/stat.h>

#include <cerrno>

namespace ost {

using platform::FileDescriptor;

namespace {

/// An item that has been opened for the sake of its class, and the directory that holds it.
struct ClassedItem {
    int directory;
    FileDescriptor descriptor;
    struct stat status;
    const std::string& path;
};

OSTResult<ClassedItem> open(int directory, const char* name, const std::string& path,
                            OSTMounts mounts = OSTMounts::cross) {
    ClassedItem item{.directory = directory, .descriptor = {}, .status = {}, .path = path};
    auto opened = OSTOpenItem(directory, name, O_RDONLY, mounts);
    if (opened && ::fstat(opened->get(), &item.status) != 0)
        opened = std::unexpected(errno);
    if (!opened)
        return std::unexpected(OSTCreatePOSIXError(opened.error(), "Failed to open %s : %s", path, opened.error()));
    item.descriptor = *std::move(opened);
    return item;
}

OSTResult<std::int32_t> classOf(const ClassedItem& item) {
    const bool hasClass = S_ISREG(item.status.st_mode) || S_ISDIR(item.status.st_mode);
    const auto found =
        hasClass ? platform::protectionClass(item.descriptor.get(), item.directory) : std::unexpected(EBADF);
    if (!found)
        return std::unexpected(
            OSTCreatePOSIXError(found.error(), "Failed to getclass of file %s: %s", item.path, found.error()));
    return *found;
}

OSTResult<void> setClass(const ClassedItem& item, std::int32_t toClass, const OSTClassPredicate& predicate) {
    if (predicate && !predicate(OST_TRY(classOf(item))))
        return {};
    const bool hasClass = S_ISREG(item.status.st_mode) || S_ISDIR(item.status.st_mode);
    const auto set = hasClass ? platform::setProtectionClass(item.descriptor.get(), toClass) : std::unexpected(EBADF);
    if (!set)
        return std::unexpected(
            OSTCreatePOSIXError(set.error(), "Failed to setclass(%d) on file %s: %s", toClass, item.path, set.error()));
    return {};
}

/// Opens the item at `path` and gives it to `act`, with its directory open as long.
template<typename Act>
auto withItem(const std::string& path, Act act) -> std::invoke_result_t<Act, const ClassedItem&> {
    const auto place = OSTItemPlace::find(path);
    if (!place)
        return std::unexpected(OSTCreatePOSIXError(place.error(), "Failed to open %s : %s", path, place.error()));
    return act(OST_TRY(open(place->directory(), place->name(), path)));
}

/// All 0 when it cannot be read.
struct statx statusOf(const OSTTreeEntry& entry) {
    struct statx status{};
    if (::statx(entry.directory, entry.name, AT_SYMLINK_NOFOLLOW, STATX_TYPE | STATX_MODE, &status) != 0)
        return {};
    return status;
}

} // namespace

OSTResult<std::int32_t> OSTFileManager::dataProtectionClassOfItemAtURL(std::string_view path) const {
    return withItem(std::string(path), classOf);
}

OSTResult<void> OSTFileManager::setDataProtectionClassOfItemAtURL(std::string_view path, std::int32_t toClass,
                                                                  const OSTClassPredicate& ifPredicate) const {
    return withItem(std::string(path), [&](const ClassedItem& item) { return setClass(item, toClass, ifPredicate); });
}

OSTResult<void> OSTFileManager::setDataProtectionClassOfItem(const OSTTreeEntry& entry, OSTOwnFiles& ownFiles,
                                                             std::int32_t toClass,
                                                             const OSTClassPredicate& ifPredicate) const {
    const auto item = open(entry.directory, entry.name, entry.path, OSTMounts::stayOut);
    if (!item && item.error().isPOSIX(EXDEV)) // another file system's
        return {};
    if (!item)
        return std::unexpected(item.error());
    const bool isSameKind = ((item->status.st_mode ^ entry.status.mode) & static_cast<mode_t>(S_IFMT)) == 0;
    if (!isSameKind || !ownFiles.contains(item->status, entry.path))
        return {};
    return setClass(*item, toClass, ifPredicate);
}

bool OSTFileManager::itemIsFixed(const OSTTreeEntry& entry) const {
    constexpr std::uint64_t fixed = STATX_ATTR_IMMUTABLE | STATX_ATTR_APPEND;
    return (statusOf(entry).stx_attributes & fixed) != 0;
}

mode_t OSTFileManager::modeOfItem(const OSTTreeEntry& entry) const { return statusOf(entry).stx_mode; }

} // namespace ost
