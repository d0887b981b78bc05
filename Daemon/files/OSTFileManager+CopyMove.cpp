#include "files/OSTFileManager.h"

#include "files/OSTDurability.h"
#include "files/OSTPathResolution.h"
#include "files/OSTTreeCopy.h"
#include "files/OSTUniqueName.h"
#include "platform/base/Log.h"
#include "platform/base/Path.h"

#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstring>

namespace ost {

using platform::FileDescriptor;

namespace {

/// What happens to an item that is at the destination of a copy.
enum class Existing : unsigned { stays = RENAME_NOREPLACE, isReplaced = 0 };

/// A directory beside an item that only root enters. A copy is built there and appears in one rename; what has been
/// copied disappears into one in one rename. Its name is hidden, so no listing shows it. It is removed with what is
/// left in it.
class Workshop {
public:
    static std::expected<Workshop, platform::Errno> make(std::string_view item, int parent) {
        auto name = OST_TRY(OSTMakeUnderUniqueName(OSTOwnUnfinishedPrefix(), [&](const char* candidate) {
            return ::mkdirat(parent, candidate, S_IRWXU) == 0;
        }));
        std::string path = platform::pathByAppending(platform::pathByDeletingLastComponent(item), name);
        auto directory = OSTOpenItem(parent, name, O_RDONLY | O_DIRECTORY);
        if (!directory) {
            ::unlinkat(parent, name.c_str(), AT_REMOVEDIR);
            return std::unexpected(directory.error());
        }
        return Workshop(std::move(path), *std::move(directory));
    }
    Workshop(Workshop&& other) noexcept = default;
    Workshop& operator=(Workshop&&) = delete;
    ~Workshop() {
        if (_directory)
            (void)OSTFileManager::defaultManager().removeItemAtURL(_path);
    }

    [[nodiscard]] int directory() const { return _directory.get(); }
    [[nodiscard]] const std::string& path() const { return _path; }

private:
    Workshop(std::string path, FileDescriptor directory) : _path(std::move(path)), _directory(std::move(directory)) {}

    std::string _path;
    FileDescriptor _directory;
};

std::expected<void, platform::Errno> copy(std::string_view source, std::string_view destination, Existing existing) {
    const auto from = OST_TRY(OSTItemPlace::find(source));
    const auto to = OST_TRY(OSTItemPlace::find(destination, O_RDONLY));
    const auto workshop = OST_TRY(Workshop::make(destination, to.directory()));
    OST_TRY(OSTCopyTree(from.directory(), from.name(), workshop.directory(), to.name()));
    // A copy that is on disk before it is visible, in a directory that is on disk before the source goes, survives
    // whatever the removal of the source survives.
    const bool isMove = existing == Existing::isReplaced;
    if (isMove)
        OST_TRY(OSTWaitForDisk(workshop.directory(), ::syncfs));
    if (::renameat2(workshop.directory(), to.name(), to.directory(), to.name(), static_cast<unsigned>(existing)) != 0)
        return std::unexpected(errno);
    if (isMove) {
        const auto durable = OSTWaitForDisk(to.directory(), ::fsync);
        if (!durable) // the source stays the only one
            ::renameat(to.directory(), to.name(), workshop.directory(), to.name());
        return durable;
    }
    return {};
}

/// Removes what has been copied elsewhere: first from its place, in one step, so that whoever is interrupted leaves all
/// of it there or nothing.
OSTResult<void> removeSource(std::string_view source) {
    const auto& files = OSTFileManager::defaultManager();
    const auto from = OSTItemPlace::find(source);
    const auto workshop = from ? Workshop::make(source, from->directory()) : std::unexpected(from.error());
    if (!workshop || ::renameat(from->directory(), from->name(), workshop->directory(), from->name()) != 0)
        return files.removeItemAtURL(source);
    return files.removeItemAtURL(platform::pathByAppending(workshop->path(), from->name()));
}

OSTResult<void> copied(std::string_view source, std::string_view destination, Existing existing) {
    if (const auto done = copy(source, destination, existing); !done)
        return std::unexpected(
            OSTCreatePOSIXError(done.error(), "clonetree of %@ to %@ failed: %s", source, destination, done.error()));
    return {};
}

std::expected<void, platform::Errno> rename(std::string_view source, std::string_view destination) {
    const auto from = OST_TRY(OSTItemPlace::find(source));
    const auto to = OST_TRY(OSTItemPlace::find(destination));
    if (::renameat(from.directory(), from.name(), to.directory(), to.name()) != 0)
        return std::unexpected(errno);
    return {};
}

/// Whether nothing is at `source`; fails when that cannot be found out.
OSTResult<bool> isMissing(std::string_view source) {
    const auto item = OSTOpenItem(AT_FDCWD, source, O_PATH);
    if (!item && item.error() != ENOENT)
        return std::unexpected(OSTCreatePOSIXError(item.error(), "stat of %@ failed: %s", source, item.error()));
    return !item;
}

} // namespace

OSTResult<void> OSTFileManager::_copyItemAtURL(std::string_view source, std::string_view destination,
                                               MissingSource missingSource) const {
    if (missingSource == MissingSource::isSuccess && OST_TRY(isMissing(source)))
        return {};
    return copied(source, destination, Existing::stays);
}

OSTResult<void> OSTFileManager::_moveItemAtURL(std::string_view source, std::string_view destination,
                                               MissingSource missingSource) const {
    if (missingSource == MissingSource::isSuccess && OST_TRY(isMissing(source)))
        return {};
    const auto renamed = rename(source, destination);
    if (renamed)
        return {};
    if (renamed.error() != EXDEV)
        return std::unexpected(OSTCreatePOSIXError(renamed.error(), "rename of %@ to %@ failed: %s", source,
                                                   destination, renamed.error()));
    OST_TRY(copied(source, destination, Existing::isReplaced));
    if (const auto removed = removeSource(source); !removed)
        platform::logError("Failed to remove source %@ : %s", source,
                           platform::Errno(static_cast<int>(removed.error().code())));
    return {};
}

OSTResult<void> OSTFileManager::copyItemAtURL(std::string_view source, std::string_view destination) const {
    return _copyItemAtURL(source, destination, MissingSource::fails);
}

OSTResult<void> OSTFileManager::copyItemIfExistsAtURL(std::string_view source, std::string_view destination) const {
    return _copyItemAtURL(source, destination, MissingSource::isSuccess);
}

OSTResult<void> OSTFileManager::moveItemAtURL(std::string_view source, std::string_view destination) const {
    return _moveItemAtURL(source, destination, MissingSource::fails);
}

OSTResult<void> OSTFileManager::moveItemIfExistsAtURL(std::string_view source, std::string_view destination) const {
    return _moveItemAtURL(source, destination, MissingSource::isSuccess);
}

} // namespace ost
