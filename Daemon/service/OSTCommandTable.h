#pragma once

#include "service/OSTCommandEntry.h"

#include <array>

namespace ost {

/// Every command that a request may name.
extern const std::array<OSTCommandEntry, OSTCommandCount> OSTCommandTable;

} // namespace ost
