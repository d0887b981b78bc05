#include "platform/ipc/PeerIdentity.h"

#include "platform/base/Try.h"

#include <fcntl.h>
#include <sys/socket.h>
#include <sys/syscall.h>
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
    const auto status = OST_TRY(_holdProgram());
    if (_changeWouldShow && haveSameChangeTime(status, _programStatus))
        return &_identity;
    _changeWouldShow = false;
    OST_TRY(_readSignature(status));
    _programStatus = status;
    _changeWouldShow = _fileSystem.showsChanges && status.st_ctim.tv_sec + secondsUntilAChangeShows < now.tv_sec;
    return &_identity;
}

std::expected<void, Errno> PeerIdentity::_readSignature(const struct stat& status) {
    std::array<char, maximumCodeSignature> buffer;
    const auto signature = OST_TRY(readCodeSignature(_program.get(), status, buffer));
    if (signature.bytes != _raw || signature.device != _device) {
        _identity = _fileSystem.ofUser ? CodeSigningIdentity{} : parseCodeSignature(signature.bytes);
        _raw = signature.bytes;
        _device = signature.device;
    }
    return {};
}

/// Holds the program that the process runs now, and gives its status. Opening it at every request would cost more than
/// the rest of this file; a file that is held open keeps its number, so looking at that tells whether it is still the
/// one.
std::expected<struct stat, Errno> PeerIdentity::_holdProgram() {
    if (!_process)
        return std::unexpected(ESRCH);
    struct stat status{};
    if (::fstatat(_process.get(), "exe", &status, 0) != 0)
        return std::unexpected(errno);
    if (_program && status.st_dev == _programStatus.st_dev && status.st_ino == _programStatus.st_ino)
        return status;
    _changeWouldShow = false;
    _program.reset(::openat(_process.get(), "exe", O_RDONLY | O_CLOEXEC | O_NONBLOCK | O_NOCTTY));
    if (!_program || ::fstat(_program.get(), &_programStatus) != 0)
        return std::unexpected(errno);
    _fileSystem = signatureFileSystem(_program.get());
    return _programStatus;
}

} // namespace ost::platform
