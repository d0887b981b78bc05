#pragma once

#include "EndToEnd/GatedDevice.h"

#include <cstdint>
#include <map>
#include <string>

namespace ost::test {

/// What clients are told of a device, and what they find there, by what it is about.
using DeviceView = std::map<std::string, std::string>;

/// Asks the device's daemon. The test fails when it contradicts itself or the disk.
[[nodiscard]] DeviceView viewOf(const GatedDevice& device);

/// The view in lines.
[[nodiscard]] std::string textOf(const DeviceView& view);

/// What may be left of a command that was interrupted before it was answered.
enum class Leaves : std::uint8_t {
    oneOfTwo, ///< what there was before, or what there is after it
    parts,    ///< of each thing one of the two, and the record of a protection class once all items have that class
    aTask,    ///< what the same command makes good; each container, and all that the command does not change
};

/// Whether `found` may be left between `before` and `after`.
[[nodiscard]] bool mayBeLeft(Leaves leaves, const DeviceView& found, const DeviceView& before, const DeviceView& after);

} // namespace ost::test
