#pragma once

#include "platform/base/FileDescriptor.h"

#include <sys/socket.h>

#include <string>

namespace ost::benchmarks {

[[nodiscard]] platform::FileDescriptor connectTo(const std::string& path, int type = SOCK_STREAM);
/// Never waits in `accept`.
[[nodiscard]] platform::FileDescriptor listenOn(const std::string& path, int type = SOCK_STREAM);

} // namespace ost::benchmarks
