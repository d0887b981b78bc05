#pragma once

#include "Client/ctl/Arguments.h"

#include <span>
#include <string>
#include <string_view>
#include <vector>

namespace ostrand::ctl {

/// What a shell may put in the place of the last word of a begun command line, which may be empty: commands, options,
/// classes, and, from the device and its daemon, users and identifiers. Names that a shell would take for more than a
/// name are left out. Where a file is wanted, the only candidate is ":files", ":directories" or ":programs", and the
/// shell knows best. Waits for the daemon a second at most.
[[nodiscard]] std::vector<std::string> completions(const CommandTable& table, std::span<const std::string_view> words);

} // namespace ostrand::ctl
