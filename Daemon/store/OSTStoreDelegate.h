#pragma once

#include "model/OSTContainerClass.h"

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

    /// The joined delegate.
    [[nodiscard]] static OSTStoreDelegate& shared();
    static void join(OSTStoreDelegate& delegate);

protected:
    ~OSTStoreDelegate() = default;
};

} // namespace ost
