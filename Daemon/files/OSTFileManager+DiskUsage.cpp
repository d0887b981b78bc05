#include "files/OSTFileManager.h"

#include "files/OSTPathResolution.h"
#include "files/OSTSharedWalk.h"
#include "platform/base/Log.h"
#include "platform/base/Mutex.h"

#include <dirent.h>
#include <sys/stat.h>

#include <atomic>
#include <cerrno>
#include <expected>
#include <unordered_set>

namespace ost {

namespace {

constexpr std::uint64_t allocationUnit = 512; // of st_blocks, on every file system

/// Measures one tree.
class DiskUsage final : public OSTTreeVisitor {
public:
    explicit DiskUsage(dev_t device) : _device(device) {}

    [[nodiscard]] std::uint64_t total() const { return _total; }

    [[nodiscard]] Next visitItem(const OSTTreeCursor& cursor) override {
        const auto bytes = _measure(cursor);
        if (bytes)
            _total.fetch_add(*bytes, std::memory_order_relaxed);
        else if (bytes.error() == EISDIR)
            return Next::enter;
        else
            platform::logAs(platform::LogLevel::error, logName, "Got error %s while processing entry %llu in %@",
                            bytes.error(), cursor.number() - 1, cursor.directoryPath());
        return Next::goOn;
    }
    [[nodiscard]] Next cannotOpen(const std::string& path, platform::Errno error) override {
        platform::logAs(platform::LogLevel::error, logName, "Failed to open directory %@ : %s", path, error);
        return Next::goOn;
    }
    [[nodiscard]] Next cannotRead(const std::string& path, std::uint64_t number, platform::Errno error) override {
        platform::logAs(platform::LogLevel::error, logName, "gatherattrs on entry %llu in %@ returned error %s", number,
                        path, error);
        return Next::goOn;
    }

private:
    /// The bytes that the current item adds to the total. Fails with EISDIR when it is a directory to be measured.
    [[nodiscard]] std::expected<std::uint64_t, platform::Errno> _measure(const OSTTreeCursor& cursor) {
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

    const dev_t _device;
    std::atomic<std::uint64_t> _total = 0;
    platform::Mutex _mutex;
    std::unordered_set<ino_t> _linked OST_GUARDED_BY(_mutex); // files with several names that are counted
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
    DiskUsage usage(status.st_dev);
    OSTWalkShared(*std::move(top), path, usage);
    return usage.total();
}

} // namespace ost
