#pragma once

#include "platform/base/Errno.h"
#include "platform/base/FileDescriptor.h"
#include "platform/device/CodeSignature.h"

#include <sys/stat.h>
#include <sys/types.h>

#include <cstdint>
#include <expected>
#include <memory>
#include <string>

namespace ost::platform {

/// Who is behind a connection: process id and effective user id of the process that made it, and what that process's
/// program is signed as.
///
/// The process is pinned when the connection is accepted: an open directory of /proc names that very process for as
/// long as it is open, so an id that is given to another process is never mistaken for the peer.
///
/// Threads: one at a time. Ownership: a value that owns its descriptors.
class PeerIdentity {
public:
    /// Pins the peer of a connected Unix socket. A peer that has gone already is pinned to nobody. Fails with an errno
    /// when the socket has no peer, or when no descriptor is left (EMFILE, ENFILE).
    [[nodiscard]] static std::expected<PeerIdentity, Errno> ofSocket(int socket);

    [[nodiscard]] pid_t processId() const { return _processId; }
    [[nodiscard]] uid_t effectiveUserId() const { return _effectiveUserId; }

    /// What the program that the peer runs now is signed as. Asks at every call which program that is and whether it
    /// has changed, because a process may execute another one, and one may be signed anew. As long as the signature
    /// stays the same, so do the objects in the identity. Valid until the next call. A program on a file system that a
    /// user serves is unsigned, and that server is never asked; a server of an administrator's may keep this thread in
    /// a `BlockingSection`. Fails with an errno when the program cannot be determined: ESRCH when the process has
    /// ended.
    [[nodiscard]] std::expected<const CodeSigningIdentity*, Errno> codeSigningIdentity();

    /// Whether the program that was last asked for has entitlements.
    [[nodiscard]] bool hasEntitlements() const { return _identity.entitlements != nullptr; }

    /// Gives the descriptors back; no program can be determined any more.
    void unpin() {
        _process.reset();
        _program.reset();
    }

private:
    PeerIdentity(pid_t processId, uid_t effectiveUserId, FileDescriptor process)
        : _processId(processId), _effectiveUserId(effectiveUserId), _process(std::move(process)) {}

    [[nodiscard]] std::expected<struct stat, Errno> _holdProgram();
    [[nodiscard]] std::expected<void, Errno> _askForIdentity(struct stat& status);
    [[nodiscard]] std::expected<void, Errno> _readSignature(const struct stat& status);

    pid_t _processId;
    uid_t _effectiveUserId;
    FileDescriptor _process; ///< the process's directory in /proc; empty when it had ended
    FileDescriptor _program; ///< the program that was last asked for, held with O_PATH
    SignatureFileSystem _fileSystem;
    struct stat _programStatus{};
    bool _changeWouldShow = false; ///< whether a signature other than the one last read comes with another status
    // The signature last read, where from, and what it says.
    std::string _raw;
    dev_t _device = 0;
    CodeSigningIdentity _identity;
};

} // namespace ost::platform
