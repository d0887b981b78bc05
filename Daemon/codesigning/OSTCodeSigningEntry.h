#pragma once

#include "platform/base/OSTValue.h"

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace ost {

/// The key of an entry's code-signing information that holds the entitlements dictionary.
inline constexpr const char* OSTEntitlementsKey = "com.tamarok.Ostrand.Entitlements";

/// Where older releases cached code-signing information: in the info values of a bundle container.
inline constexpr const char* OSTCachedCodeSigningInfoKey = "com.tamarok.Tessaly.CachedCodeSigningInfo";

/// What is known of one identifier's code signing.
///
/// A value type. The mapping holds entries shared and unchanging; a change is a new entry.
///
/// On disk: a dictionary with "Invalid", "Placeholder", "RegisteredByCaller" (booleans), "DataContainerClass" (number)
/// and, when present, "CodeSigningInfo" (dictionary) and "ChildBundleIds" (array of strings).
struct OSTCodeSigningEntry {
    /// The registered information; null stands for no entry at all.
    std::shared_ptr<const OSTDictionary> codeSigningInfo = nullptr;
    /// Identifiers registered with this one as their parent, in the order they were added.
    std::optional<std::vector<std::string>> childBundleIdentifiers = std::nullopt;
    bool invalid = false;                 ///< stale; requests from outside treat it as absent
    bool placeholder = false;             ///< of a placeholder install; requests from outside treat it as absent
    bool registeredByCaller = false;      ///< registered by a client directly, not from a signed bundle
    std::uint64_t dataContainerClass = 0; ///< class of the identifier's data container, 0 when none is known

    /// Builds an entry from its serialized form. What is missing is absent, false or 0; a list of children keeps its
    /// strings.
    [[nodiscard]] static OSTCodeSigningEntry withSerializedDictionary(const OSTDictionary& dictionary);

    /// Builds a valid entry from information that an older release cached, which has the entitlements under another
    /// key.
    [[nodiscard]] static OSTCodeSigningEntry withCachedInfo(const OSTDictionary& cached,
                                                            std::uint64_t dataContainerClass);

    [[nodiscard]] OSTDictionary serialize() const;

    /// The entitlements inside the code-signing information, or null.
    [[nodiscard]] const OSTDictionary* entitlements() const;

    [[nodiscard]] std::string description() const;

    friend bool operator==(const OSTCodeSigningEntry& a, const OSTCodeSigningEntry& b);
};

} // namespace ost
