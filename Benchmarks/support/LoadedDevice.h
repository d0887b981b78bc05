#pragma once

#include "Support/BootedDevice.h"
#include "platform/base/FileDescriptor.h"
#include "support/EchoServer.h"
#include "support/RoundTrips.h"

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <filesystem>
#include <thread>
#include <vector>

namespace ost::benchmarks {

/// A device whose daemon a client asks for a container, alone or while other clients bear upon it.
class LoadedDevice {
public:
    LoadedDevice();

    /// The seconds that each of so many look-ups took, sorted.
    [[nodiscard]] std::vector<double> lookUps(unsigned count);
    /// The same of as many as there is time for.
    [[nodiscard]] std::vector<double> lookUps(std::chrono::seconds duration);

    /// The same of an echo that nobody else asks: what the machine has left for anybody.
    [[nodiscard]] std::vector<double> echoes(unsigned count);

    /// What the daemon has of the system.
    struct Holding {
        std::size_t descriptors;
        std::uint64_t residentBytes;
    };
    [[nodiscard]] Holding holding() const;
    /// Waits a while until the daemon has no more than before, up to 16 MiB of memory. False when it keeps more.
    [[nodiscard]] bool returnsTo(const Holding& before) const;

    /// A thousand idle connections, and dozens that are busy and a hundred that mean harm of three users, for as long
    /// as the object lives.
    class Load {
    public:
        explicit Load(const LoadedDevice& device);

    private:
        std::vector<platform::FileDescriptor> _idle;
        std::vector<std::jthread> _threads;
    };

private:
    explicit LoadedDevice(const std::filesystem::path& directory);

    test::BootedDevice _device;
    RoundTrips _lookUp;
    EchoServer _echoServer;
    RoundTrips _echo;
};

/// A percentile, between 0 and 1, of sorted samples, of which there are some.
[[nodiscard]] double percentileOf(const std::vector<double>& sorted, double percentile);

} // namespace ost::benchmarks
