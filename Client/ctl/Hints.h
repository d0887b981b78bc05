#pragma once

#include "Client/Error.h"

#include <string_view>

namespace ostrand::ctl {

/// What a person can do about an error, as one or more sentences; empty for success alone.
[[nodiscard]] std::string_view hintFor(const Error& error);

} // namespace ostrand::ctl
