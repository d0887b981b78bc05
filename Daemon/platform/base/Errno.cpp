#include "platform/base/Errno.h"

#include <cstring>

namespace ost::platform {

std::string Errno::description() const { return std::strerror(_value); }

} // namespace ost::platform
