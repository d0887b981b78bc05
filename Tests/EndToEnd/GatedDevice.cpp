#include "EndToEnd/GatedDevice.h"

#include "Support/BootedDevice.h"
#include "Support/ScratchDirectory.h"
#include "support/DeviceTest.h"

#include <gtest/gtest.h>

#include <fcntl.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <chrono>
#include <cstdint>
#include <cstdlib>
#include <stdexcept>
#include <string>
#include <system_error>

namespace ost::test {

using platform::FileDescriptor;

namespace {

constexpr const char* service = "com.tamarok.ostrandd";
constexpr std::chrono::seconds patience{60};

void require(bool succeeded, const char* what) {
    if (!succeeded)
        throw std::system_error(errno, std::generic_category(), what);
}

template<typename Value>
Value require(device::Result<Value> result) {
    if (!result)
        throw std::runtime_error(result.error().description());
    return *std::move(result);
}

sockaddr_un addressOf(const std::filesystem::path& socket) {
    sockaddr_un address{.sun_family = AF_UNIX, .sun_path = {}};
    if (socket.native().copy(address.sun_path, sizeof address.sun_path - 1) != socket.native().size())
        throw std::runtime_error("The scratch directory's path is too long for a socket");
    return address;
}

} // namespace

GatedDevice::GatedDevice(const std::filesystem::path& directory)
    : _scratch(makeScratchDirectory(0755)),
      _image(require(device::DeviceImage::openOrMake(directory.empty() ? _scratch / "device" : directory))),
      _program(::open(builtProgram("ostrandd").c_str(), O_RDONLY | O_CLOEXEC)),
      _complaints(::open((_scratch / "complaints").c_str(), O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0600)),
      _listener(_listen()), _client(_socket(), wire::allowed("com.example.Installer")) {
    require(_program && _complaints, "open the daemon");
    require(_image.mountDeviceFileSystems());
    require(_image.mountHostLibraries()); // for a daemon that is not linked statically
}

GatedDevice::~GatedDevice() {
    _daemon.reset();
    const auto complaints = readFile(_scratch / "complaints");
    for (const char* fault : {"Assertion failed", "Sanitizer:", "runtime error:"})
        EXPECT_EQ(complaints.find(fault), std::string::npos) << complaints;
}

std::filesystem::path GatedDevice::_socket() const { return onHost("/private/var/run") / service; }

FileDescriptor GatedDevice::_listen() const {
    FileDescriptor listener(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
    const auto address = addressOf(_socket());
    std::filesystem::remove(_socket()); // of an earlier boot
    require(listener && ::bind(listener.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address) == 0 &&
                ::listen(listener.get(), SOMAXCONN) == 0,
            address.sun_path);
    return listener;
}

void GatedDevice::startDaemon(const Fault& fault, GatedCallWatcher watcher) {
    _daemon.emplace([this] { return _becomeDaemon(); }, fault, std::move(watcher));
}

/// As the service launcher does it, with one of the sockets.
int GatedDevice::_becomeDaemon() const {
    enter();
    constexpr int handedOver = STDERR_FILENO + 1;
    if (::dup2(_complaints.get(), STDERR_FILENO) < 0 || ::dup2(_listener.get(), handedOver) < 0 ||
        ::close_range(handedOver + 1, ~0U, CLOSE_RANGE_CLOEXEC) != 0)
        return EXIT_FAILURE;
    ::setenv("LISTEN_PID", std::to_string(::getpid()).c_str(), 1);
    ::setenv("LISTEN_FDS", "1", 1);
    ::setenv("LISTEN_FDNAMES", service, 1);
    char name[] = "ostrandd";
    char* const arguments[] = {name, nullptr};
    ::fexecve(_program.get(), arguments, environ);
    return EXIT_FAILURE;
}

void GatedDevice::killDaemon() {
    _daemon->kill();
    _daemon->wait();
    _daemon.reset();
}

bool GatedDevice::waitForFirstPass() const {
    constexpr std::uint64_t destroyDeathRow = 4; // Passes run one after the other.
    auto connection = _client.connect();
    connection.send(wire::request(1, {{"Command", wire::number(destroyDeathRow)}}));
    const auto socket = connection.release();
    std::array<pollfd, 2> events{pollfd{socket.get(), POLLIN, 0}, pollfd{_daemon->handle(), POLLIN, 0}};
    constexpr int milliseconds = std::chrono::milliseconds(patience).count();
    char anything = 0;
    return ::poll(events.data(), events.size(), milliseconds) > 0 && events[1].revents == 0 &&
           ::recv(socket.get(), &anything, 1, 0) == 1;
}

bool GatedDevice::daemonIsUp() const {
    return _daemon && std::filesystem::exists("/proc/" + std::to_string(_daemon->id()) + "/fd/0");
}

std::vector<std::string> GatedDevice::openFilesOfDaemon() const {
    std::vector<std::string> paths;
    std::error_code closed;
    for (const auto& entry : std::filesystem::directory_iterator("/proc/" + std::to_string(_daemon->id()) + "/fd")) {
        auto path = std::filesystem::read_symlink(entry, closed).string();
        if (path.starts_with(onHost("/private").native()))
            paths.push_back(std::move(path));
    }
    std::ranges::sort(paths);
    return paths;
}

ostrand::Connection GatedDevice::connect() const { return ostrand::Connection(_client.connect().release(), patience); }

std::filesystem::path GatedDevice::onHost(const std::filesystem::path& devicePath) const {
    return _image.path() / devicePath.relative_path();
}

void GatedDevice::enter() const {
    if (!_image.changeRoot())
        ::_exit(EXIT_FAILURE); // It would act on the host.
}

void GatedDeviceTest::SetUp() {
    if (::geteuid() != 0)
        GTEST_SKIP() << "A device can be run by root only";
    _device.emplace();
    _device->startDaemon();
    ASSERT_TRUE(_device->waitForFirstPass());
}

} // namespace ost::test
