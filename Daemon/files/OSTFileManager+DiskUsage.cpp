#include "files/OSTFileManager.h"

#include "files/OSTPathResolution.h"
#include "files/OSTTreeCursor.h"
#include "platform/base/Log.h"
#include "platform/base/Mutex.h"
#include "platform/base/Path.h"
#include "platform/base/Try.h"
#include "platform/threads/Aside.h"

#include <dirent.h>
#include <sys/stat.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <deque>
#include <iterator>
#include <optional>
#include <unordered_set>

namespace ost {

using platform::FileDescriptor;
using platform::pathByAppending;

namespace {

constexpr std::uint64_t allocationUnit = 512; // of st_blocks, on every file system

/// The longest relative path that the kernel takes at once.
constexpr std::size_t longestPath = PATH_MAX - 1;

/// Opens a directory below `top`, however long its relative path is. The top itself has an empty one.
std::expected<FileDescriptor, platform::Errno> openBelow(int top, std::string_view relative) {
    FileDescriptor opened;
    int from = top;
    while (relative.size() > longestPath) {
        const auto slash = relative.rfind('/', longestPath);
        opened = OST_TRY(OSTOpenSubdirectory(from, relative.substr(0, slash)));
        from = opened.get();
        relative.remove_prefix(slash + 1);
    }
    return OSTOpenSubdirectory(from, relative.empty() ? "." : relative);
}

/// Measures one tree, with a second thread where that helps. Directories wait in the order in which they were found.
class DiskUsage {
public:
    DiskUsage(FileDescriptor top, dev_t device, std::string_view path)
        : _top(std::move(top)), _device(device), _path(path) {}

    [[nodiscard]] std::uint64_t measure() {
        auto aside = platform::startAside([this] { _work(); });
        _work();
        if (aside.valid())
            aside.get();
        const platform::MutexLock lock(_mutex);
        return _total;
    }

private:
    /// A directory that is being measured, and may still bring others to light.
    class Turn {
    public:
        explicit Turn(DiskUsage& usage) : _usage(usage) {}
        Turn(const Turn&) = delete;
        Turn& operator=(const Turn&) = delete;
        ~Turn() {
            const platform::MutexLock lock(_usage._mutex);
            if (--_usage._turns == 0)
                _usage._changed.notifyAll();
        }

    private:
        DiskUsage& _usage;
    };

    void _work() {
        while (const auto directory = _take()) {
            const Turn turn(*this);
            _add(_measureDirectory(*directory));
        }
    }

    /// The next directory, or none when all are measured. What is taken is given back with a `Turn`.
    [[nodiscard]] std::optional<std::string> _take() {
        platform::MutexLock lock(_mutex);
        _changed.wait(lock, [this]() OST_REQUIRES(_mutex) { return !_waiting.empty() || _turns == 0; });
        if (_waiting.empty())
            return std::nullopt;
        std::optional directory = std::move(_waiting.front());
        _waiting.pop_front();
        ++_turns;
        return directory;
    }

    struct Measured {
        std::uint64_t bytes = 0;
        std::vector<std::string> directories;
    };
    void _add(Measured measured) {
        const platform::MutexLock lock(_mutex);
        _total += measured.bytes;
        std::ranges::move(measured.directories, std::back_inserter(_waiting));
        if (!measured.directories.empty())
            _changed.notifyOne();
    }

    [[nodiscard]] Measured _measureDirectory(const std::string& relative) {
        Measured measured;
        const auto path = relative.empty() ? _path : pathByAppending(_path, relative);
        auto opened = openBelow(_top.get(), relative);
        if (!opened) {
            if (opened.error() != EXDEV) // Other file systems are not part of the tree.
                platform::logAs(platform::LogLevel::error, logName, "Failed to open directory %@ : %s", path,
                                opened.error());
            return measured;
        }
        OSTTreeCursor cursor(*std::move(opened), path);
        for (std::uint64_t number = 0;; ++number) {
            const auto found = cursor.next();
            if (!found)
                platform::logAs(platform::LogLevel::error, logName, "gatherattrs on entry %llu in %@ returned error %s",
                                number, path, found.error());
            if (!found || !*found)
                return measured;
            if (const auto bytes = _measureEntry(cursor))
                measured.bytes += *bytes;
            else if (bytes.error() == EISDIR)
                measured.directories.push_back(relative.empty() ? cursor.name()
                                                                : pathByAppending(relative, cursor.name()));
            else
                platform::logAs(platform::LogLevel::error, logName, "Got error %s while processing entry %llu in %@",
                                bytes.error(), number, path);
        }
    }

    /// The bytes that the current item adds to the total. Fails with EISDIR when it is a directory to be measured.
    [[nodiscard]] std::expected<std::uint64_t, platform::Errno> _measureEntry(const OSTTreeCursor& cursor) {
        if (cursor.type() == DT_DIR)
            return std::unexpected(EISDIR);
        struct stat status{};
        if (::fstatat(cursor.directory(), cursor.name(), &status, AT_SYMLINK_NOFOLLOW | AT_NO_AUTOMOUNT) != 0)
            return std::unexpected(errno);
        if (S_ISDIR(status.st_mode))
            return std::unexpected(EISDIR);
        if (status.st_dev != _device)
            return 0;
        if (status.st_nlink > 1 && !_isFirstName(status.st_ino)) {
            platform::logAs(platform::LogLevel::debug, logName, "Skipping hardlinked file at %@", cursor.path());
            return 0;
        }
        return static_cast<std::uint64_t>(status.st_blocks) * allocationUnit;
    }

    [[nodiscard]] bool _isFirstName(ino_t file) {
        const platform::MutexLock lock(_mutex);
        return _linked.insert(file).second;
    }

    static constexpr const char* logName = "diskUsageForURL";

    // Constant after construction.
    const FileDescriptor _top;
    const dev_t _device;
    const std::string _path;

    platform::Mutex _mutex;
    platform::Condition _changed;
    std::deque<std::string> _waiting OST_GUARDED_BY(_mutex){std::string()}; // relative to the top
    std::size_t _turns OST_GUARDED_BY(_mutex) = 0;
    std::unordered_set<ino_t> _linked OST_GUARDED_BY(_mutex); // files with several names that are counted
    std::uint64_t _total OST_GUARDED_BY(_mutex) = 0;
};

} // namespace

std::uint64_t OSTFileManager::diskUsageForURL(std::string_view path) const {
    if (path.empty()) {
        platform::logError("Failed to get path to url %@", path);
        return 0;
    }
    auto top = OSTOpenItem(AT_FDCWD, path, O_RDONLY | O_DIRECTORY);
    struct stat status{};
    if (top && ::fstat(top->get(), &status) != 0)
        top = std::unexpected(errno);
    if (!top) {
        platform::logError("Failed to open directory %@ : %s", path, top.error());
        return 0;
    }
    return DiskUsage(*std::move(top), status.st_dev, path).measure();
}

} // namespace ost
