#pragma once

#include "Client/Upcall.h"

#include <string>
#include <vector>

namespace ostrand {

/// The environment of a program that runs in its containers, as "NAME=VALUE": what it needs of the caller's to find
/// programs and to speak to people, and where its containers are. `device` is the device's directory as the program
/// sees it, `caller` the caller's environment, ended by null.
[[nodiscard]] std::vector<std::string> processEnvironment(const ProcessContainers& containers,
                                                          const std::string& device, const std::string& userName,
                                                          const char* const* caller);

} // namespace ostrand
