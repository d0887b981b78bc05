#pragma once

#include "Protocol/OSTContainerClass.h"

#include <functional>
#include <map>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace ost {

/// The fixed table of system containers (class 12) and system group containers (class 13) that belong to services of
/// every device. Such a container lies in the directory named by its container identifier instead of a UUID.
/// Identifiers are compared exactly. These names come from the table alone, so no path is ever built from an identifier
/// that a client chose.
///
/// Threads: any; immutable. One shared instance.
class OSTWhitelist {
public:
    using Mapping = std::map<std::string, std::string, std::less<>>;

    static const OSTWhitelist& sharedWhitelist();
    OSTWhitelist(Mapping systemContainerMapping, Mapping systemGroupContainerMapping)
        : _systemWhitelist(std::move(systemContainerMapping)),
          _systemGroupWhitelist(std::move(systemGroupContainerMapping)) {}

    /// The container identifier that a well-known identifier uses; none for others.
    [[nodiscard]] std::optional<std::string> wellknownSystemContainerForId(std::string_view identifier) const;
    [[nodiscard]] std::optional<std::string> wellknownSystemGroupContainerForId(std::string_view identifier) const;
    /// The same by class; none for every class but 12 and 13.
    [[nodiscard]] std::optional<std::string> wellknownContainerForId(std::string_view identifier,
                                                                     OSTContainerClass containerClass) const;

    [[nodiscard]] bool systemContainerIdIsWellknown(std::string_view identifier) const;
    [[nodiscard]] bool systemGroupContainerIdIsWellknown(std::string_view identifier) const;
    [[nodiscard]] bool containerIdIsWellknown(std::string_view identifier, OSTContainerClass containerClass) const;

    [[nodiscard]] std::vector<std::string> wellknownSystemContainers() const;
    [[nodiscard]] std::vector<std::string> wellknownSystemGroupContainers() const;

private:
    const Mapping _systemWhitelist;
    const Mapping _systemGroupWhitelist;
};

} // namespace ost
