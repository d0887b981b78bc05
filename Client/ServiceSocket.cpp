#include "Client/ServiceSocket.h"

#include "Protocol/OSTServices.h"
#include "platform/base/Path.h"
#include "platform/base/Try.h"

#include <algorithm>
#include <cerrno>
#include <fcntl.h>
#include <limits>
#include <poll.h>
#include <sys/socket.h>
#include <sys/time.h>
#include <sys/un.h>

namespace ostrand {

using ost::platform::FileDescriptor;

namespace {

std::unexpected<Error> transportError(int errnoValue) { return std::unexpected(Error::transport(errnoValue)); }

/// An address that is too long for a socket is reached through a descriptor of its directory, which `directory` keeps
/// open.
Result<sockaddr_un> serviceAddress(const std::string& device, std::string_view service, FileDescriptor& directory) {
    const auto directoryPath =
        ost::platform::pathByAppending(device, std::string_view(ost::OSTServiceSocketDirectory).substr(1));
    auto path = ost::platform::pathByAppending(directoryPath, service);
    sockaddr_un address{};
    if (path.size() >= sizeof address.sun_path) {
        directory.reset(::open(directoryPath.c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
        if (!directory)
            return transportError(errno);
        path = ost::platform::pathByAppending("/proc/self/fd/" + std::to_string(directory.get()), service);
    }
    address.sun_family = AF_UNIX;
    path.copy(address.sun_path, sizeof address.sun_path - 1);
    return address;
}

} // namespace

Result<FileDescriptor> connectToService(const std::string& device, std::string_view service, int type,
                                        std::optional<std::chrono::milliseconds> timeout) {
    FileDescriptor directory;
    const auto address = OST_TRY(serviceAddress(device, service, directory));
    FileDescriptor socket(::socket(AF_UNIX, type | SOCK_CLOEXEC, 0));
    if (!socket)
        return transportError(errno);
    if (timeout) {
        using namespace std::chrono;
        // Nothing but the wait of connect asks this option.
        const auto wait = duration_cast<microseconds>(std::max(*timeout, milliseconds(1)));
        const timeval limit{.tv_sec = wait / seconds(1), .tv_usec = (wait % seconds(1)).count()};
        if (setsockopt(socket.get(), SOL_SOCKET, SO_SNDTIMEO, &limit, sizeof limit) != 0)
            return transportError(errno);
    }
    while (connect(socket.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address) != 0)
        if (errno != EINTR)
            return transportError(errno == EAGAIN ? ETIMEDOUT : errno);
    return socket;
}

Result<short> awaitEvents(const FileDescriptor& socket, short events, const Deadline& deadline) {
    using namespace std::chrono;
    while (true) {
        int limit = -1;
        if (deadline) {
            const auto left = std::max(ceil<milliseconds>(*deadline - steady_clock::now()), milliseconds(0));
            limit = static_cast<int>(std::min<milliseconds::rep>(left.count(), std::numeric_limits<int>::max()));
        }
        pollfd entry{.fd = socket.get(), .events = events, .revents = 0};
        const int ready = ::poll(&entry, 1, limit);
        if (ready > 0)
            return entry.revents;
        if (ready == 0)
            return transportError(ETIMEDOUT);
        if (errno != EINTR)
            return transportError(errno);
    }
}

} // namespace ostrand
