#pragma once

#include "files/OSTFileManager.h"
#include "model/OSTContainerName.h"
#include "model/OSTMetadata.h"
#include "platform/base/OSTError.h"
#include "platform/base/OSTValue.h"
#include "platform/base/UUID.h"
#include "platform/threads/WorkQueue.h"
#include "store/OSTContainerCache.h"

#include <cstdint>
#include <expected>
#include <functional>
#include <optional>
#include <set>
#include <string>
#include <string_view>
#include <vector>

namespace ost {

/// Where items go that cannot be removed.
inline constexpr std::string_view OSTParkingDirectory = "/tmp";

/// Who a client is and what it may look up.
struct OSTClientIdentity {
    std::optional<std::string> clientBundleIdentifier = std::nullopt;
    std::uint32_t clientUserId = 0;
    bool allowOtherIdLookup = false; ///< may act on identifiers other than its own
    bool allowGroupIdLookup = false;
    std::optional<std::vector<std::string>> entitledWipeIdentifiers = std::nullopt;
};

/// What a client asks for when it asks for one container.
struct OSTContainerLookup {
    OSTContainerName name;
    bool createIfNecessary = false;
    bool useLocking = true; ///< false when the caller holds the all-identifiers lock for writing
};

/// No: the caller holds the container's lock.
enum class OSTUseLocking : bool { no, yes };

/// Containers to be deleted as a client lists them, one for each index of lists that may differ in length.
struct OSTDeletion {
    std::vector<std::uint32_t> userIds;
    std::vector<std::optional<platform::UUID>> uuids;
    std::vector<std::optional<std::string_view>> identifiers;
    std::vector<OSTContainerClass> classes;
};

/// A container to be put in another's place.
struct OSTReplacement {
    OSTContainerReference oldContainer; ///< without a UUID: there is none
    OSTContainerReference newContainer;
    bool preserveOldUUID = false; ///< the new one takes the old one's directory name and internal UUID
    bool startDeletionThread = false;
};

/// The serial queue on which every death-row pass runs, at background priority.
[[nodiscard]] platform::WorkQueue& OSTDeathRowQueue();

/// The object through which every store operation runs, with one client's identity and rights. A new one is made for
/// each request and dies with it; the daemon's own work uses `sharedClientConnection`.
///
/// Threads: any, one at a time for an object whose rights change. Operations serialise themselves with the locks of
/// OSTLocks. On disk: a container is built in the staging directory and put in place with one rename, so a live one is
/// never half made. What is thrown away is moved to death row with one rename and destroyed by a later pass. Failures
/// leave as a code alone; the error behind it is in the log. An exception becomes `exceptionCaught`.
class OSTClientConnection {
public:
    explicit OSTClientConnection(OSTClientIdentity identity) : _identity(std::move(identity)) {}

    /// The connection of the daemon's own work: identifier "com.tamarok.ostrandd.internal", user 0, any identifier.
    [[nodiscard]] static OSTClientConnection& sharedClientConnection();

    [[nodiscard]] const OSTClientIdentity& identity() const { return _identity; }
    /// Widen what the client may look up, for the rest of its request.
    void setAllowOtherIdLookup() { _identity.allowOtherIdLookup = true; }
    void setAllowGroupIdLookup() { _identity.allowGroupIdLookup = true; }

    /// The opposite: the client's entitlements alone count.
    void clearAllowOtherIdLookup() { _identity.allowOtherIdLookup = false; }

    // Creation and look-up

    /// Gives the container that the look-up names, making it when it is missing and may be made; `existed` tells which.
    /// A transient container is never reused: one that is found is thrown away first. What is answered has reached the
    /// disk.
    ///
    /// Codes: `invalidObject` (no identifier, or a class or user that do not fit), `notEntitled`, `notFound`,
    /// `transientRemovalFailed`, `stagingCreationFailed`, `dictionaryWriteFailed`, `accessControlListFailed`,
    /// `subDirectoryCreationFailed`, `moveToLiveFailed`, `cacheAddFailed`, `stagingRemovalFailed`, those of the cache.
    [[nodiscard]] std::expected<OSTMetadataRecord, OSTErrorCode>
    createOrLookupContainerForUser(const OSTContainerLookup& lookup) const;

    /// All containers of the user and class. Codes: `invalidObject`, those of the cache.
    [[nodiscard]] std::expected<std::vector<OSTMetadataRecord>, OSTErrorCode>
    containersForUser(std::uint32_t userId, OSTContainerClass containerClass, bool transient) const;

    // Attributes of one container
    //
    // Each works on the container that has that internal UUID, under a lock of its own on that. What is answered has
    // reached the disk. Codes of all: `invalidObject` (no UUID, or no class), `notFound`, `moveToLiveFailed` (the
    // container's place cannot be made sure of).

    /// Sets the info value of a key, or removes the key when there is no value. When that fails, file and cache hold
    /// what they held before. Codes: `invalidParameter` (no key), `dictionaryWriteFailed`, `cacheAddFailed`.
    [[nodiscard]] std::expected<void, OSTErrorCode> setInfoValue(const std::optional<OSTValue>& value,
                                                                 std::optional<std::string_view> key,
                                                                 const OSTContainerReference& container,
                                                                 OSTUseLocking useLocking = OSTUseLocking::yes) const;

    /// The info value of a key. Codes: `invalidParameter` (no key), `noInfoValue`, which is not logged.
    [[nodiscard]] std::expected<OSTValue, OSTErrorCode>
    infoValueForKey(std::optional<std::string_view> key, const OSTContainerReference& container,
                    OSTUseLocking useLocking = OSTUseLocking::yes) const;

    /// The container's record.
    [[nodiscard]] std::expected<OSTMetadataRecord, OSTErrorCode>
    metadataForUser(const OSTContainerReference& container) const;

    /// Makes the directories again that a new container of the class has, and standardises the ACLs of a system
    /// container. Codes: `subDirectoryCreationFailed`, those of the ACLs.
    [[nodiscard]] std::expected<void, OSTErrorCode>
    recreateDefaultStructureForUser(const OSTContainerReference& container) const;

    /// Gives the container's directory a new name. Codes: `moveToNewUUIDFailed`, also for a container whose name is
    /// well known, `cacheAddFailed`, after which it has the new name.
    [[nodiscard]] std::expected<void, OSTErrorCode>
    regenerateDirectoryUUIDForUser(const OSTContainerReference& container) const;

    // Deletion

    /// Takes containers out of their places, the cache and the sandbox's mapping, and leaves them on death row. That
    /// has reached the disk when this returns. An entry that names no container is passed over; one whose container
    /// cannot be moved or removed is logged, and keeps its place. Codes: `invalidObject` when UUIDs, identifiers and
    /// classes differ in number, `cacheRemoveFailed`, `deletionFailed` when a power cut might bring a container back.
    [[nodiscard]] std::expected<void, OSTErrorCode>
    stageForDeleteContainersWithUsers(const OSTDeletion& deletion) const;
    /// The same for a container that was found; one that has gone since is passed over, and one that keeps its place
    /// gives `deletionFailed`. `useLocking` is false when the caller holds the all-identifiers lock for writing.
    [[nodiscard]] std::expected<void, OSTErrorCode> stageForDeleteContainer(const OSTMetadata& container,
                                                                            bool useLocking = true) const;

    /// Looks one container up and stages it for deletion. Codes: those of the look-up and of the staging.
    [[nodiscard]] std::expected<void, OSTErrorCode> deleteContainerForUser(const OSTContainerName& name) const;

    using DeathRowCompletion = std::move_only_function<void(std::int64_t code)>;

    /// Enqueues a death-row pass, which destroys everything on death row, and returns. `completion`, if any, gets
    /// `success`, or the code of the last failure.
    void deleteContainersOnDeathRowWithCompletion(DeathRowCompletion completion = nullptr) const;

    // Replacement

    /// Puts the new container in the place of the old one, which is discarded, or, without an old one, into its live
    /// class directory. A crash at any moment leaves one of the two in its place. When a step fails the old container
    /// is put back, unless the new one has taken its place already.
    ///
    /// Codes: `invalidObject`, `classesDiffer`, `usersDiffer`, `notFound`, `replacedByItself`, `unexpectedPath`,
    /// `alreadyExists`, `replaceDescriptionIncomplete`, `dictionaryWriteFailed`, `moveOldToStagingFailed`,
    /// `cacheRemoveFailed`, `mappingWriteFailed`, `replacingMoveFailed`, `cacheAddFailed`, `replaceCleanupFailed`,
    /// those of the cache.
    [[nodiscard]] std::expected<void, OSTErrorCode> replaceContainer(const OSTReplacement& replacement) const;

    // Maintenance

    /// Puts a fresh container in the place of a data container, under the same internal UUID; its old content goes to
    /// death row. A client without `allowOtherIdLookup` may do so to the plug-ins alone that it is entitled to wipe.
    /// Codes: `noIdentifier`, `invalidObject` (no data container), `notEntitled`, those of look-up, creation and
    /// replacement.
    [[nodiscard]] std::expected<void, OSTErrorCode>
    deleteDataContainerContentForUser(const OSTContainerName& name) const;

    /// The bytes that a container takes on disk; those of a bundle are measured once and kept in its info values.
    /// Codes: `invalidObject` (no UUID, or no class), `notFound`.
    [[nodiscard]] std::expected<std::uint64_t, OSTErrorCode>
    diskUsageForUserId(const OSTContainerReference& container) const;

    /// Ends the daemon as often as `crashes` says, once for each call, so that clients can test what they do then. The
    /// count is kept in a container's info values; the call that finds none left returns. Codes: those of creation, of
    /// `setInfoValue` and of deletion.
    [[nodiscard]] std::expected<void, OSTErrorCode> retryTestForUser(std::uint32_t userId, std::uint64_t crashes) const;

    // Start-up

    /// The start-up migration, which lies above the store. A failure may come without an error.
    using StartupMigration = std::function<std::expected<void, std::optional<OSTError>>()>;

    /// The first step after a boot of the device: changes what older releases left behind. A failure is logged.
    static void rebootContainerManagerSetup(const StartupMigration& migration);

    /// Finishes or undoes the replacements that a crash interrupted. Failures are logged. Runs first, and takes no
    /// locks.
    void containerManagerSetup() const;

    /// The work of the first start after a boot of the device: transient containers, which do not survive it, and items
    /// of class directories that are no containers go to death row. Failures are logged. Runs before requests are
    /// accepted, and so takes no locks.
    void rebootContainerManagerCleanup() const;

    /// Brings the store to order before anybody is served: what a crash left in staging goes to death row, and a first
    /// pass destroys it. Failures are logged. Runs before requests are accepted, and so takes no locks.
    void containerManagerCleanup() const;

private:
    enum class StartPass : bool { no, yes };

    // +Creation
    [[nodiscard]] OSTResult<void> _checkLookup(const OSTContainerLookup& lookup) const;
    /// `staging` is what is to be thrown away when this has returned, if anything.
    [[nodiscard]] OSTResult<OSTCacheEntry> _lookUpOrCreate(const OSTContainerLookup& lookup,
                                                           std::string& staging) const;
    struct LookUpResult {
        OSTCacheEntry entry = {}; ///< without a record: the container is to be made
        bool threwTransientAway = false;
    };
    [[nodiscard]] OSTResult<LookUpResult> _lookUp(const OSTContainerLookup& lookup) const;
    [[nodiscard]] static OSTResult<void> _checkNewIdentifier(const OSTContainerName& name);
    [[nodiscard]] static OSTResult<OSTMetadata> _buildInStaging(const OSTContainerName& name, std::string& staging);
    [[nodiscard]] static OSTResult<OSTCacheEntry> _putInPlace(OSTMetadata metadata, std::string& staging);
    [[nodiscard]] static OSTResult<OSTCacheEntry> _putInPlaceOfThrownAway(const OSTContainerName& name,
                                                                          std::string& staging);
    [[nodiscard]] static OSTResult<void>
    _createTopLevelContainerDirectory(const std::string& url, OSTContainerClass containerClass, std::uint32_t owner);
    [[nodiscard]] static OSTResult<void> _createSubDirectories(const std::string& url, std::uint32_t userId,
                                                               OSTContainerClass containerClass);
    /// Waits until the owners of the sub-directories, and what lies in these, are on disk.
    [[nodiscard]] static OSTResult<void> _makeSubDirectoriesDurable(const std::string& url,
                                                                    OSTContainerClass containerClass);
    [[nodiscard]] static OSTResult<void> _createDefaultDirectory(const std::string& url, std::uint16_t mode,
                                                                 std::uint32_t owner);

    /// Waits until the rename that put the record's container in place has reached the disk. Whoever finds one that is
    /// not there yet does so before he answers with it. Fails with `moveToLiveFailed`.
    [[nodiscard]] static OSTResult<void> _makePlaceDurable(const OSTMetadata& record);

    // +Attributes
    struct MovedContainer {
        OSTMetadataRecord before, after;
    };
    /// The container that is meant, in a place that is on disk.
    [[nodiscard]] static OSTResult<OSTMetadataRecord> _container(const OSTContainerReference& container);
    [[nodiscard]] static OSTResult<void> _changeInfo(const OSTMetadata& record, OSTDictionary info);
    [[nodiscard]] OSTResult<MovedContainer> _moveToNewUUID(const OSTContainerReference& container) const;

    // +Replacement
    struct ReplaceOperation;
    [[nodiscard]] static OSTResult<void> _checkReplacement(const OSTReplacement& replacement);
    [[nodiscard]] OSTResult<void> _replaceOrRestore(const OSTReplacement& replacement,
                                                    ReplaceOperation& operation) const;
    [[nodiscard]] OSTResult<void> _replace(const OSTReplacement& replacement, ReplaceOperation& operation) const;
    [[nodiscard]] static OSTResult<OSTMetadataRecord> _containerOfSide(const OSTContainerReference& side);
    [[nodiscard]] static OSTResult<void> _findSides(const OSTReplacement& replacement, ReplaceOperation& operation);
    [[nodiscard]] static OSTResult<void> _checkNothingLives(const ReplaceOperation& operation);
    [[nodiscard]] static OSTResult<void> _parkOldContainer(ReplaceOperation& operation);
    [[nodiscard]] OSTResult<void> _putNewContainerInPlace(const OSTReplacement& replacement,
                                                          ReplaceOperation& operation) const;
    [[nodiscard]] static OSTResult<void> _forgetContainer(const OSTContainerName& name);
    [[nodiscard]] static OSTResult<void> _restoreOldContainer(ReplaceOperation& operation);
    [[nodiscard]] OSTResult<void> _cleanUpReplacement(const OSTReplacement& replacement,
                                                      const ReplaceOperation& operation) const;
    /// Moves the file to death row, or removes it where it is; the latter is a failure all the same.
    [[nodiscard]] OSTResult<void> _discardReplaceFile(const std::string& url, StartPass startDeletionThread) const;
    /// Discards the replace files that earlier replacements left and that speak of a container at or below `place`,
    /// which is about to leave: a later start would take it for one that a replacement lost. The caller holds the
    /// all-identifiers lock or the container's, so that none of these replacements is under way, or is starting up.
    /// Fails with `replaceFileInvalid` or `replaceCleanupFailed`.
    [[nodiscard]] OSTResult<void> _settleReplacementsAt(std::string_view place) const;
    /// The same, but a power cut may bring them back.
    [[nodiscard]] OSTResult<void> _discardReplaceFilesOf(std::string_view place) const;
    [[nodiscard]] OSTResult<void> _recoverFromReplaceOperations() const;
    [[nodiscard]] OSTResult<void> _recoverFromReplaceFile(const std::string& url) const;

    // +Maintenance
    struct PlaceAndUsage {
        std::string url;
        std::optional<OSTItemIdentity> directory = std::nullopt; ///< a bundle's
        std::optional<std::uint64_t> usage = std::nullopt;
    };
    [[nodiscard]] std::expected<void, OSTErrorCode> _checkWipe(const OSTContainerName& name) const;
    [[nodiscard]] std::expected<PlaceAndUsage, OSTErrorCode>
    _placeAndKnownUsage(const OSTContainerReference& container) const;
    void _keepUsage(const OSTContainerReference& container, const PlaceAndUsage& measured) const;

    // +Reboot
    [[nodiscard]] OSTResult<void> _moveTransientDirectoryToDeathRow(const std::string& url) const;
    void _cleanUpMobileUser() const;
    /// Moves to death row what lies in a class directory and is no container.
    void _cleanupOrphanedDataForUser(std::uint32_t userId, OSTContainerClass containerClass) const;

    // +SandboxMapping
    /// Tells the sandbox where the container of an identifier lies, or with no URL that there is none. False, with the
    /// reason in the log, when that failed. Bundle classes are not the sandbox's business.
    static bool _setSandboxContainerMappingForUser(const OSTContainerName& name, std::optional<std::string_view> url);
    /// Tells the sandbox where the live container of the name lies, or that there is none.
    static void _correctSandboxContainerMapping(OSTContainerName name);
    /// Tells the sandbox of the containers that a crash had moved or removed when it was still to be told.
    static void _repairSandboxContainerMappings();

    // +Deletion
    /// Adds the directory out of which a container has gone to `directories`.
    [[nodiscard]] OSTResult<void> _stageForDeletion(const OSTContainerReference& reference,
                                                    std::set<std::string>& directories) const;
    [[nodiscard]] OSTResult<void> _stageContainer(const OSTMetadata& metadata,
                                                  std::set<std::string>& directories) const;
    /// Moves one item to death row with one rename; an item that is already gone is success.
    /// Fails with `moveToDeathRowFailed`.
    [[nodiscard]] OSTResult<void> _moveItemAtURLToDeathRow(const std::string& url, StartPass startDeletionThread) const;
    /// Removes an item, or parks it under /tmp when it cannot be removed; the value is then the removal's error. An
    /// item that cannot be removed at the moment stays, with the same value. Fails with `moveAsideFailed`.
    [[nodiscard]] static OSTResult<std::optional<OSTError>> _removeItemOrMoveToTempAtURL(const std::string& url);
    [[nodiscard]] static std::optional<OSTError> _emptyDeathRow();

    OSTClientIdentity _identity;
};

} // namespace ost
