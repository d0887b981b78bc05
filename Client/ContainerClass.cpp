#include "Client/ContainerClass.h"

#include <array>
#include <strings.h>

namespace ostrand {

namespace {

struct Class {
    std::string_view name;
    std::uint32_t usualUser;
};

/// By number; the first stands for "no class".
constexpr std::array classes{
    Class{"", currentUser},
    Class{"Bundle/Application", installerUser},
    Class{"Data/Application", currentUser},
    Class{"Bundle/LoomworkPlugin", installerUser},
    Class{"Data/LoomworkPlugin", currentUser},
    Class{"Bundle/VPNPlugin", installerUser},
    Class{"Data/VPNPlugin", currentUser},
    Class{"Shared/AppGroup", currentUser},
    Class{"Bundle/Framework", installerUser},
    Class{"Data/VexelService", currentUser},
    Class{"Data/InternalDaemon", currentUser},
    Class{"Data/TempDir", currentUser},
    Class{"Data/System", systemContainerUser},
    Class{"Shared/SystemGroup", systemContainerUser},
};

const Class& entryOf(ContainerClass containerClass) {
    const auto number = static_cast<std::uint64_t>(containerClass);
    return classes[number < classes.size() ? number : 0];
}

} // namespace

std::string_view nameOf(ContainerClass containerClass) { return entryOf(containerClass).name; }

std::optional<ContainerClass> containerClassNamed(std::string_view name) {
    for (std::size_t number = 1; number < classes.size(); ++number) {
        const auto candidate = classes[number].name;
        if (candidate.size() == name.size() && strncasecmp(candidate.data(), name.data(), name.size()) == 0)
            return static_cast<ContainerClass>(number);
    }
    return std::nullopt;
}

std::uint32_t usualUserOf(ContainerClass containerClass) { return entryOf(containerClass).usualUser; }

} // namespace ostrand
