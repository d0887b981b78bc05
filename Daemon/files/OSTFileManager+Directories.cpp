#include "files/OSTFileManager.h"

#include "files/OSTDurability.h"
#include "files/OSTPathResolution.h"
#include "files/OSTUniqueName.h"
#include "platform/base/Path.h"
#include "platform/device/AccessControlList.h"
#include "platform/device/ProtectionClass.h"

#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

namespace ost {

using platform::FileDescriptor;

namespace {

/// Makes a directory unless something is there. Gives whether it did.
std::expected<bool, platform::Errno> makeWhereMissing(int parent, const char* name,
                                                      const OSTDirectoryAttributes& attributes) {
    if (::mkdirat(parent, name, attributes.mode) != 0)
        return errno == EEXIST ? std::expected<bool, platform::Errno>(false) : std::unexpected(errno);
    if (!attributes.durable)
        return true;
    const auto names = OSTOpenItem(parent, ".", O_RDONLY | O_DIRECTORY);
    const auto durable = names ? OSTWaitForDisk(names->get(), ::fsync) : std::unexpected(names.error());
    if (durable)
        return true;
    ::unlinkat(parent, name, AT_REMOVEDIR);
    return std::unexpected(durable.error());
}

/// Makes the directories on the way to the item at `path` that are missing.
std::expected<void, platform::Errno> makeParents(std::string_view path, const OSTDirectoryAttributes& attributes) {
    FileDescriptor held = OST_TRY(OSTOpenItem(AT_FDCWD, "/", O_PATH | O_DIRECTORY));
    for (auto slash = path.find('/'); slash != std::string_view::npos; slash = path.find('/')) {
        const std::string_view name = path.substr(0, slash);
        path.remove_prefix(slash + 1);
        if (name.empty())
            continue;
        auto opened = OSTOpenItem(held.get(), name, O_PATH | O_DIRECTORY);
        if (!opened && opened.error() == ENOENT) {
            static_cast<void>(OST_TRY(makeWhereMissing(held.get(), std::string(name).c_str(), attributes)));
            opened = OSTOpenItem(held.get(), name, O_PATH | O_DIRECTORY);
        }
        held = OST_TRY(std::move(opened));
    }
    return {};
}

struct MadeDirectory {
    bool isNew;
    std::expected<FileDescriptor, platform::Errno> opened;
};

/// Makes a directory unless something is there, and opens it with `access`.
std::expected<MadeDirectory, platform::Errno> makeDirectory(std::string_view path,
                                                            const OSTDirectoryAttributes& attributes, int access) {
    auto place = OSTItemPlace::find(path);
    if (!place && place.error() == ENOENT && attributes.withIntermediateDirectories) {
        OST_TRY(makeParents(path, attributes));
        place = OSTItemPlace::find(path);
    }
    if (!place)
        return std::unexpected(place.error());
    const bool isNew = OST_TRY(makeWhereMissing(place->directory(), place->name(), attributes));
    auto opened = OSTOpenItem(place->directory(), place->name(), access);
    if (isNew && opened && attributes.mode == 0) { // which masks all that the directory inherits
        const auto applied = platform::applyInheritedEntries(place->directory(), opened->get());
        if (!applied && applied.error() != EOPNOTSUPP)
            return std::unexpected(applied.error());
    }
    return MadeDirectory{.isNew = isNew, .opened = std::move(opened)};
}

void giveDirectory(int directory, std::uint32_t owner) {
    // What cannot be given away stays root's.
    (void)::fchownat(directory, "", owner, owner, AT_EMPTY_PATH);
}

bool belongsTo(int directory, std::uint32_t owner) {
    struct stat status{};
    return ::fstat(directory, &status) == 0 && status.st_uid == owner && status.st_gid == owner;
}

} // namespace

const OSTFileManager& OSTFileManager::defaultManager() {
    static const OSTFileManager manager;
    return manager;
}

OSTResult<void> OSTFileManager::createDirectoryAtURL(std::string_view path,
                                                     const OSTDirectoryAttributes& attributes) const {
    const bool setsClass = attributes.protectionClass != OSTKeepProtectionClass;
    const int access = O_DIRECTORY | (setsClass ? O_RDONLY : O_PATH);

    auto directory = OSTOpenItem(AT_FDCWD, path, access); // most directories asked for exist
    bool isNew = false;
    if (!directory) {
        auto made = makeDirectory(path, attributes, access);
        if (!made && attributes.withIntermediateDirectories)
            return std::unexpected(OSTCreatePOSIXError(made.error(), "forgepath of %s failed: %s", path, made.error()));
        if (!made)
            return std::unexpected(OSTCreatePOSIXError(made.error(), "mkdir of %s failed: %s", path, made.error()));
        isNew = made->isNew;
        directory = std::move(made->opened);
    }
    if (!directory)
        return std::unexpected(
            OSTCreatePOSIXError(directory.error(), "opendir of %s failed: %s", path, directory.error()));

    if (setsClass && (isNew || platform::protectionClass(directory->get(), -1) != attributes.protectionClass)) {
        const auto set = platform::setProtectionClass(directory->get(), attributes.protectionClass);
        if (!set)
            return std::unexpected(OSTCreatePOSIXError(set.error(), "Failed to setclass(%d) on directory %s: %s",
                                                       attributes.protectionClass, path, set.error()));
    }
    if (attributes.owner != 0 && (isNew || !belongsTo(directory->get(), attributes.owner)))
        giveDirectory(directory->get(), attributes.owner);
    return {};
}

OSTResult<FileDescriptor> OSTFileManager::openDirectoryAtURL(std::string_view path) const {
    auto opened = OSTOpenItem(AT_FDCWD, path, O_RDONLY | O_DIRECTORY);
    if (!opened)
        return std::unexpected(OSTCreatePOSIXError(opened.error(), "opendir of %s failed: %s", path, opened.error()));
    return *std::move(opened);
}

OSTResult<std::string> OSTFileManager::createTemporaryDirectoryInDirectoryURL(std::string_view path,
                                                                              std::uint32_t owner) const {
    const auto make = [&]() -> std::expected<std::string, platform::Errno> {
        const FileDescriptor parent = OST_TRY(OSTOpenItem(AT_FDCWD, path, O_PATH | O_DIRECTORY));
        std::string name = OST_TRY(OSTMakeUnderUniqueName(
            "temp.", [&](const char* candidate) { return ::mkdirat(parent.get(), candidate, S_IRWXU) == 0; }));
        if (owner != 0)
            if (const auto made = OSTOpenItem(parent.get(), name, O_PATH | O_DIRECTORY))
                giveDirectory(made->get(), owner);
        return name;
    };
    const auto name = make();
    if (!name)
        return std::unexpected(OSTCreatePOSIXError(name.error(), "Failed to create temp dir at path %s : %s",
                                                   platform::pathByAppending(path, "temp.XXXXXX"), name.error()));
    return platform::pathByAppending(path, *name);
}

OSTResult<void> OSTFileManager::_waitForDirectory(std::string_view path, int (*synchronise)(int)) const {
    const FileDescriptor directory = OST_TRY(openDirectoryAtURL(path));
    if (const auto durable = OSTWaitForDisk(directory.get(), synchronise); !durable)
        return std::unexpected(OSTCreatePOSIXError(durable.error(), "fsync of %@ failed: %s", path, durable.error()));
    return {};
}

OSTResult<void> OSTFileManager::makeDirectoryDurable(std::string_view path) const {
    return _waitForDirectory(path, ::fsync);
}

OSTResult<void> OSTFileManager::makeMoveDurable(std::string_view source, std::string_view destination) const {
    const auto from = platform::pathByDeletingLastComponent(source),
               to = platform::pathByDeletingLastComponent(destination);
    OST_TRY(makeDirectoryDurable(to));
    return from == to ? OSTResult<void>() : makeDirectoryDurable(from);
}

OSTResult<void> OSTFileManager::makeFileSystemDurable(std::string_view path) const {
    return _waitForDirectory(path, ::syncfs);
}

} // namespace ost
