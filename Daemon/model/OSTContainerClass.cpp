#include "model/OSTContainerClass.h"

#include "platform/base/Assert.h"

#include <array>

namespace ost {

namespace {

constexpr std::array<std::string_view, 15> pathComponents = {
    "Undefined",           "Bundle/Application", "Data/Application", "Bundle/LoomworkPlugin", "Data/LoomworkPlugin",
    "Bundle/VPNPlugin",    "Data/VPNPlugin",     "Shared/AppGroup",  "Bundle/Framework",      "Data/VexelService",
    "Data/InternalDaemon", "Data/TempDir",       "Data/System",      "Shared/SystemGroup",    "MAX",
};

} // namespace

std::string_view pathComponentForContainerClass(OSTContainerClass containerClass) {
    const auto index = static_cast<std::uint64_t>(containerClass);
    OST_ASSERT(index < pathComponents.size());
    return pathComponents[index];
}

} // namespace ost
