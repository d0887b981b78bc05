#include "support/LoadedDevice.h"

#include "Client/Containers.h"
#include "Support/ScratchDirectory.h"
#include "platform/codec/CBOR.h"
#include "support/DeviceClient.h"
#include "support/Require.h"
#include "support/Socket.h"
#include "support/Stopwatch.h"

#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <filesystem>
#include <functional>
#include <iterator>
#include <string>

namespace ost::benchmarks {

namespace {

using namespace std::chrono_literals;
using ostrand::ContainerClass;
using platform::FileDescriptor;

constexpr const char* identifier = "com.example.Sketches";
constexpr std::array<uid_t, 3> users{501, 502, 503};
constexpr unsigned idleConnections = 1000;
constexpr unsigned busyConnectionsOfUser = 21;
constexpr unsigned hostileConnectionsOfUser = 33;

std::string requestOf(std::uint64_t command) {
    return requestWith(4, [&](platform::CBOREncoder& encoder) {
        encoder.key("Command");
        encoder.unsignedNumber(command);
        encoder.key("ContainerClass");
        encoder.unsignedNumber(static_cast<std::uint64_t>(ContainerClass::dataApplication));
        encoder.key("UserID");
        encoder.unsignedNumber(501);
        encoder.key("Identifier");
        encoder.text(identifier);
    });
}

/// The calling thread alone acts for the user from now on, as far as the sockets that it connects tell.
void become(uid_t user) { require(::syscall(SYS_setresuid, -1, user, -1) == 0, "setresuid"); }

/// Connections that each do harm in their own way, over and over.
class HostileConnections {
public:
    explicit HostileConnections(std::string socketPath) : _socketPath(std::move(socketPath)) {
        while (_sockets.size() < hostileConnectionsOfUser)
            _sockets.push_back(connectTo(_socketPath));
    }

    void doHarm() {
        for (std::size_t index = 0; index < _sockets.size(); ++index)
            if (!_doHarm(index % 5, _sockets[index].get()))
                _sockets[index] = connectTo(_socketPath);
    }

private:
    /// False when another connection is needed.
    bool _doHarm(std::size_t way, int socket) {
        switch (way) {
        case 0: // a frame without an end
            return _send(socket, _lookUp.substr(0, _lookUp.size() / 2)) || errno == EAGAIN;
        case 1:
            return _send(socket, std::string(100, '\xff'));
        case 2: // replies that nobody reads
            while (_send(socket, _lookUp))
                ;
            return errno == EAGAIN;
        case 3:
            return _send(socket, _unknown) && ::recv(socket, _reply.data(), _reply.size(), 0) > 0;
        default:
            return false;
        }
    }
    static bool _send(int socket, const std::string& bytes) {
        return ::send(socket, bytes.data(), bytes.size(), MSG_NOSIGNAL | MSG_DONTWAIT) ==
               static_cast<ssize_t>(bytes.size());
    }

    const std::string _socketPath;
    const std::string _lookUp = requestOf(0), _unknown = requestOf(999);
    std::array<char, 4096> _reply;
    std::vector<FileDescriptor> _sockets;
};

void beBusy(const std::stop_token& end, const std::string& socketPath, uid_t user) {
    become(user);
    const auto request = requestOf(0);
    const auto reply = RoundTrips(socketPath, request).once().size();
    BusyConnections connections(socketPath, request, reply, busyConnectionsOfUser);
    while (!end.stop_requested())
        connections.rate(20ms);
}

void beHostile(const std::stop_token& end, const std::string& socketPath, uid_t user) {
    become(user);
    HostileConnections connections(socketPath);
    for (; !end.stop_requested(); std::this_thread::sleep_for(1ms))
        connections.doHarm();
}

/// With descriptors for every connection of the load.
std::filesystem::path placeOfDevice() {
    const rlimit descriptors{.rlim_cur = 4096, .rlim_max = 4096};
    require(::setrlimit(RLIMIT_NOFILE, &descriptors) == 0, "setrlimit");
    return test::makeScratchDirectory(0711);
}

/// A device's socket, when its daemon has the container that is looked up.
std::string socketOf(const test::BootedDevice& device) {
    auto connection = connectTo(device);
    createContainer(connection, identifier);
    return device.socket();
}

/// The seconds of each round trip as long as `goesOn` says of so many, sorted.
std::vector<double> secondsOfEach(RoundTrips& trips, const std::function<bool(std::size_t done)>& goesOn) {
    std::vector<double> seconds;
    while (goesOn(seconds.size()))
        seconds.push_back(secondsOf([&] { trips.once(); }));
    std::ranges::sort(seconds);
    return seconds;
}

std::vector<double> secondsOfEach(RoundTrips& trips, unsigned count) {
    return secondsOfEach(trips, [=](std::size_t done) { return done < count; });
}

} // namespace

LoadedDevice::LoadedDevice() : LoadedDevice(placeOfDevice()) {}

LoadedDevice::LoadedDevice(const std::filesystem::path& directory)
    : _device(directory / "device"), _lookUp(socketOf(_device), requestOf(0)),
      _echoServer(directory / "echo", requestOf(0).size(), std::string(_lookUp.once())),
      _echo(directory / "echo", requestOf(0)) {
    static_cast<void>(lookUps(2000));
    static_cast<void>(echoes(2000));
}

std::vector<double> LoadedDevice::lookUps(unsigned count) { return secondsOfEach(_lookUp, count); }

std::vector<double> LoadedDevice::lookUps(std::chrono::seconds duration) {
    const auto end = Clock::now() + duration;
    return secondsOfEach(_lookUp, [=](std::size_t) { return Clock::now() < end; });
}

std::vector<double> LoadedDevice::echoes(unsigned count) { return secondsOfEach(_echo, count); }

LoadedDevice::Holding LoadedDevice::holding() const {
    const std::filesystem::directory_iterator all("/proc/" + std::to_string(_device.daemonId()) + "/fd");
    return {static_cast<std::size_t>(std::distance(begin(all), end(all))), residentBytes(_device)};
}

bool LoadedDevice::returnsTo(const Holding& before) const {
    constexpr std::uint64_t mayStay = std::uint64_t{16} << 20;
    for (const auto patience = Clock::now() + 10s; Clock::now() < patience; std::this_thread::sleep_for(10ms)) {
        const auto now = holding();
        if (now.descriptors <= before.descriptors && now.residentBytes <= before.residentBytes + mayStay)
            return true;
    }
    return false;
}

LoadedDevice::Load::Load(const LoadedDevice& device) {
    const auto path = device._device.socket().string();
    while (_idle.size() < idleConnections)
        _idle.push_back(connectTo(path));
    for (const auto user : users) {
        _threads.emplace_back([=](const std::stop_token& end) { beBusy(end, path, user); });
        _threads.emplace_back([=](const std::stop_token& end) { beHostile(end, path, user); });
    }
}

double percentileOf(const std::vector<double>& sorted, double percentile) {
    return sorted.at(static_cast<std::size_t>(percentile * static_cast<double>(sorted.size() - 1)));
}

} // namespace ost::benchmarks
