#pragma once

#include "platform/base/FileDescriptor.h"

#include <string>

namespace ost::benchmarks {

[[nodiscard]] platform::FileDescriptor connectTo(const std::string& path);
/// Never waits in `accept`.
[[nodiscard]] platform::FileDescriptor listenOn(const std::string& path);

} // namespace ost::benchmarks
