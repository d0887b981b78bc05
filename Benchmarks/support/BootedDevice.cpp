#include "support/BootedDevice.h"

#include "Client/CodeSigning.h"
#include "Client/Containers.h"
#include "support/Require.h"

#include <chrono>
#include <fstream>
#include <sstream>
#include <stdexcept>
#include <thread>

namespace ost::benchmarks {

namespace {

constexpr std::chrono::seconds patience{30};

/// Where the launcher and the daemon tell what goes wrong.
std::string messagesOf(const std::filesystem::path& image) { return image.string() + ".messages"; }

std::string contentOf(const std::filesystem::path& file) {
    std::ostringstream content;
    content << std::ifstream(file).rdbuf();
    return content.str();
}

} // namespace

std::string builtProgram(const std::string& name) { return OSTRAND_BIN_DIR "/" + name; }

BootedDevice::BootedDevice(const std::filesystem::path& image)
    : _image(image), _launcher({builtProgram("ostrand-device"), "boot", "--image", image.string()}, messagesOf(image)) {
    const auto deadline = std::chrono::steady_clock::now() + patience;
    // An image that was booted before may still have the sockets of then, which nobody serves.
    auto connection = ostrand::Connection::open(_image, patience);
    for (; !connection; connection = ostrand::Connection::open(_image, patience)) {
        if (_launcher.hasEnded() || std::chrono::steady_clock::now() > deadline)
            throw std::runtime_error("The device does not boot: " + contentOf(messagesOf(image)));
        std::this_thread::sleep_for(std::chrono::milliseconds(1));
    }
    require(ostrand::list(*connection, {.containerClass = ostrand::ContainerClass::sharedSystemGroup,
                                        .user = ost::OSTSystemUserId,
                                        .identifier = {}}),
            "The daemon does not serve: " + contentOf(messagesOf(image)));
}

ostrand::Connection BootedDevice::connect() const {
    return require(ostrand::Connection::open(_image, patience), "connect to the daemon");
}

void BootedDevice::registerApplication(const std::string& identifier) const {
    auto connection = connect();
    require(ostrand::registerCodeSigning(
                connection, {.identifier = identifier,
                             .info = OSTDictionary(),
                             .options = ostrand::RegistrationOptions{.dataContainerClass = 2}.dictionary()}),
            "register the application");
}

std::string BootedDevice::socketPath() const { return _image / "private/var/run/com.tamarok.ostrandd"; }

std::filesystem::path BootedDevice::hostPath(const std::string& devicePath) const {
    return _image / std::filesystem::path(devicePath).relative_path();
}

std::uint64_t BootedDevice::residentBytes() const {
    std::ifstream status("/proc/" + std::to_string(_daemonId()) + "/status");
    for (std::string line; std::getline(status, line);)
        if (line.starts_with("RssAnon:"))
            return std::stoull(line.substr(line.find(':') + 1)) * 1024;
    throw std::runtime_error("The daemon's memory cannot be read");
}

/// The launcher has no other child.
pid_t BootedDevice::_daemonId() const {
    const auto launcher = std::to_string(_launcher.id());
    return std::stoi(contentOf("/proc/" + launcher + "/task/" + launcher + "/children"));
}

} // namespace ost::benchmarks
