#pragma once

#include "Client/Containers.h"
#include "Client/ctl/Output.h"
#include "platform/base/OSTValue.h"

#include <cstdint>
#include <expected>
#include <string>
#include <vector>

namespace ostrand::ctl {

// What users type, and what it means. What means nothing is a failure that says why.

/// The names of all container classes, in the order of their numbers.
[[nodiscard]] std::vector<std::string> classNames();

/// A container class: its number, whatever that is, or its name.
[[nodiscard]] std::expected<ContainerClass, Failure> classNamed(const std::string& text);

/// A user: a number, or the name of an account in the device's own list, which is not the host's.
[[nodiscard]] std::expected<std::uint64_t, Failure> userNamed(const std::string& text, const std::string& device);

/// The largest property list that is read for a request: XML is longer than what becomes of it.
inline constexpr std::size_t largestPropertyList = std::size_t{64} << 20U;

/// The value in a property-list file of either encoding; "-" is standard input.
[[nodiscard]] std::expected<ost::OSTValue, Failure> propertyListIn(const std::string& path);
/// The same, which must be a dictionary.
[[nodiscard]] std::expected<ost::OSTDictionary, Failure> dictionaryIn(const std::string& path,
                                                                      std::size_t largest = largestPropertyList);

} // namespace ostrand::ctl
