#include "platform/ipc/PeerIdentity.h"

#include "platform/base/Try.h"
#include "platform/device/MountTable.h"
#include "platform/threads/BlockingSection.h"

#include <fcntl.h>
#include <sys/socket.h>
#include <sys/syscall.h>
#include <sys/sysmacros.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <ctime>
#include <utility>

#ifndef SO_PEERPIDFD
#define SO_PEERPIDFD 77 // newer than the C library's headers
#endif

namespace ost::platform {

namespace {

/// A descriptor for the very process that made the connection, -1 with errno when it has ended or the kernel does not
/// have the option (before 6.5). Then the process that has the id now is taken: it can be another one only if the peer
/// ended and its id was given away in the short time since it connected.
int openPeer(int socket, pid_t processId) {
    int peer = -1;
    socklen_t size = sizeof peer;
    if (::getsockopt(socket, SOL_SOCKET, SO_PEERPIDFD, &peer, &size) == 0)
        return peer;
    return errno == ENOPROTOOPT ? static_cast<int>(::syscall(SYS_pidfd_open, processId, 0)) : -1;
}

/// A file whose last change is older than this gets another time with its next one. Times are as fine as the clock's
/// tick on most file systems, and as coarse as a second on some.
constexpr time_t secondsUntilAChangeShows = 2;

bool haveSameChangeTime(const struct stat& one, const struct stat& other) {
    return one.st_ctim.tv_sec == other.st_ctim.tv_sec && one.st_ctim.tv_nsec == other.st_ctim.tv_nsec;
}

/// The directory of a live process in /proc. Once it is open it names one process for good: after that has ended,
/// everything below it fails with ESRCH. That it was opened for the right one is sure if the right one still exists
/// afterwards.
std::expected<FileDescriptor, Errno> openProcess(int socket, pid_t processId) {
    const FileDescriptor peer(openPeer(socket, processId));
    if (!peer)
        return std::unexpected(errno);
    const auto path = "/proc/" + std::to_string(processId);
    FileDescriptor process(::open(path.c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC | O_NOFOLLOW));
    if (!process)
        return std::unexpected(errno);
    if (::syscall(SYS_pidfd_send_signal, peer.get(), 0, nullptr, 0) != 0 && errno != EPERM)
        return std::unexpected(errno);
    return process;
}

/// What the kernel knows of a file without asking the server of its file system.
struct Look {
    struct stat status{};
    std::uint64_t mount = 0;
};

std::expected<Look, Errno> lookWithoutAsking(int directory, const char* name, int flags) {
    struct statx known{};
    if (::statx(directory, name, flags | AT_STATX_DONT_SYNC | AT_NO_AUTOMOUNT, STATX_BASIC_STATS | STATX_MNT_ID,
                &known) != 0)
        return std::unexpected(errno);
    Look look{.mount = known.stx_mnt_id};
    look.status.st_dev = ::makedev(known.stx_dev_major, known.stx_dev_minor);
    look.status.st_ino = known.stx_ino;
    look.status.st_mode = known.stx_mode;
    look.status.st_uid = known.stx_uid;
    look.status.st_ctim = {.tv_sec = known.stx_ctime.tv_sec, .tv_nsec = known.stx_ctime.tv_nsec};
    return look;
}

bool isServedByProcess(const Mount& mount) {
    return mount.fileSystem == "fuse" || mount.fileSystem.starts_with("fuse.");
}

/// One that is mounted by a user is served by a process of that user, which need never answer; so it is told by the
/// mount tables and not asked. What is in the table of the first process or in ours was mounted by an administrator, or
/// for a user by a program that sees to it that it forbids set-user-id. The peer may have a table of its own, in which
/// it mounts what it likes.
std::expected<bool, Errno> isOnFileSystemOfUser(int process, const Look& look) {
    // What has a disk of its own was mounted by an administrator.
    if (major(look.status.st_dev) != 0)
        return false;
    for (const char* trusted : {"/proc/self", "/proc/1"}) {
        const FileDescriptor directory(::open(trusted, O_PATH | O_DIRECTORY | O_CLOEXEC));
        if (!directory)
            return std::unexpected(errno);
        const auto mount = findMount(directory.get(), look.mount, look.status.st_dev);
        if (mount)
            return isServedByProcess(*mount) && mount->forbidsSetUserId;
        if (mount.error() != ENOENT)
            return std::unexpected(mount.error());
    }
    return isServedByProcess(OST_TRY(findMount(process, look.mount, look.status.st_dev)));
}

} // namespace

std::expected<PeerIdentity, Errno> PeerIdentity::ofSocket(int socket) {
    ucred credentials{};
    socklen_t size = sizeof credentials;
    if (::getsockopt(socket, SOL_SOCKET, SO_PEERCRED, &credentials, &size) != 0)
        return std::unexpected(errno);
    auto process = openProcess(socket, credentials.pid);
    if (!process && (process.error() == EMFILE || process.error() == ENFILE || process.error() == ENOMEM))
        return std::unexpected(process.error());
    return PeerIdentity(credentials.pid, credentials.uid, process ? *std::move(process) : FileDescriptor());
}

std::expected<const CodeSigningIdentity*, Errno> PeerIdentity::codeSigningIdentity() {
    timespec now{}; // of before the status is read; by the clock that dates changes
    ::clock_gettime(CLOCK_REALTIME_COARSE, &now);
    auto status = OST_TRY(_holdProgram());
    if (_changeWouldShow && haveSameChangeTime(status, _programStatus))
        return &_identity;
    _changeWouldShow = false;
    OST_TRY(_askForIdentity(status));
    _programStatus = status;
    _changeWouldShow = _fileSystem.showsChanges && status.st_ctim.tv_sec + secondsUntilAChangeShows < now.tv_sec;
    return &_identity;
}

/// A file system that is not known to be a local one may let us wait for its server, for as long as that likes.
std::expected<void, Errno> PeerIdentity::_askForIdentity(struct stat& status) {
    if (_fileSystem.showsChanges)
        return _readSignature(status);
    if (!_fileSystem.ofUser) {
        const BlockingSection blocking;
        if (::fstat(_program.get(), &status) != 0)
            return std::unexpected(errno);
        _fileSystem = signatureFileSystem(_program.get());
        if (!_fileSystem.ofUser)
            return _readSignature(status);
    }
    _identity = {};
    _raw.clear();
    return {};
}

std::expected<void, Errno> PeerIdentity::_readSignature(const struct stat& status) {
    std::array<char, maximumCodeSignature> buffer;
    const auto signature = OST_TRY(readCodeSignature(_program.get(), status, buffer));
    if (signature.bytes != _raw || signature.device != _device) {
        _identity = parseCodeSignature(signature.bytes);
        _raw = signature.bytes;
        _device = signature.device;
    }
    return {};
}

/// Holds the program that the process runs now, and gives what the kernel knows of its status. Holding another one
/// costs more than the rest of this file; a file that is held keeps its number, so looking at that tells whether it is
/// still the one. It is not opened for reading, because opening and closing may ask its server.
std::expected<struct stat, Errno> PeerIdentity::_holdProgram() {
    if (!_process)
        return std::unexpected(ESRCH);
    auto look = OST_TRY(lookWithoutAsking(_process.get(), "exe", 0));
    if (_program && look.status.st_dev == _programStatus.st_dev && look.status.st_ino == _programStatus.st_ino)
        return look.status;
    _changeWouldShow = false;
    _program.reset(::openat(_process.get(), "exe", O_PATH | O_CLOEXEC));
    if (!_program)
        return std::unexpected(errno);
    // The process may run a third one by now; what is held counts.
    auto held = lookWithoutAsking(_program.get(), "", AT_EMPTY_PATH);
    const auto ofUser = held ? isOnFileSystemOfUser(_process.get(), *held) : std::unexpected(held.error());
    if (!ofUser) {
        _program.reset();
        return std::unexpected(ofUser.error());
    }
    _fileSystem = {.ofUser = *ofUser, .showsChanges = false};
    _programStatus = held->status;
    return held->status;
}

} // namespace ost::platform
