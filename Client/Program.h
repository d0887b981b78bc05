#pragma once

#include "Client/Upcall.h"
#include "platform/base/FileDescriptor.h"
#include "platform/device/CodeSignature.h"

#include <expected>
#include <string>

namespace ostrand {

/// A program of the host that is to be run: held open, so that what is executed is what was looked at. Immutable.
class Program {
public:
    /// Finds a program as a shell does: a name without a slash in the directories of PATH. Fails with ENOENT when there
    /// is none, EACCES when it is nothing that can be executed, or the errno of looking.
    [[nodiscard]] static std::expected<Program, ost::platform::Errno> find(const std::string& name);

    [[nodiscard]] int file() const { return _file.get(); }
    [[nodiscard]] const std::string& path() const { return _path; } ///< absolute
    /// Whether it is a text for an interpreter, which opens it by its path.
    [[nodiscard]] bool isScript() const { return _isScript; }
    /// What its signature says, as far as that counts.
    [[nodiscard]] const ost::platform::CodeSigningIdentity& identity() const { return _identity; }

private:
    Program(ost::platform::FileDescriptor file, std::string path) : _file(std::move(file)), _path(std::move(path)) {}
    static std::expected<Program, ost::platform::Errno> _open(const std::string& path);
    [[nodiscard]] std::expected<void, ost::platform::Errno> _examine();

    ost::platform::FileDescriptor _file;
    std::string _path;
    bool _isScript = false;
    ost::platform::CodeSigningIdentity _identity;
};

/// What the sandbox is told of a process with this signature: its identifier, and the groups and the system container
/// that its entitlements name. A list of groups that holds anything but strings names none, as for the daemon.
[[nodiscard]] ProcessDescription descriptionOf(const ost::platform::CodeSigningIdentity& identity);

} // namespace ostrand
