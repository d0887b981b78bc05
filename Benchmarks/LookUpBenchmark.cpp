// Look-ups of an existing container, beside an echo of the same bytes from an event loop.

#include "Client/Containers.h"
#include "Support/BootedDevice.h"
#include "Support/ScratchDirectory.h"
#include "platform/codec/CBOR.h"
#include "platform/ipc/IPCFrame.h"
#include "support/Comparison.h"
#include "support/DeviceClient.h"
#include "support/EchoServer.h"
#include "support/OneProcessor.h"
#include "support/Require.h"
#include "support/RoundTrips.h"

#include <stdexcept>
#include <string>

namespace ost::benchmarks {

using test::BootedDevice;
using test::makeScratchDirectory;

namespace {

using ostrand::ContainerClass;
using platform::IPCFrameHeader;

constexpr const char* identifier = "com.example.Sketches.Documents";

std::string lookUpRequest() {
    return requestWith(6, [](platform::CBOREncoder& encoder) {
        encoder.key("Command");
        encoder.unsignedNumber(0);
        encoder.key("ContainerClass");
        encoder.unsignedNumber(static_cast<std::uint64_t>(ContainerClass::dataApplication));
        encoder.key("UserID");
        encoder.unsignedNumber(ost::OSTCurrentUserPlaceholder);
        encoder.key("Transient");
        encoder.boolean(false);
        encoder.key("Identifier");
        encoder.text(identifier);
        encoder.key("CreateIfNecessary");
        encoder.boolean(false);
    });
}

/// A daemon with one container, and an echo that answers the look-up of that container with what the daemon answers.
struct Servers {
    std::filesystem::path directory = makeScratchDirectory(0711);
    std::string request = lookUpRequest();
    BootedDevice device{directory / "device"};
    std::string reply = _replyOfDaemon();
    EchoServer echo{echoPath(), request.size(), reply};

    [[nodiscard]] std::string echoPath() const { return directory / "echo"; }

private:
    [[nodiscard]] std::string _replyOfDaemon() const {
        auto connection = connectTo(device);
        createContainer(connection, identifier);
        const std::string bytes(RoundTrips(device.socket(), request).once());
        const auto answer = platform::validateCBOR(std::string_view(bytes).substr(IPCFrameHeader::size));
        const auto existed = answer ? answer->find("ReplyExisted") : std::nullopt;
        if (!existed || existed->asBoolean() != true)
            throw std::runtime_error("the daemon does not find the container");
        return bytes;
    }
};

void oneClient(benchmark::State& state) {
    constexpr unsigned roundTrips = 2000;
    const OneProcessor oneProcessor;
    const Servers servers;
    RoundTrips daemon(servers.device.socket(), servers.request);
    RoundTrips echo(servers.echoPath(), servers.request);
    Comparison{.unit = Unit::seconds,
               .target = {Target::Kind::ratioAtMost, 2.0},
               .daemon = [&] { return daemon.secondsEach(roundTrips); },
               .baseline = [&] { return echo.secondsEach(roundTrips); }}
        .run(state);
}

void manyConnections(benchmark::State& state) {
    constexpr unsigned connections = 64;
    constexpr std::chrono::milliseconds duration{200};
    const Servers servers;
    BusyConnections daemon(servers.device.socket(), servers.request, servers.reply.size(), connections);
    BusyConnections echo(servers.echoPath(), servers.request, servers.reply.size(), connections);
    Comparison{.unit = Unit::perSecond,
               .target = {Target::Kind::ratioAtLeast, 0.7},
               .daemon = [&] { return daemon.rate(duration); },
               .baseline = [&] { return echo.rate(duration); }}
        .run(state);
}

[[maybe_unused]] const int one = registerComparison("look-up, one client", 51, oneClient);
[[maybe_unused]] const int many = registerComparison("look-ups, 64 connections", 31, manyConnections);

} // namespace

} // namespace ost::benchmarks
