#include "support/DeviceClient.h"

#include "Client/CodeSigning.h"
#include "support/Require.h"

#include <chrono>
#include <fstream>
#include <stdexcept>

namespace ost::benchmarks {

ostrand::Connection connectTo(const test::BootedDevice& device) {
    constexpr std::chrono::seconds patience{30};
    return require(ostrand::Connection::open(device.image(), patience), "connect to the daemon");
}

ostrand::Container createContainer(ostrand::Connection& connection, const std::string& identifier, bool transient) {
    return require(ostrand::createOrLookup(connection,
                                           {.containerClass = ostrand::ContainerClass::dataApplication,
                                            .identifier = identifier,
                                            .transient = transient},
                                           ostrand::WhenMissing::create),
                   "create a container");
}

void registerApplication(const test::BootedDevice& device, const std::string& identifier) {
    auto connection = connectTo(device);
    require(ostrand::registerCodeSigning(
                connection, {.identifier = identifier,
                             .info = OSTDictionary(),
                             .options = ostrand::RegistrationOptions{.dataContainerClass = 2}.dictionary()}),
            "register the application");
}

std::uint64_t residentBytes(const test::BootedDevice& device) {
    std::ifstream status("/proc/" + std::to_string(device.daemonId()) + "/status");
    for (std::string line; std::getline(status, line);)
        if (line.starts_with("RssAnon:"))
            return std::stoull(line.substr(line.find(':') + 1)) * 1024;
    throw std::runtime_error("The daemon's memory cannot be read");
}

} // namespace ost::benchmarks
