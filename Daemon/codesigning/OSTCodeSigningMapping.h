#pragma once

#include "codesigning/OSTCodeSigningEntry.h"
#include "model/OSTMetadata.h"
#include "platform/base/OSTError.h"
#include "platform/base/OSTValue.h"
#include "platform/threads/WorkQueue.h"
#include "store/OSTLocks.h"

#include <atomic>
#include <concepts>
#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

namespace ost {

/// How an identifier is registered.
struct OSTRegistrationOptions {
    std::uint64_t dataContainerClass = 0;
    std::optional<std::string> parentBundleIdentifier = std::nullopt;
    bool registeredByCaller = false;
    bool placeholder = false;
};

/// The entitlements that list an identifier's groups: the second one counts where the first lists none.
struct OSTGroupKeys {
    const char* key;
    const char* fallbackKey;

    static const OSTGroupKeys application;
    static const OSTGroupKeys system;
};

/// What every identifier is entitled to: one entry for each that the installer or a client registered.
///
/// The shared instance reads the mapping file when it is first used; from then on memory is the authority and the file
/// is only written: whole, atomically, and durable before the change is answered. A file that cannot be read is never
/// overwritten: the mapping is then unavailable, every query answers as for an unknown identifier, and nothing is
/// processed. When the reason is one that passes, the next use reads again.
///
/// Threads: any. All work runs on one serial queue. Operations that may change entries take the all-identifiers write
/// lock first; the order is always the lock, then the queue, where taking a lock stops the process. On disk:
/// "ost_code_signing_info.plist" in the library directory, a dictionary from identifier to serialized entry.
class OSTCodeSigningMapping {
public:
    static OSTCodeSigningMapping& sharedInstance();

    /// Whether the mapping file could be read.
    [[nodiscard]] bool isAvailable();

    /// Whether the identifier has code-signing information, an invalid or placeholder one included.
    [[nodiscard]] bool codeSigningInfoExistForIdentifier(std::string_view identifier);
    [[nodiscard]] bool identifierHasCallerRegisteredEntitlements(std::string_view identifier);
    /// Whether `processCallerRegisteredEntitlements` is to be called for a client, and would change anything: nobody
    /// has registered the identifier, or the client itself did so, with other entitlements. One turn on the queue, and
    /// no lock, for what every request asks.
    [[nodiscard]] bool callerIsToBeRegistered(std::string_view identifier,
                                              const std::shared_ptr<const OSTDictionary>& entitlements);
    [[nodiscard]] bool identifierHasSystemContainer(std::string_view identifier);
    /// The class of the identifier's data container, 0 when none is known.
    [[nodiscard]] std::uint64_t dataContainerTypeForIdentifier(std::string_view identifier);
    /// The identifier's groups, each once; none when there are none or the entitlement is malformed, which is logged.
    [[nodiscard]] std::optional<std::vector<std::string>> appGroupIdentifiersForIdentifier(std::string_view identifier);
    [[nodiscard]] std::optional<std::vector<std::string>>
    systemGroupIdentifiersForIdentifier(std::string_view identifier);
    /// The identifier's code-signing information as a request from outside sees it.
    [[nodiscard]] std::shared_ptr<const OSTDictionary> getCodeSigningInfoForIdentifier(std::string_view identifier);

    /// Registers code-signing information, or with none removes the identifier. Fails with `noIdentifier`,
    /// `mappingWriteFailed` (memory keeps the change), `exceptionCaught`, or `noProcessingResult` when the mapping is
    /// unavailable.
    [[nodiscard]] std::expected<void, OSTErrorCode>
    processCodeSigningInfo(const std::shared_ptr<const OSTDictionary>& info, std::optional<std::string_view> identifier,
                           const OSTRegistrationOptions& options);
    /// Registers the entitlements that a client carries. Codes as above.
    [[nodiscard]] std::expected<void, OSTErrorCode>
    processCallerRegisteredEntitlements(std::shared_ptr<const OSTDictionary> entitlements,
                                        std::optional<std::string_view> identifier);

    /// Marks every entry invalid that the installer registered and whose application has no bundle container.
    /// Fails with `mappingWriteFailed`, or `noProcessingResult` when the mapping is unavailable.
    [[nodiscard]] std::expected<void, OSTErrorCode> invalidateCodeSigningInfoForAppsWithoutBundleContainer();

    /// Groups of an identifier, each once, as its entitlements hold them.
    using GroupViews = std::vector<std::string_view>;
    /// Calls `block`, on the mapping's queue, with the groups of every identifier, or with null where they are absent.
    /// They are there for the call alone. From work that runs on the queue already, too.
    void
    iterateGroupIdsWithKey(const OSTGroupKeys& keys,
                           const std::function<void(const std::string& identifier, const GroupViews* groups)>& block);

    /// Removes the entries of an identifier and of its children, and writes the mapping. Failures are logged. The
    /// caller holds the all-identifiers lock for writing.
    void removeCodeSigningDictionariesForIdentifierAndItsChildren(std::string_view identifier);

    /// Marks the entries of an identifier and of its children invalid and writes the mapping, also when there are none.
    /// Fails with `mappingWriteFailed`.
    [[nodiscard]] OSTResult<void> invalidateCodeSigningInfoForIdentifierAndItsChildren(std::string_view identifier);

    /// Moves into the mapping what older releases kept elsewhere, then removes application group containers that nobody
    /// references. A valid entry is never overwritten. Takes the all-identifiers lock for writing. Failures are logged;
    /// what fails is tried again the next time.
    void performAllCodeSigningMigrationAndReconciliation();

    using EntryRecord = std::shared_ptr<const OSTCodeSigningEntry>;

    /// The entries of an identifier and of its children as they are now.
    [[nodiscard]] std::vector<std::pair<std::string, EntryRecord>>
    entriesOfIdentifierAndItsChildren(std::string_view identifier);
    /// Puts entries back and writes the mapping; a failure is logged.
    void restoreEntries(const std::vector<std::pair<std::string, EntryRecord>>& entries);

private:
    using Entries = std::map<std::string, EntryRecord, std::less<>>;
    enum class Request : bool { internal, external };

    OSTCodeSigningMapping() {
        _sync([] {});
    }

    /// Runs work on the queue, when the file has been read or cannot be.
    template<std::invocable Work>
    std::invoke_result_t<Work> _sync(Work&& work) {
        return _codeSignQueue.sync([&] {
            const OSTNoFurtherLocks noFurtherLocks;
            if (_reading == Reading::pending)
                _readWhenPossible();
            return std::invoke(std::forward<Work>(work));
        });
    }
    void _readWhenPossible();

    [[nodiscard]] static std::string _mappingFileURL();
    [[nodiscard]] OSTResult<void> _readCodeSigningMappingFromDisk();
    [[nodiscard]] OSTResult<void> _writeCodeSigningMappingToDisk();
    /// Stores entries under identifiers, matched by index, and writes the mapping if that changed anything. An entry
    /// that is null or has no information removes its identifier. Fails with `countsDiffer` or `mappingWriteFailed`.
    [[nodiscard]] OSTResult<void> _setCodeSigningDictionaryValues(const std::vector<EntryRecord>& entries,
                                                                  const std::vector<std::string>& identifiers);
    using GroupList = std::optional<std::vector<std::string>>;
    /// Puts the groups that the entitlements list under a key into `groups`. False when they are absent.
    static bool _copyApplicationGroupEntitlementForIdentifier(std::string_view identifier,
                                                              const OSTDictionary* entitlements, const char* groupKey,
                                                              GroupViews& groups);
    /// The same with the first key, or where that lists none with the second.
    static bool _findGroups(std::string_view identifier, const OSTDictionary* entitlements, const OSTGroupKeys& keys,
                            GroupViews& groups);
    [[nodiscard]] static GroupList _groupList(std::string_view identifier, const OSTDictionary* entitlements,
                                              const OSTGroupKeys& keys);

    // On the queue only
    [[nodiscard]] EntryRecord _entry(std::string_view identifier) const;
    [[nodiscard]] EntryRecord _onQueue_codeSigningInfoForIdentifier(std::string_view identifier, Request request);
    /// The identifier's children in order, then the identifier itself.
    [[nodiscard]] std::vector<std::string> _childrenAndIdentifier(std::string_view identifier) const;
    /// Replaces an identifier's entry in memory.
    void _storeEntry(const std::string& identifier, OSTCodeSigningEntry entry);
    [[nodiscard]] EntryRecord _migrateFromBundleContainer(std::string_view identifier);
    [[nodiscard]] bool _onQueue_identifierHasSystemContainer(std::string_view identifier);
    [[nodiscard]] bool _hasBundleContainer(std::string_view identifier) const;
    [[nodiscard]] GroupList _onQueue_appGroupIdentifiersForIdentifier(std::string_view identifier);
    [[nodiscard]] GroupList _onQueue_systemGroupIdentifiersForIdentifier(std::string_view identifier);
    /// The same, with an exception as an error.
    [[nodiscard]] OSTResult<void> _onQueue_processCodeSigningInfo(const std::shared_ptr<const OSTDictionary>& info,
                                                                  std::string_view identifier,
                                                                  const OSTRegistrationOptions& options);
    [[nodiscard]] OSTResult<void> _process(const std::shared_ptr<const OSTDictionary>& info,
                                           std::string_view identifier, const OSTRegistrationOptions& options);
    struct Batch;
    void _linkToParent(std::string_view identifier, const std::string& parent, Batch& batch);
    void _releaseSystemContainer(std::string_view identifier, const OSTDictionary* newEntitlements);
    void _releaseGroups(std::string_view identifier, const OSTDictionary* newEntitlements);

    // +Migration: each tells whether all of it is done.
    [[nodiscard]] bool _migrateAppGroupIdsFromDataContainersToFile();
    [[nodiscard]] bool _migrateDataFromLegacyEntitlementsFileToCodeSigningFile();
    [[nodiscard]] bool _migrateCachedCodeSigningInfoFromBundleContainersToMapping();
    /// Calls `storeEntries` on the queue and writes the mapping if it tells that it stored any.
    [[nodiscard]] OSTResult<void> _storeMigrated(const std::function<bool()>& storeEntries);
    // +Migration, on the queue only; the first two tell whether they stored an entry.
    [[nodiscard]] bool _migrateGroupIds(const OSTMetadata& container, const OSTValue& groupIds);
    [[nodiscard]] bool _migrateCachedInfo(const OSTMetadata& bundle, const OSTDictionary& cached);
    [[nodiscard]] bool _hasValidEntry(std::string_view identifier) const;

    platform::WorkQueue _codeSignQueue{"com.tamarok.Ostrand.EntitlementQueue"};
    enum class Reading : std::uint8_t { pending, done, failed };
    std::atomic<Reading> _reading = Reading::pending; ///< changes on the queue only, and from `pending` only
    // On the queue only.
    Entries _codeSigningMappingDict;
    /// The last write failed: the next registration writes even if it changes nothing, because it is answered.
    bool _unwritten = false;
    /// What the file holds under identifiers but is no entry: kept and written back until the identifier is registered.
    std::map<std::string, OSTValue, std::less<>> _unreadableEntries;
};

} // namespace ost
