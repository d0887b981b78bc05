#include "support/RoundTrips.h"

#include "platform/ipc/IPCFrame.h"
#include "support/Require.h"
#include "support/Socket.h"
#include "support/Stopwatch.h"

#include <sys/epoll.h>
#include <sys/socket.h>

#include <algorithm>
#include <array>
#include <future>
#include <stdexcept>
#include <thread>

namespace ost::benchmarks {

using platform::FileDescriptor;
using platform::IPCFrameHeader;

namespace {

constexpr std::size_t largestReply = 4096;

void send(int socket, std::string_view request) {
    require(::send(socket, request.data(), request.size(), MSG_NOSIGNAL) == static_cast<ssize_t>(request.size()),
            "send a request");
}

/// Receives a reply, which comes whole because it was sent whole.
std::size_t receive(int socket, char* bytes) {
    const auto count = ::recv(socket, bytes, largestReply, 0);
    require(count >= 0, "receive a reply");
    const auto size = static_cast<std::size_t>(count);
    if (size < IPCFrameHeader::size || IPCFrameHeader::read(bytes).payloadLength + IPCFrameHeader::size != size)
        throw std::runtime_error("a reply that is none: the connection was refused, or the reply came in pieces");
    return size;
}

void expect(std::size_t size, std::size_t expected) {
    if (size != expected)
        throw std::runtime_error("a reply of another size");
}

} // namespace

std::string requestWith(std::uint64_t entries, const std::function<void(platform::CBOREncoder&)>& writeEntries) {
    std::string frame(IPCFrameHeader::size, '\0');
    platform::CBOREncoder encoder(frame);
    encoder.beginMap(entries);
    writeEntries(encoder);
    IPCFrameHeader{.payloadLength = static_cast<std::uint32_t>(frame.size() - IPCFrameHeader::size), .requestNumber = 1}
        .write(frame.data());
    return frame;
}

RoundTrips::RoundTrips(const std::string& socketPath, std::string request)
    : _socket(connectTo(socketPath)), _request(std::move(request)), _received(largestReply, '\0') {}

std::string_view RoundTrips::once() {
    send(_socket.get(), _request);
    return std::string_view(_received).substr(0, receive(_socket.get(), _received.data()));
}

double RoundTrips::secondsEach(unsigned count) {
    const auto size = once().size();
    const auto start = Clock::now();
    for (unsigned done = 0; done < count; ++done)
        expect(once().size(), size);
    return secondsSince(start) / count;
}

BusyConnections::BusyConnections(const std::string& socketPath, std::string request, std::size_t replySize,
                                 unsigned connections)
    : _request(std::move(request)), _replySize(replySize) {
    for (unsigned made = 0; made < connections; ++made)
        _sockets.push_back(connectTo(socketPath));
}

double BusyConnections::rate(std::chrono::milliseconds duration) {
    const std::size_t threads = std::max(1U, std::thread::hardware_concurrency() / 2);
    const auto start = Clock::now();
    std::vector<std::future<unsigned>> counts;
    for (std::size_t thread = 0; thread < threads; ++thread)
        counts.push_back(
            std::async(std::launch::async, [&, thread] { return _drive(thread, threads, start + duration); }));
    unsigned replies = 0;
    for (auto& count : counts)
        replies += count.get();
    return replies / secondsSince(start);
}

/// Keeps every `stride`th connection busy, from `first` on, until `end`. Gives the number of replies.
unsigned BusyConnections::_drive(std::size_t first, std::size_t stride, Clock::time_point end) const {
    const FileDescriptor epoll(::epoll_create1(EPOLL_CLOEXEC));
    std::size_t waiting = 0;
    for (std::size_t index = first; index < _sockets.size(); index += stride, ++waiting) {
        const int socket = _sockets[index].get();
        epoll_event event{.events = EPOLLIN, .data = {.fd = socket}};
        require(::epoll_ctl(epoll.get(), EPOLL_CTL_ADD, socket, &event) == 0, "epoll_ctl");
        send(socket, _request);
    }
    unsigned replies = 0;
    std::array<epoll_event, 64> events;
    std::array<char, largestReply> reply;
    while (waiting > 0) {
        const int ready = ::epoll_wait(epoll.get(), events.data(), static_cast<int>(events.size()), -1);
        const bool goesOn = Clock::now() < end;
        for (int index = 0; index < ready; ++index) {
            const int socket = events[static_cast<std::size_t>(index)].data.fd;
            expect(receive(socket, reply.data()), _replySize);
            ++replies;
            if (goesOn)
                send(socket, _request);
            else
                --waiting;
        }
    }
    return replies;
}

} // namespace ost::benchmarks
