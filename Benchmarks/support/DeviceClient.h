#pragma once

#include "Client/Connection.h"
#include "Client/Containers.h"
#include "Support/BootedDevice.h"

#include <cstdint>
#include <string>

namespace ost::benchmarks {

[[nodiscard]] ostrand::Connection connectTo(const test::BootedDevice& device);

/// Creates an application's data container unless it is there.
ostrand::Container createContainer(ostrand::Connection& connection, const std::string& identifier,
                                   bool transient = false);

/// As the installer does: an upcall for an identifier that nobody knows leaves lines in the log.
void registerApplication(const test::BootedDevice& device, const std::string& identifier);

/// The daemon's resident memory that is its own.
[[nodiscard]] std::uint64_t residentBytes(const test::BootedDevice& device);

} // namespace ost::benchmarks
