#include "codesigning/OSTCodeSigningStoreDelegate.h"

#include "codesigning/OSTCodeSigningMapping.h"
#include "codesigning/OSTWhitelist.h"

namespace ost {

bool OSTCodeSigningStoreDelegate::identifierHasSystemContainer(std::string_view identifier) {
    return OSTCodeSigningMapping::sharedInstance().identifierHasSystemContainer(identifier);
}

std::optional<std::string> OSTCodeSigningStoreDelegate::wellknownContainerForId(std::string_view identifier,
                                                                                OSTContainerClass containerClass) {
    return OSTWhitelist::sharedWhitelist().wellknownContainerForId(identifier, containerClass);
}

bool OSTCodeSigningStoreDelegate::containerIdIsWellknown(std::string_view identifier,
                                                         OSTContainerClass containerClass) {
    return OSTWhitelist::sharedWhitelist().containerIdIsWellknown(identifier, containerClass);
}

void OSTCodeSigningStoreDelegate::removeCodeSigningDictionariesForIdentifierAndItsChildren(
    std::string_view identifier) {
    OSTCodeSigningMapping::sharedInstance().removeCodeSigningDictionariesForIdentifierAndItsChildren(identifier);
}

OSTStoreDelegate::Restoration
OSTCodeSigningStoreDelegate::rememberIdentifierAndItsChildren(std::string_view identifier) {
    return [entries = OSTCodeSigningMapping::sharedInstance().entriesOfIdentifierAndItsChildren(identifier)] {
        OSTCodeSigningMapping::sharedInstance().restoreEntries(entries);
    };
}

OSTResult<void>
OSTCodeSigningStoreDelegate::invalidateCodeSigningInfoForIdentifierAndItsChildren(std::string_view identifier) {
    return OSTCodeSigningMapping::sharedInstance().invalidateCodeSigningInfoForIdentifierAndItsChildren(identifier);
}

} // namespace ost
