#pragma once

#include "store/OSTStoreDelegate.h"

namespace ost {

/// Answers the store's questions from the code-signing mapping and the table of well-known containers. The mapping is
/// made at the first question that needs it.
///
/// Threads: any. Without state.
class OSTCodeSigningStoreDelegate final : public OSTStoreDelegate {
public:
    [[nodiscard]] bool identifierHasSystemContainer(std::string_view identifier) override;
    [[nodiscard]] std::optional<std::string> wellknownContainerForId(std::string_view identifier,
                                                                     OSTContainerClass containerClass) override;
    [[nodiscard]] bool containerIdIsWellknown(std::string_view identifier, OSTContainerClass containerClass) override;
    void removeCodeSigningDictionariesForIdentifierAndItsChildren(std::string_view identifier) override;
    [[nodiscard]] Restoration rememberIdentifierAndItsChildren(std::string_view identifier) override;
    [[nodiscard]] OSTResult<void>
    invalidateCodeSigningInfoForIdentifierAndItsChildren(std::string_view identifier) override;
};

} // namespace ost
