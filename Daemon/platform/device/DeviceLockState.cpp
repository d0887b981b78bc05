#include "platform/device/DeviceLockState.h"

#include "platform/base/Immortal.h"
#include "platform/base/PassingReason.h"
#include "platform/base/Path.h"
#include "platform/base/SmallFile.h"
#include "platform/base/Try.h"

#include <fcntl.h>
#include <sys/epoll.h>
#include <sys/inotify.h>
#include <sys/stat.h>
#include <sys/timerfd.h>
#include <unistd.h>

#include <cerrno>
#include <charconv>
#include <chrono>
#include <cstdio>
#include <cstring>
#include <ctime>
#include <optional>
#include <string>
#include <string_view>

namespace ost::platform {

namespace {

constexpr std::size_t stateTextLimit = 16; // a number of 32 bits and a newline

/// By which one content of a file or of a directory is told from another.
struct FileStatus {
    dev_t device = 0;
    ino_t inode = 0;
    std::chrono::nanoseconds changed{0};
    friend bool operator==(const FileStatus&, const FileStatus&) = default;
};

/// What the state's file said when it had that status.
struct KnownState {
    FileStatus of;
    int state = deviceLockStateUnknown;
};

std::chrono::nanoseconds durationOf(const timespec& time) {
    return std::chrono::seconds(time.tv_sec) + std::chrono::nanoseconds(time.tv_nsec);
}

std::expected<FileStatus, Errno> statusOf(const char* path, int flags) {
    struct stat status{};
    if (::fstatat(AT_FDCWD, path, &status, flags) != 0)
        return std::unexpected(errno);
    return FileStatus{.device = status.st_dev, .inode = status.st_ino, .changed = durationOf(status.st_ctim)};
}

std::expected<FileStatus, Errno> statusOfStateFile() { return statusOf(deviceLockStateFile, AT_SYMLINK_NOFOLLOW); }

std::expected<FileStatus, Errno> statusOfDirectory() {
    static Immortal directory([] { return std::string(pathByDeletingLastComponent(deviceLockStateFile)); });
    return statusOf((*directory).c_str(), 0);
}

/// Whether nothing that changes now can bear that time any more.
bool isLongAgo(std::chrono::nanoseconds time) {
    constexpr std::chrono::seconds coarsestTime{2}; // in which file systems count
    constexpr std::chrono::milliseconds clockTick{10};
    timespec now{};
    ::clock_gettime(CLOCK_REALTIME, &now);
    return durationOf(now) - time > coarsestTime + 2 * clockTick;
}

/// The status of the directory from before it was seen to be without the file, when any file made later must change it.
std::optional<FileStatus> directoryWithoutStateFile() {
    const auto directory = statusOfDirectory();
    if (!directory || !isLongAgo(directory->changed))
        return std::nullopt;
    const auto file = statusOfStateFile();
    return !file && file.error() == ENOENT ? std::optional(*directory) : std::nullopt;
}

/// Fetches every event that is due. True when one of them concerns the state's file.
bool drainEvents(int watch) {
    alignas(inotify_event) char buffer[4096];
    const auto watchedName = lastPathComponent(deviceLockStateFile);
    bool changed = false;
    for (ssize_t count = 0; (count = ::read(watch, buffer, sizeof buffer)) > 0;) {
        for (const char* next = buffer; next < buffer + count;) {
            inotify_event event{};
            std::memcpy(&event, next, sizeof event);
            const char* name = next + sizeof event;
            // Events that were lost may have been ours.
            changed |= (event.mask & IN_Q_OVERFLOW) != 0 || (event.len > 0 && name == watchedName);
            next = name + event.len;
        }
    }
    return changed;
}

} // namespace

std::expected<int, Errno> deviceLockState() {
    thread_local KnownState known;
    // Many a file system looks for a file that is not there anew each time, which costs far more than this status.
    thread_local std::optional<FileStatus> withoutFile;
    if (withoutFile && withoutFile == statusOfDirectory())
        return deviceUnlocked;
    withoutFile.reset();
    const auto status = statusOfStateFile();
    if (!status && status.error() == ENOENT) {
        withoutFile = directoryWithoutStateFile();
        return deviceUnlocked;
    }
    if (status && known.of == *status)
        return known.state;
    const int state = OST_TRY(deviceLockState(std::string()));
    // A later change in the same moment of the file system's clock would bear the same time.
    if (status && isLongAgo(status->changed))
        known = {.of = *status, .state = state};
    return state;
}

std::expected<int, Errno> deviceLockState(const std::string& image) {
    const auto content = readSmallFile((image + deviceLockStateFile).c_str(), stateTextLimit, FinalLink::refuse);
    if (!content && !speaksOfTheItem(content.error()))
        return std::unexpected(content.error());
    if (!content)
        return content.error() == ENOENT ? deviceUnlocked : deviceLockStateUnknown;
    int state = 0;
    const auto* contentEnd = content->data() + content->size();
    const auto [end, error] = std::from_chars(content->data(), contentEnd, state);
    const std::string_view rest(end, contentEnd);
    return error == std::errc{} && state >= 0 && (rest.empty() || rest == "\n") ? state : deviceLockStateUnknown;
}

std::expected<void, Errno> writeDeviceLockState(int state, const std::string& image) {
    const auto file = image + deviceLockStateFile;
    const auto newFile = file + "." + std::to_string(::getpid());
    const auto text = std::to_string(state) + "\n";
    ::unlink(newFile.c_str()); // left by a process of the same number
    const FileDescriptor descriptor(
        ::open(newFile.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, 0644));
    if (!descriptor)
        return std::unexpected(errno);
    const auto written = ::write(descriptor.get(), text.data(), text.size());
    if (written == static_cast<ssize_t>(text.size()) && ::rename(newFile.c_str(), file.c_str()) == 0)
        return {};
    const int error = written >= 0 && static_cast<std::size_t>(written) < text.size() ? ENOSPC : errno;
    ::unlink(newFile.c_str());
    return std::unexpected(error);
}

std::expected<std::unique_ptr<DeviceLockStateNotification>, Errno>
DeviceLockStateNotification::registerHandler(RunLoop& loop, Handler handler) {
    FileDescriptor watch(::inotify_init1(IN_NONBLOCK | IN_CLOEXEC));
    FileDescriptor timer(::timerfd_create(CLOCK_MONOTONIC, TFD_NONBLOCK | TFD_CLOEXEC));
    // The directory is watched, because the file itself may be replaced or missing.
    const std::string directory(pathByDeletingLastComponent(deviceLockStateFile));
    constexpr auto events = IN_CREATE | IN_CLOSE_WRITE | IN_MOVED_FROM | IN_MOVED_TO | IN_DELETE | IN_ONLYDIR;
    if (!watch || !timer || ::inotify_add_watch(watch.get(), directory.c_str(), events) < 0)
        return std::unexpected(errno);
    std::unique_ptr<DeviceLockStateNotification> notification(
        new DeviceLockStateNotification(std::move(watch), std::move(timer), std::move(handler)));
    auto* self = notification.get();
    self->_watchSource = OST_TRY(loop.addSource(self->_watch.get(), EPOLLIN, [self](std::uint32_t) {
        if (drainEvents(self->_watch.get()))
            self->_notify();
    }));
    self->_timerSource =
        OST_TRY(loop.addSource(self->_timer.get(), EPOLLIN, [self](std::uint32_t) { self->_notify(); }));
    return notification;
}

void DeviceLockStateNotification::_notify() {
    constexpr itimerspec never{}, soon{.it_interval = {}, .it_value = {.tv_sec = 1, .tv_nsec = 0}};
    const bool isDone = _handler();
    ::timerfd_settime(_timer.get(), 0, isDone ? &never : &soon, nullptr);
}

} // namespace ost::platform
