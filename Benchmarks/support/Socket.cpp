#include "support/Socket.h"

#include "support/Require.h"

#include <sys/socket.h>
#include <sys/un.h>

#include <stdexcept>

namespace ost::benchmarks {

using platform::FileDescriptor;

namespace {

sockaddr_un addressOf(const std::string& path) {
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    if (path.size() >= sizeof address.sun_path)
        throw std::runtime_error("too long for a socket: " + path);
    path.copy(address.sun_path, path.size());
    return address;
}

} // namespace

FileDescriptor connectTo(const std::string& path, int type) {
    const auto address = addressOf(path);
    FileDescriptor socket(::socket(AF_UNIX, type | SOCK_CLOEXEC, 0));
    require(socket && ::connect(socket.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address) == 0, path);
    return socket;
}

FileDescriptor listenOn(const std::string& path, int type) {
    const auto address = addressOf(path);
    FileDescriptor socket(::socket(AF_UNIX, type | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
    require(socket && ::bind(socket.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address) == 0 &&
                ::listen(socket.get(), SOMAXCONN) == 0,
            path);
    return socket;
}

} // namespace ost::benchmarks
