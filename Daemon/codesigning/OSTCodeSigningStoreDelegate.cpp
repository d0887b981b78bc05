#include "codesigning/OSTCodeSigningStoreDelegate.h"

#include "codesigning/OSTCodeSigningMapping.h"
#include "codesigning/OSTWhitelist.h"

namespace ost {

bool OSTCodeSigningStoreDelegate::identifierHasSystemContainer(std::string_view identifier) {
    return OSTCodeSigningMapping::sharedInstance().identifierHasSystemContainer(identifier);
}

std::optional<std::string>
OSTCodeSigningStoreDelegate::wellknownContainerForId(std::string_view identifier, OSTContainerClass containerClass) {
    return OSTWhitelist::sharedWhitelist().wellknownContainerForId(identifier, containerClass);
}

} // namespace ost
