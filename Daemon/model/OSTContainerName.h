#pragma once

#include "Protocol/OSTContainerClass.h"
#include "platform/base/UUID.h"

#include <cstddef>
#include <cstdint>
#include <optional>
#include <string_view>

namespace ost {

/// The longest identifier, in bytes, under which something is made, registered or set: with paths and UUIDs beside
/// them, thousands of such fit into one reply. What is on disk under a longer one stays valid.
inline constexpr std::size_t OSTLongestIdentifier = 1024;

/// What names one container among all: at most one has a name at a time.
///
/// A value that looks at an identifier of its maker's, for the length of a call.
struct OSTContainerName {
    std::uint32_t userId = 0;
    OSTContainerClass containerClass = OSTContainerClass::undefined;
    std::optional<std::string_view> identifier = std::nullopt; ///< none: a client named no container, and is refused
    bool transient = false;
};

/// A container that is meant only as long as it has that internal UUID, live or transient whatever the name says.
struct OSTContainerReference {
    OSTContainerName name = {};
    std::optional<platform::UUID> uuid = std::nullopt;
};

} // namespace ost
