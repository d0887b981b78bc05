#pragma once

#include "Client/Connection.h"
#include "Support/BootedDevice.h"

#include <cstdint>
#include <string>

namespace ost::benchmarks {

[[nodiscard]] ostrand::Connection connectTo(const test::BootedDevice& device);

/// As the installer does: an upcall for an identifier that nobody knows leaves lines in the log.
void registerApplication(const test::BootedDevice& device, const std::string& identifier);

/// The daemon's resident memory that is its own.
[[nodiscard]] std::uint64_t residentBytes(const test::BootedDevice& device);

} // namespace ost::benchmarks
