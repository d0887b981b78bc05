#include "Client/ctl/ContainerArguments.h"

#include "Client/ctl/Commands.h"
#include "Client/ctl/Hints.h"
#include "Client/ctl/Suggestion.h"
#include "Client/ctl/Values.h"
#include "Protocol/OSTErrorCode.h"
#include "platform/base/Try.h"

#include <algorithm>

namespace ostrand::ctl {

namespace {

Failure noContainer(const std::string& identifier, const std::vector<ListedContainer>& listed) {
    std::vector<std::string> names;
    for (const auto& container : listed)
        names.push_back(container.identifier);
    const auto error = Error::failed(static_cast<std::uint64_t>(ost::OSTErrorCode::notFound));
    return Failure::of(error,
                       std::string(ost::meaningOf(ost::OSTErrorCode::notFound)) + ": " + escaped(identifier) +
                           didYouMean(identifier, names),
                       std::string(hintFor(error)));
}

} // namespace

std::expected<ContainerClass, Failure> classOf(const Arguments& arguments) {
    return classNamed(*arguments.value(classOption.name));
}

std::expected<std::uint64_t, Failure> userOf(const Arguments& arguments, ContainerClass containerClass) {
    const auto text = arguments.value(userOption.name);
    return text ? userNamed(*text, deviceDirectory(arguments)) : usualUserOf(containerClass);
}

std::expected<std::vector<ContainerReference>, Failure>
listedContainers(Connection& connection, const ContainerRequest& about, const std::vector<std::string>& identifiers) {
    const auto listed = OST_TRY(orFailure(ostrand::list(connection, about)));
    std::vector<ContainerReference> containers;
    for (const auto& identifier : identifiers) {
        const auto found = std::ranges::find(listed, identifier, &ListedContainer::identifier);
        if (found == listed.end())
            return std::unexpected(noContainer(identifier, listed));
        containers.push_back({about.containerClass, about.user, identifier, found->uuid});
    }
    return containers;
}

} // namespace ostrand::ctl
