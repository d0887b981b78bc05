#pragma once

#include "files/OSTKnownFile.h"
#include "model/OSTContainerName.h"
#include "model/OSTMetadata.h"
#include "platform/base/Mutex.h"
#include "platform/base/OSTError.h"

#include <cstdint>
#include <functional>
#include <map>
#include <source_location>
#include <string>
#include <string_view>
#include <unordered_map>
#include <utility>
#include <vector>

namespace ost {

/// Whether a container's place is certain to outlast a power cut.
enum class OSTPlacement : bool { durable, pending };

/// What the cache knows of one container.
struct OSTCacheEntry {
    OSTMetadataRecord record = nullptr;
    OSTPlacement placement = OSTPlacement::durable;
};

/// The metadata records of all containers, by user, class and identifier, so that a look-up does not scan a class
/// directory.
///
/// The table of a user and class is read from disk at its first use and then lives as long as the daemon. Code
/// that makes, moves or deletes a container tells the cache. One record for each identifier: a later one takes the
/// place of an earlier one. Records are shared and never change; a change is a new record, added in place of the old
/// one.
///
/// Threads: any. A mutex guards the tables, the scan of a class directory included; checks on disk of what was found
/// run outside it. An exception inside an operation becomes `exceptionCaught`.
class OSTContainerCache {
public:
    static OSTContainerCache& sharedInstance();

    /// To be called at the start of a process that is not the first one since the device has booted: an earlier one may
    /// have been killed before it had waited for what it wrote in containers.
    void expectChangesOfEarlierProcess();

    /// Finds a container by its identifier. Fails with `invalidCacheInput`, `notFound` (not logged),
    /// `cacheInconsistent` when the container's metadata file has gone from the disk, or `cacheRebuildFailed` when that
    /// or the class directory cannot be looked at. The record stays in any case.
    [[nodiscard]] OSTResult<OSTMetadataRecord> containerForUser(const OSTContainerName& name);
    [[nodiscard]] OSTResult<OSTCacheEntry> entryForUser(const OSTContainerName& name);

    /// Finds the container with that internal UUID, among the live ones first; without a record when there is none.
    /// Fails when that cannot be found out.
    [[nodiscard]] OSTResult<OSTMetadataRecord> containerForUser(const OSTContainerName& name,
                                                                const platform::UUID& uuid);
    [[nodiscard]] OSTResult<OSTCacheEntry> entryForUser(OSTContainerName name, const platform::UUID& uuid);

    /// All containers whose metadata file is on disk; a file that has gone is logged. Fails with `invalidCacheInput` or
    /// `cacheRebuildFailed`.
    [[nodiscard]] OSTResult<std::vector<OSTMetadataRecord>>
    allContainersForUser(std::uint32_t userId, OSTContainerClass contentClass, bool transient);
    [[nodiscard]] OSTResult<std::vector<OSTCacheEntry>>
    allEntriesForUser(std::uint32_t userId, OSTContainerClass contentClass, bool transient);

    /// The identifiers of all containers, without a look at the disk.
    [[nodiscard]] OSTResult<std::vector<std::string>>
    allContainerIdentifiersForUser(std::uint32_t userId, OSTContainerClass contentClass, bool transient);

    /// Holds `metadata` under its name, in place of what is held there. Gives the record as it is held. A place that is
    /// pending stays so until `placementReachedDisk`, even when a later record speaks of the same place.
    /// Fails with `invalidCacheInput` or `cacheRebuildFailed`.
    [[nodiscard]] OSTResult<OSTMetadataRecord> addContainerMetadata(OSTMetadata metadata,
                                                                    OSTPlacement placement = OSTPlacement::durable);
    /// Ends the pending of the place that the record speaks of, unless its name stands for another one by now.
    void placementReachedDisk(const OSTMetadata& metadata);

    /// Forgets a container; one that is not there is no error. Fails with `invalidCacheInput` or `cacheRebuildFailed`.
    [[nodiscard]] OSTResult<void> removeContainerForUser(const OSTContainerName& name);

private:
    struct Held {
        OSTCacheEntry entry;
        OSTKnownFile metadataFile = {};
    };
    /// What is held, by the identifier that its own record owns.
    using ClassTable = std::unordered_map<std::string_view, Held>;
    using ClassKey = std::pair<std::uint32_t, OSTContainerClass>;
    using ClassTables = std::map<ClassKey, ClassTable>;

    /// The table that a name belongs to, read from disk when there is none.
    [[nodiscard]] OSTResult<ClassTable*> _getCacheForUserId(const OSTContainerName& name) OST_REQUIRES(_cacheLock);
    /// The same for the public operations, which report any failure as `cacheRebuildFailed`.
    [[nodiscard]] OSTResult<ClassTable*> _tableForUserId(const OSTContainerName& name, std::source_location where)
        OST_REQUIRES(_cacheLock);
    [[nodiscard]] OSTResult<ClassTable> _readClassDirectory(const std::string& directory, std::uint32_t userId,
                                                            bool transient) const OST_REQUIRES(_cacheLock);
    static void _put(ClassTable& table, OSTCacheEntry entry);
    /// The same for what was found on disk. Of two containers of one name, one whose metadata an application wrote
    /// gives way.
    [[nodiscard]] static OSTResult<void> _putFound(ClassTable& table, OSTMetadataRecord found);
    /// What is held under a name; without a record when there is nothing.
    [[nodiscard]] OSTResult<Held> _heldForUser(const OSTContainerName& name, std::source_location where);
    /// Looks for the metadata file of what is held and remembers what was seen.
    [[nodiscard]] OSTResult<void> _checkOnDisk(const Held& held, std::source_location where);
    void _remember(const OSTMetadataRecord& record, const OSTKnownFile& metadataFile);

    platform::Mutex _cacheLock;
    ClassTables _liveContainerCache OST_GUARDED_BY(_cacheLock);
    ClassTables _transientContainerCache OST_GUARDED_BY(_cacheLock);
    bool _changesOfEarlierProcess OST_GUARDED_BY(_cacheLock) = false;
};

} // namespace ost
