#pragma once

#include "Client/Containers.h"

#include <filesystem>
#include <map>
#include <string>
#include <vector>

namespace ost::test {

/// Internal UUIDs by identifier.
using Containers = std::map<std::string, std::string>;

/// What the daemon says there is. Throws when it does not answer.
[[nodiscard]] Containers listedContainers(ostrand::Connection& connection, ostrand::ContainerClass containerClass,
                                          bool transient);

/// What a class directory really holds, by the containers' metadata files; a directory that is missing holds nothing.
/// The test fails when an identifier is there twice, or an item that is no container.
[[nodiscard]] Containers containersOnDisk(const std::filesystem::path& classDirectory);

/// The names in a directory, sorted; none when it is missing.
[[nodiscard]] std::vector<std::string> namesIn(const std::filesystem::path& directory);

/// What lies where nothing lies while a device is idle: in staging, on death row, among the replace files. `image` is
/// the device's directory on the host.
[[nodiscard]] std::vector<std::string> leftovers(const std::filesystem::path& image);

} // namespace ost::test
