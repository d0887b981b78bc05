#include "codesigning/OSTWhitelist.h"

#include "platform/base/Immortal.h"

namespace ost {

namespace {

std::optional<std::string> find(const OSTWhitelist::Mapping& mapping, std::string_view identifier) {
    const auto found = mapping.find(identifier);
    return found == mapping.end() ? std::nullopt : std::optional(found->second);
}

std::vector<std::string> identifiersOf(const OSTWhitelist::Mapping& mapping) {
    std::vector<std::string> identifiers;
    for (const auto& [identifier, container] : mapping)
        identifiers.push_back(identifier);
    return identifiers;
}

/// Every service of the table uses the container of its own name.
OSTWhitelist::Mapping toThemselves(std::initializer_list<const char*> identifiers) {
    OSTWhitelist::Mapping mapping;
    for (const auto* const identifier : identifiers)
        mapping.emplace(identifier, identifier);
    return mapping;
}

} // namespace

const OSTWhitelist& OSTWhitelist::sharedWhitelist() {
    static platform::Immortal whitelist([] {
        return OSTWhitelist(
            toThemselves({"com.tamarok.pellord", "com.tamarok.quiltrad"}),
            toThemselves({"systemgroup.com.tamarok.marrowfell", "systemgroup.com.tamarok.dunlin.tessary",
                          "systemgroup.com.tamarok.ossel.plinthwork",
                          "systemgroup.com.tamarok.corvane.tillet.sorrel"}));
    });
    return *whitelist;
}

std::optional<std::string> OSTWhitelist::wellknownSystemContainerForId(std::string_view identifier) const {
    return find(_systemWhitelist, identifier);
}

std::optional<std::string> OSTWhitelist::wellknownSystemGroupContainerForId(std::string_view identifier) const {
    return find(_systemGroupWhitelist, identifier);
}

std::optional<std::string> OSTWhitelist::wellknownContainerForId(std::string_view identifier,
                                                                 OSTContainerClass containerClass) const {
    if (containerClass == OSTContainerClass::sharedSystemGroup)
        return wellknownSystemGroupContainerForId(identifier);
    if (containerClass == OSTContainerClass::dataSystem)
        return wellknownSystemContainerForId(identifier);
    return std::nullopt;
}

bool OSTWhitelist::systemContainerIdIsWellknown(std::string_view identifier) const {
    return _systemWhitelist.contains(identifier);
}

bool OSTWhitelist::systemGroupContainerIdIsWellknown(std::string_view identifier) const {
    return _systemGroupWhitelist.contains(identifier);
}

bool OSTWhitelist::containerIdIsWellknown(std::string_view identifier, OSTContainerClass containerClass) const {
    return wellknownContainerForId(identifier, containerClass).has_value();
}

std::vector<std::string> OSTWhitelist::wellknownSystemContainers() const { return identifiersOf(_systemWhitelist); }

std::vector<std::string> OSTWhitelist::wellknownSystemGroupContainers() const {
    return identifiersOf(_systemGroupWhitelist);
}

} // namespace ost
