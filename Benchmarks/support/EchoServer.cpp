#include "support/EchoServer.h"

#include "support/Require.h"
#include "support/Socket.h"

#include <sys/epoll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <string_view>
#include <thread>
#include <vector>

namespace ost::benchmarks {

using platform::FileDescriptor;

namespace {

void watch(int epoll, int fd) {
    epoll_event event{.events = EPOLLIN | EPOLLET, .data = {.fd = fd}};
    require(::epoll_ctl(epoll, EPOLL_CTL_ADD, fd, &event) == 0, "epoll_ctl");
}

/// A stream socket that fills less than the space has nothing left; whatever comes then is another event.
void answer(int connection, std::size_t requestSize, std::string_view reply) {
    std::array<char, 4096> bytes;
    const auto count = ::recv(connection, bytes.data(), bytes.size(), MSG_DONTWAIT);
    if (count > 0 && static_cast<std::size_t>(count) == requestSize)
        ::send(connection, reply.data(), reply.size(), MSG_DONTWAIT | MSG_NOSIGNAL);
    else if (count == 0)
        ::close(connection);
}

int serve(int listener, std::size_t requestSize, std::string_view reply) {
    const FileDescriptor epoll(::epoll_create1(EPOLL_CLOEXEC));
    watch(epoll.get(), listener);
    const auto loop = [&] {
        for (;;) {
            epoll_event event{};
            if (::epoll_wait(epoll.get(), &event, 1, -1) != 1)
                continue;
            if (event.data.fd != listener)
                answer(event.data.fd, requestSize, reply);
            else
                for (int connection = 0; (connection = ::accept4(listener, nullptr, nullptr, SOCK_CLOEXEC)) >= 0;)
                    watch(epoll.get(), connection);
        }
    };
    std::vector<std::jthread> threads;
    for (unsigned count = std::max(1U, std::thread::hardware_concurrency()); count > 0; --count)
        threads.emplace_back(loop);
    return 0;
}

} // namespace

EchoServer::EchoServer(const std::string& socketPath, std::size_t requestSize, std::string reply)
    : _listener(listenOn(socketPath)), _process([&] { return serve(_listener.get(), requestSize, reply); }) {}

} // namespace ost::benchmarks
