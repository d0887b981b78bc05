#include "Client/ProcessEnvironment.h"

#include "platform/base/Path.h"

#include <algorithm>
#include <array>
#include <string_view>

namespace ostrand {

namespace {

bool isKept(std::string_view variable) {
    constexpr std::array<std::string_view, 4> kept{"PATH", "TERM", "LANG", "TZ"};
    const auto name = variable.substr(0, variable.find('='));
    return name.size() < variable.size() && (name.starts_with("LC_") || std::ranges::find(kept, name) != kept.end());
}

class Environment {
public:
    explicit Environment(std::string device) : _device(std::move(device)) {}

    void keep(std::string_view variable) { _variables.emplace_back(variable); }
    void add(std::string_view name, std::string_view value) { _variables.emplace_back(name).append("=").append(value); }
    void addPath(std::string_view name, const std::optional<std::string>& devicePath) {
        if (devicePath)
            add(name, _seen(*devicePath));
    }
    /// One "ID=PATH" a line; nothing when there are no groups.
    void addGroups(std::string_view name, const ProcessContainers::Groups& groups) {
        std::string lines;
        for (const auto& [identifier, path] : groups)
            lines.append(lines.empty() ? "" : "\n").append(identifier).append("=").append(_seen(path));
        if (!groups.empty())
            add(name, lines);
    }
    [[nodiscard]] std::vector<std::string> take() { return std::move(_variables); }

private:
    [[nodiscard]] std::string _seen(std::string_view devicePath) const {
        devicePath.remove_prefix(devicePath.starts_with('/') ? 1 : 0);
        return ost::platform::pathByAppending(_device, devicePath);
    }

    std::string _device;
    std::vector<std::string> _variables;
};

} // namespace

std::vector<std::string> processEnvironment(const ProcessContainers& containers, const std::string& device,
                                            const std::string& userName, const char* const* caller) {
    Environment environment(device);
    for (; *caller; ++caller)
        if (const std::string_view variable(*caller); isKept(variable))
            environment.keep(variable);
    environment.add("USER", userName);
    environment.add("LOGNAME", userName);
    environment.addPath("HOME", containers.data);
    environment.addPath("TMPDIR", containers.temporary);
    environment.addPath("OSTRAND_DATA_CONTAINER", containers.data);
    environment.addGroups("OSTRAND_GROUP_CONTAINERS", containers.groups);
    environment.addPath("OSTRAND_SYSTEM_CONTAINER", containers.system);
    environment.addGroups("OSTRAND_SYSTEM_GROUP_CONTAINERS", containers.systemGroups);
    return environment.take();
}

} // namespace ostrand
