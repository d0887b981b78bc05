#pragma once

#include <optional>
#include <string>
#include <string_view>

namespace ost::platform {

/// What the device is, read from its files at each call. Threads: any.

/// Whether /etc/device-capabilities has the line `name=true`, as its last word on the name. Anything else means no.
[[nodiscard]] bool deviceCapability(std::string_view name);

/// BUILD_ID of /etc/os-release; absent when there is none.
[[nodiscard]] std::optional<std::string> buildVersion();

/// Whether several people share the device, each with accounts of their own: never.
[[nodiscard]] constexpr bool isMultiUser() { return false; }

} // namespace ost::platform
