#pragma once

#include "platform/base/FileDescriptor.h"
#include "platform/codec/CBOR.h"

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <functional>
#include <string>
#include <string_view>
#include <vector>

namespace ost::benchmarks {

/// A request of so many entries, as the client library sends it. Made here, so that what is timed is the daemon and not
/// the library.
[[nodiscard]] std::string requestWith(std::uint64_t entries,
                                      const std::function<void(platform::CBOREncoder&)>& writeEntries);

/// One client that sends the same request over and over, and does nothing else.
class RoundTrips {
public:
    RoundTrips(const std::string& socketPath, std::string request);

    /// The reply's bytes, valid until the next round trip.
    std::string_view once();
    /// Seconds for each of `count` round trips, all of which must bring a reply of the same size.
    double secondsEach(unsigned count);

private:
    platform::FileDescriptor _socket;
    std::string _request;
    std::string _received;
};

/// Many connections, each of which sends its next request when it has its reply. One thread for every two processors
/// keeps them busy, so that the other side has at least as many.
class BusyConnections {
public:
    BusyConnections(const std::string& socketPath, std::string request, std::size_t replySize, unsigned connections);

    /// Replies a second, over `duration`.
    double rate(std::chrono::milliseconds duration);

private:
    unsigned _drive(std::size_t first, std::size_t stride, std::chrono::steady_clock::time_point end) const;

    std::string _request;
    std::size_t _replySize;
    std::vector<platform::FileDescriptor> _sockets;
};

} // namespace ost::benchmarks
