#pragma once

#include "platform/base/Errno.h"
#include "platform/base/FileDescriptor.h"

#include <expected>
#include <string>
#include <string_view>
#include <vector>

namespace ost::platform {

/// The listening sockets of the services that the process offers: those that the service launcher hands over, else
/// sockets that the process binds itself. One object, of the thread that starts the process up.
class ActivatedSockets {
public:
    /// Takes what the launcher handed over (LISTEN_PID, LISTEN_FDS, LISTEN_FDNAMES) and removes these variables.
    /// Requires that nobody else has taken it, and no other thread runs yet. Sockets that nobody asks for are closed
    /// with the object.
    [[nodiscard]] static ActivatedSockets fromEnvironment();

    /// The listening Unix socket of the service `name`, close-on-exec and non-blocking. `type` is SOCK_STREAM or
    /// SOCK_SEQPACKET. One that was not handed over is bound in the service socket directory with mode 0666, in place
    /// of a socket on which nobody listens any more. Fails with EPROTOTYPE when what was handed over is no such socket,
    /// EADDRINUSE when somebody listens on the name, EEXIST when the name is that of something else, else with the
    /// errno of binding.
    [[nodiscard]] std::expected<FileDescriptor, Errno> takeListener(std::string_view name, int type);

private:
    struct Handed {
        std::string name;
        FileDescriptor socket;
    };

    std::vector<Handed> _handed;
};

} // namespace ost::platform
