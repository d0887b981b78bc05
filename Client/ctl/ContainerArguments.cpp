#include "Client/ctl/ContainerArguments.h"

#include "Client/ctl/Commands.h"
#include "Client/ctl/Values.h"
#include "platform/base/Try.h"

#include <algorithm>

namespace ostrand::ctl {

std::expected<ContainerClass, Failure> classOf(const Arguments& arguments) {
    return classNamed(*arguments.value(classOption.name));
}

std::expected<std::uint64_t, Failure> userOf(const Arguments& arguments, ContainerClass containerClass) {
    const auto text = arguments.value(userOption.name);
    return text ? userNamed(*text, deviceDirectory(arguments)) : usualUserOf(containerClass);
}

std::expected<std::vector<ContainerReference>, Failure>
listedContainers(Connection& connection, const ContainerRequest& about, const std::vector<std::string>& identifiers) {
    constexpr std::uint64_t noSuchContainer = 21;
    const auto listed = OST_TRY(orFailure(ostrand::list(connection, about)));
    std::vector<ContainerReference> containers;
    for (const auto& identifier : identifiers) {
        const auto found = std::ranges::find(listed, identifier, &ListedContainer::identifier);
        if (found == listed.end()) {
            auto failure = Failure::of(Error::failed(noSuchContainer));
            failure.message += ": " + escaped(identifier);
            return std::unexpected(std::move(failure));
        }
        containers.push_back({about.containerClass, about.user, identifier, found->uuid});
    }
    return containers;
}

} // namespace ostrand::ctl
