#include "files/OSTFileManager.h"

#include "files/OSTDurability.h"
#include "files/OSTPathResolution.h"
#include "files/OSTUniqueName.h"
#include "platform/base/Immortal.h"
#include "platform/base/Path.h"
#include "platform/base/SmallFile.h"
#include "platform/device/AccessControlList.h"
#include "platform/device/ProtectionClass.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <map>
#include <memory>
#include <set>

namespace ost {

using platform::FileDescriptor;

namespace {

/// The name of a file that is removed again unless it was kept.
class UnfinishedFile {
public:
    UnfinishedFile(int directory, std::string name) : _directory(directory), _name(std::move(name)) {}
    UnfinishedFile(const UnfinishedFile&) = delete;
    UnfinishedFile& operator=(const UnfinishedFile&) = delete;
    ~UnfinishedFile() {
        if (!_name.empty())
            ::unlinkat(_directory, _name.c_str(), 0);
    }

    [[nodiscard]] int directory() const { return _directory; }
    [[nodiscard]] const char* name() const { return _name.c_str(); }
    void keep() { _name.clear(); }

private:
    int _directory;
    std::string _name;
};

FileDescriptor createExclusively(int directory, const char* name, mode_t mode) {
    return FileDescriptor(::openat(directory, name, O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, mode));
}

/// A directory may hand an ACL down to what is made in it, which then takes from the mode, and a file of the daemon is
/// nobody else's to write.
std::expected<void, platform::Errno> insistOnMode(int file, mode_t mode) {
    struct stat status{};
    if (::fstat(file, &status) != 0)
        return std::unexpected(errno);
    if ((status.st_mode & static_cast<mode_t>(ALLPERMS)) == mode)
        return {};
    const auto none = OST_TRY(platform::AccessControlList::create(0));
    OST_TRY(none.apply(file));
    return platform::setModeKeepingMask(file, mode);
}

std::expected<void, platform::Errno> finish(int file, std::string_view bytes, const OSTFileAttributes& attributes) {
    OST_TRY(insistOnMode(file, attributes.mode));
    if (attributes.protectionClass != OSTKeepProtectionClass) {
        const auto set = platform::setProtectionClass(file, attributes.protectionClass);
        // On a file system without classes every file is unprotected anyway.
        if (!set && set.error() != EBADF)
            return std::unexpected(set.error());
    }
    return platform::writeAll(file, bytes);
}

/// Creates a file in the directory `workshop` and gives its name.
std::expected<std::string, platform::Errno> createUnfinished(int workshop, mode_t mode, FileDescriptor& file) {
    return OSTMakeUnderUniqueName(OSTOwnUnfinishedPrefix(), [&](const char* candidate) {
        file = createExclusively(workshop, candidate, mode);
        return static_cast<bool>(file);
    });
}

/// `workshop` is the directory in which the file is unfinished.
std::expected<void, platform::Errno> writeAtomically(const OSTItemPlace& place, int workshop, std::string_view bytes,
                                                     const OSTFileAttributes& attributes) {
    FileDescriptor file;
    UnfinishedFile unfinished(workshop, OST_TRY(createUnfinished(workshop, attributes.mode, file)));
    OST_TRY(finish(file.get(), bytes, attributes));
    OST_TRY(OSTWaitForDisk(file.get(), ::fsync)); // the protection class is an attribute, which fdatasync may leave out
    if (::renameat(workshop, unfinished.name(), place.directory(), place.name()) != 0)
        return std::unexpected(errno);
    unfinished.keep();
    return OSTWaitForDisk(place.directory(), ::fsync);
}

std::expected<void, platform::Errno> writeAtomically(std::string_view path, std::string_view bytes,
                                                     const OSTFileAttributes& attributes, OSTWorkshop workshop) {
    const auto place = OST_TRY(OSTItemPlace::find(path, O_RDONLY));
    if (workshop == OSTWorkshop::directoryAbove) {
        const auto above = OST_TRY(OSTItemPlace::find(platform::pathByDeletingLastComponent(path)));
        const auto written = writeAtomically(place, above.directory(), bytes, attributes);
        if (written || written.error() != EXDEV)
            return written;
    }
    return writeAtomically(place, place.directory(), bytes, attributes);
}

/// Writes many files, each in one step, on few waits for the disk: all of them are made beside their places, waited for
/// together, moved into their places, and waited for again.
class FileBatch {
public:
    using Result = std::expected<void, platform::Errno>;

    explicit FileBatch(const std::vector<OSTFileContent>& files) : _files(files), _results(files.size()) {}

    [[nodiscard]] std::vector<Result> write() && {
        for (std::size_t first = 0; first < _files.size(); first += unfinishedAtOnce)
            _write(first, std::min(first + unfinishedAtOnce, _files.size()));
        _waitForDisk(0, _files.size());
        return std::move(_results);
    }

private:
    /// So that neither directories nor the disk grow much for a while.
    static constexpr std::size_t unfinishedAtOnce = 2048;

    void _write(std::size_t first, std::size_t end) {
        std::map<std::size_t, UnfinishedFile> unfinished;
        for (auto index = first; index < end; ++index)
            _results[index] = _prepare(index, unfinished);
        _waitForDisk(first, end);
        for (auto& [index, file] : unfinished)
            if (_results[index])
                _results[index] = _put(file, _files[index]);
    }

    [[nodiscard]] Result _prepare(std::size_t index, std::map<std::size_t, UnfinishedFile>& unfinished) {
        const OSTFileAttributes attributes;
        const int workshop = OST_TRY(_workshopOf(_files[index].path));
        FileDescriptor file;
        unfinished.try_emplace(index, workshop, OST_TRY(createUnfinished(workshop, attributes.mode, file)));
        return finish(file.get(), _files[index].bytes, attributes);
    }

    [[nodiscard]] static Result _put(UnfinishedFile& unfinished, const OSTFileContent& content) {
        const auto place = OST_TRY(OSTItemPlace::find(content.path));
        if (::renameat(unfinished.directory(), unfinished.name(), place.directory(), place.name()) == 0)
            unfinished.keep();
        else if (errno == EXDEV)
            return writeAtomically(content.path, content.bytes, {}, OSTWorkshop::ownDirectory);
        else
            return std::unexpected(errno);
        return {};
    }

    /// The directory above that of the file.
    [[nodiscard]] std::expected<int, platform::Errno> _workshopOf(std::string_view path) {
        const std::string above(platform::pathByDeletingLastComponent(platform::pathByDeletingLastComponent(path)));
        auto found = _workshops.find(above);
        if (found == _workshops.end())
            found = _workshops.emplace(above, OST_TRY(OSTOpenItem(AT_FDCWD, above, O_RDONLY | O_DIRECTORY))).first;
        return found->second.get();
    }

    /// Waits for all that was changed where the workshops are. When that fails, so do the files of the range.
    void _waitForDisk(std::size_t first, std::size_t end) {
        std::set<dev_t> waitedFor;
        Result durable;
        for (const auto& [path, workshop] : _workshops) {
            struct stat status{};
            if (::fstat(workshop.get(), &status) != 0)
                durable = std::unexpected(errno);
            else if (waitedFor.insert(status.st_dev).second)
                if (const auto waited = OSTWaitForDisk(workshop.get(), ::syncfs); !waited)
                    durable = waited;
        }
        for (auto index = first; !durable && index < end; ++index)
            if (_results[index])
                _results[index] = durable;
    }

    const std::vector<OSTFileContent>& _files;
    std::vector<Result> _results;
    std::map<std::string, FileDescriptor, std::less<>> _workshops; // few: one for each class of containers
};

/// Users may have items of such names.
bool isOurs(int directory, const char* name) {
    struct stat status{};
    return ::fstatat(directory, name, &status, AT_SYMLINK_NOFOLLOW | AT_NO_AUTOMOUNT) == 0 &&
           status.st_uid == ::geteuid();
}

} // namespace

OSTResult<void> OSTFileManager::writeFileAtomicallyAtURL(std::string_view path, std::string_view bytes,
                                                         const OSTFileAttributes& attributes,
                                                         OSTWorkshop workshop) const {
    if (const auto written = writeAtomically(path, bytes, attributes, workshop); !written)
        return std::unexpected(OSTCreatePOSIXError(written.error(), "write of %@ failed: %s", path, written.error()));
    return {};
}

std::vector<OSTResult<void>>
OSTFileManager::writeFilesAtomicallyAtURLs(const std::vector<OSTFileContent>& files) const {
    std::vector<OSTResult<void>> results(files.size());
    const auto written = FileBatch(files).write();
    for (std::size_t i = 0; i < files.size(); ++i)
        if (!written[i])
            results[i] = std::unexpected(
                OSTCreatePOSIXError(written[i].error(), "write of %@ failed: %s", files[i].path, written[i].error()));
    return results;
}

const std::string& OSTOwnUnfinishedPrefix() {
    static platform::Immortal prefix([] {
        const auto tag = OSTMakeUnderUniqueName(OSTUnfinishedPrefix, [](const char*) { return true; });
        return tag.value_or(std::string(OSTUnfinishedPrefix)) + ".";
    });
    return *prefix;
}

std::vector<std::string> OSTFileManager::unfinishedItemsInDirectoryURL(std::string_view path) const {
    std::vector<std::string> items;
    auto directory = OSTOpenItem(AT_FDCWD, path, O_RDONLY | O_DIRECTORY);
    const auto close = [](DIR* stream) { ::closedir(stream); };
    const std::unique_ptr<DIR, decltype(close)> stream(directory ? ::fdopendir(directory->release()) : nullptr);
    while (const dirent* const entry = stream ? ::readdir(stream.get()) : nullptr) {
        const std::string_view name = entry->d_name;
        if (name.starts_with(OSTUnfinishedPrefix) && !name.starts_with(OSTOwnUnfinishedPrefix()) &&
            isOurs(::dirfd(stream.get()), entry->d_name))
            items.push_back(platform::pathByAppending(path, name));
    }
    return items;
}

void OSTFileManager::removeUnfinishedItemsInDirectoryURL(std::string_view path) const {
    for (const auto& item : unfinishedItemsInDirectoryURL(path))
        static_cast<void>(removeItemAtURL(item));
}

OSTResult<OSTNewFile> OSTFileManager::createFileAtURL(std::string_view path, std::string_view bytes,
                                                      const OSTFileAttributes& attributes) const {
    const auto create = [&]() -> std::expected<OSTNewFile, platform::Errno> {
        auto place = OST_TRY(OSTItemPlace::find(path, O_RDONLY));
        FileDescriptor file = createExclusively(place.directory(), place.name(), attributes.mode);
        if (!file)
            return std::unexpected(errno);
        UnfinishedFile unfinished(place.directory(), place.name());
        OST_TRY(finish(file.get(), bytes, attributes));
        unfinished.keep();
        return OSTNewFile(std::string(path), std::move(file), std::move(place).takeDirectory());
    };
    auto created = create();
    if (!created)
        return std::unexpected(OSTCreatePOSIXError(created.error(), "write of %@ failed: %s", path, created.error()));
    return *std::move(created);
}

OSTResult<void> OSTNewFile::makeDurable() {
    auto durable = OSTWaitForDisk(_file.get(), ::fsync); // the class too
    if (durable)
        durable = OSTWaitForDisk(_directory.get(), ::fsync);
    if (!durable)
        return std::unexpected(OSTCreatePOSIXError(durable.error(), "fsync of %@ failed: %s", _path, durable.error()));
    return {};
}

} // namespace ost
