#pragma once

#include "Protocol/OSTContainerClass.h"
#include "model/OSTMetadata.h"
#include "platform/base/OSTError.h"
#include "store/OSTClientConnection.h"

#include <cstdint>
#include <expected>
#include <functional>
#include <map>
#include <optional>
#include <string>
#include <string_view>
#include <unordered_map>
#include <vector>

namespace ost {

/// The two kinds of group containers.
enum class OSTGroupType : std::uint8_t {
    application = 0, ///< of the mobile user 501, class 7
    system = 1,      ///< of the system user 499, class 13
};

/// Finds and makes the group containers that an identifier is entitled to, and deletes those that nobody references any
/// more. References are not stored: they are counted in the whole mapping whenever they are needed.
///
/// Threads: any; the shared instance has no state. Everything runs with the all-identifiers write lock held: the
/// queries take it, the rest is called by whoever holds it.
class OSTGroupManager {
public:
    using GroupList = std::optional<std::vector<std::string>>;
    using Paths = std::map<std::string, std::string>;

    static const OSTGroupManager& defaultManager();

    /// The paths of an identifier's group containers, by group identifier: of its system groups for user 499, else of
    /// its application groups. Missing containers are made; one that cannot be made is logged and left out. The
    /// client's `allowGroupIdLookup` stays set. Codes: `invalidObject` without an identifier.
    [[nodiscard]] std::expected<Paths, OSTErrorCode>
    groupContainerPathsForUser(std::uint32_t userId, OSTClientConnection& client,
                               std::optional<std::string_view> identifier) const;

    /// The application groups of an identifier. Codes: `invalidObject` without an identifier.
    [[nodiscard]] std::expected<std::vector<std::string>, OSTErrorCode>
    groupContainerIdentifiersForUser(std::uint32_t userId, std::optional<std::string_view> identifier) const;

    /// Releases the groups that an identifier leaves when its list changes from one to the other. Runs on the mapping's
    /// queue, while the mapping still has the old list.
    void handleChangeFromOldGroupContainerIds(const GroupList& oldGroups, const GroupList& newGroups,
                                              OSTGroupType type) const;

    /// Deletes every application group container that nobody references. The caller holds the all-identifiers lock for
    /// writing. Failures are logged.
    void reconcileGroupContainersOfType(OSTGroupType type) const;

private:
    struct Hash {
        using is_transparent = void;
        std::size_t operator()(std::string_view group) const { return std::hash<std::string_view>{}(group); }
    };
    using ReferenceCounts = std::unordered_map<std::string, std::size_t, Hash, std::equal_to<>>;

    OSTGroupManager() = default;

    /// Whether the mapping is available. Without it, which is logged, nobody knows who references what.
    [[nodiscard]] static bool _mayCountReferencesOfType(OSTGroupType type);
    /// How many identifiers of the mapping reference each of these groups, whatever state their entries are in. None
    /// when they may not be counted.
    [[nodiscard]] static std::optional<ReferenceCounts>
    _copyReferenceCountSetOfType(OSTGroupType type, const std::vector<std::string>& groups);

    static void _removeReferenceForGroupIdentifiers(const std::vector<std::string>& groups, OSTGroupType type);
    static void _removeGroupContainersIfNeededforUser(std::uint32_t userId, OSTContainerClass groupContainerClass,
                                                      const std::vector<std::string>& groups,
                                                      ReferenceCounts referenceCounts);
    static void _cleanupUnreferencedGroupContainersForUser(std::uint32_t userId,
                                                           const std::vector<OSTMetadataRecord>& containers,
                                                           const ReferenceCounts& referenceCounts);
    /// `operation` is whose name a failure is logged under.
    static void _stageForDeletion(const OSTMetadata& container, std::string_view operation);
};

} // namespace ost
