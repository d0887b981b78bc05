// A client that only makes connections: each byte on standard input, which is a socket, is answered with a new
// connection to the daemon, passed as a descriptor. Its user speaks with the identity of this process: its user,
// its program's signature. Usage: wire-client SOCKET

#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <cstdlib>
#include <cstring>

namespace {

int connectTo(const char* path) {
    sockaddr_un address{.sun_family = AF_UNIX, .sun_path = {}};
    std::strncpy(address.sun_path, path, sizeof address.sun_path - 1);
    const int connection = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    if (::connect(connection, reinterpret_cast<const sockaddr*>(&address), sizeof address) != 0)
        std::exit(EXIT_FAILURE);
    return connection;
}

bool pass(int descriptor) {
    char byte = 0;
    iovec data{.iov_base = &byte, .iov_len = 1};
    alignas(cmsghdr) char control[CMSG_SPACE(sizeof descriptor)] = {};
    msghdr message{};
    message.msg_iov = &data;
    message.msg_iovlen = 1;
    message.msg_control = control;
    message.msg_controllen = sizeof control;
    cmsghdr& rights = *CMSG_FIRSTHDR(&message);
    rights.cmsg_level = SOL_SOCKET;
    rights.cmsg_type = SCM_RIGHTS;
    rights.cmsg_len = CMSG_LEN(sizeof descriptor);
    std::memcpy(CMSG_DATA(&rights), &descriptor, sizeof descriptor);
    return ::sendmsg(STDIN_FILENO, &message, MSG_NOSIGNAL) == 1;
}

} // namespace

int main(int count, char** arguments) {
    if (count != 2)
        return EXIT_FAILURE;
    for (char byte = 0; ::read(STDIN_FILENO, &byte, 1) == 1;) {
        const int connection = connectTo(arguments[1]);
        if (!pass(connection))
            return EXIT_FAILURE;
        ::close(connection);
    }
    return EXIT_SUCCESS;
}
