#pragma once

#include "Protocol/OSTContainerClass.h"
#include "platform/base/OSTError.h"

#include <functional>
#include <optional>
#include <string>
#include <string_view>

namespace ost {

/// What the store asks of the code-signing floor above it. `main` joins the two before the first operation; until then
/// nobody is entitled to anything and no name is well known.
///
/// Threads: any; the delegate lives as long as the process.
class OSTStoreDelegate {
public:
    /// Whether the identifier's code signing entitles it to a system container.
    [[nodiscard]] virtual bool identifierHasSystemContainer(std::string_view identifier) = 0;

    /// The directory name of a system service's container that exists on every device; none for all other identifiers.
    [[nodiscard]] virtual std::optional<std::string> wellknownContainerForId(std::string_view identifier,
                                                                             OSTContainerClass containerClass) = 0;

    /// Whether a system service's container of the class is known by that identifier on every device.
    [[nodiscard]] virtual bool containerIdIsWellknown(std::string_view identifier,
                                                      OSTContainerClass containerClass) = 0;

    /// Forgets the code signing of an identifier and of its children: its bundle is being deleted. Failures are logged.
    /// The caller holds the all-identifiers lock for writing.
    virtual void removeCodeSigningDictionariesForIdentifierAndItsChildren(std::string_view identifier) = 0;

    /// Puts back what was remembered.
    using Restoration = std::move_only_function<void()>;
    /// Remembers the code signing of an identifier and of its children as it is now.
    [[nodiscard]] virtual Restoration rememberIdentifierAndItsChildren(std::string_view identifier) = 0;

    /// Marks the code signing of an identifier and of its children as stale: its bundle is being replaced. Fails with
    /// `mappingWriteFailed`.
    [[nodiscard]] virtual OSTResult<void>
    invalidateCodeSigningInfoForIdentifierAndItsChildren(std::string_view identifier) = 0;

    /// The joined delegate.
    [[nodiscard]] static OSTStoreDelegate& shared();
    static void join(OSTStoreDelegate& delegate);

protected:
    ~OSTStoreDelegate() = default;
};

} // namespace ost
