#include "platform/ipc/ActivatedSockets.h"

#include "Protocol/OSTServices.h"
#include "platform/base/Path.h"
#include "platform/base/Text.h"
#include "platform/base/Try.h"

#include <fcntl.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <charconv>
#include <cstdlib>
#include <cstring>
#include <optional>

namespace ost::platform {

namespace {

constexpr int firstHandedDescriptor = 3;
constexpr int handedLimit = 64;     // more than any launcher hands over, less than would hurt
constexpr int pendingLimit = 4096;  // as many clients as the service takes may ask at once
constexpr mode_t socketMode = 0666; // who may do what is decided per request

/// The number in an environment variable, which is removed.
std::optional<int> takeNumber(const char* variable) {
    const char* text = std::getenv(variable);
    int number = 0;
    const auto length = text ? std::strlen(text) : 0;
    const bool valid = text && std::from_chars(text, text + length, number).ptr == text + length && length > 0;
    ::unsetenv(variable);
    return valid ? std::optional(number) : std::nullopt;
}

std::string takeText(const char* variable) {
    const char* text = std::getenv(variable);
    std::string taken = text ? text : "";
    ::unsetenv(variable);
    return taken;
}

bool isListening(int descriptor, int wantedType) {
    const auto option = [&](int name) {
        int value = -1;
        socklen_t size = sizeof value;
        return ::getsockopt(descriptor, SOL_SOCKET, name, &value, &size) == 0 ? value : -1;
    };
    return option(SO_DOMAIN) == AF_UNIX && option(SO_TYPE) == wantedType && option(SO_ACCEPTCONN) == 1;
}

FileDescriptor makeSocket(int type) {
    return FileDescriptor(::socket(AF_UNIX, type | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
}

/// Makes the name free, if it is that of a socket on which nobody listens.
std::expected<void, Errno> removeStaleSocket(const sockaddr_un& address, int type) {
    struct stat status{};
    if (::lstat(address.sun_path, &status) != 0)
        return errno == ENOENT ? std::expected<void, Errno>() : std::unexpected(errno);
    if (!S_ISSOCK(status.st_mode))
        return std::unexpected(EEXIST);
    const auto probe = makeSocket(type);
    if (!probe)
        return std::unexpected(errno);
    if (::connect(probe.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address) == 0 ||
        errno != ECONNREFUSED)
        return std::unexpected(EADDRINUSE);
    if (::unlink(address.sun_path) != 0)
        return std::unexpected(errno);
    return {};
}

std::expected<FileDescriptor, Errno> bindListener(std::string_view name, int type) {
    const auto path = pathByAppending(OSTServiceSocketDirectory, name);
    sockaddr_un address{.sun_family = AF_UNIX, .sun_path = {}};
    if (path.size() >= sizeof address.sun_path)
        return std::unexpected(ENAMETOOLONG);
    path.copy(address.sun_path, path.size());
    OST_TRY(removeStaleSocket(address, type));
    auto listener = makeSocket(type);
    if (!listener || ::bind(listener.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address) != 0)
        return std::unexpected(errno);
    // Before the socket listens, so that nobody is refused for the mode it was made with, and no packet comes without
    // its sender's credentials.
    const int passCredentials = type == SOCK_SEQPACKET ? 1 : 0;
    if (::chmod(address.sun_path, socketMode) != 0 ||
        ::setsockopt(listener.get(), SOL_SOCKET, SO_PASSCRED, &passCredentials, sizeof passCredentials) != 0 ||
        ::listen(listener.get(), pendingLimit) != 0)
        return std::unexpected(errno);
    return listener;
}

} // namespace

ActivatedSockets ActivatedSockets::fromEnvironment() {
    ActivatedSockets sockets;
    const auto process = takeNumber("LISTEN_PID");
    const auto count = takeNumber("LISTEN_FDS");
    const auto nameList = takeText("LISTEN_FDNAMES");
    if (process != ::getpid() || !count || *count > handedLimit)
        return sockets;
    std::string_view names = nameList;
    for (int descriptor = firstHandedDescriptor; descriptor < firstHandedDescriptor + *count; ++descriptor) {
        const auto name = takeUntil(names, ':');
        const int flags = ::fcntl(descriptor, F_GETFD);
        if (flags >= 0 && ::fcntl(descriptor, F_SETFD, flags | FD_CLOEXEC) == 0)
            sockets._handed.push_back({std::string(name), FileDescriptor(descriptor)});
    }
    return sockets;
}

std::expected<FileDescriptor, Errno> ActivatedSockets::takeListener(std::string_view name, int type) {
    const auto found = std::ranges::find(_handed, name, &Handed::name);
    if (found == _handed.end())
        return bindListener(name, type);
    auto listener = std::move(found->socket);
    _handed.erase(found);
    if (!isListening(listener.get(), type))
        return std::unexpected(EPROTOTYPE);
    const int flags = ::fcntl(listener.get(), F_GETFL);
    if (flags < 0 || ::fcntl(listener.get(), F_SETFL, flags | O_NONBLOCK) != 0)
        return std::unexpected(errno);
    return listener;
}

} // namespace ost::platform
