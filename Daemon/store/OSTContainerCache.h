#pragma once

#include "model/OSTContainerClass.h"
#include "model/OSTMetadata.h"
#include "platform/base/OSTError.h"

#include <cstdint>
#include <functional>
#include <map>
#include <mutex>
#include <source_location>
#include <string>
#include <string_view>
#include <unordered_set>
#include <utility>
#include <vector>

namespace ost {

/// The metadata records of all containers, by user, class and identifier, so that a look-up does not scan a class
/// directory.
///
/// The table of a user and class is read from disk at its first use and then lives as long as the daemon; whoever
/// makes, moves or deletes a container tells the cache. One record for each identifier: a later one takes the place of
/// an earlier one. Records are shared and never change; a change is a new record, added in place of the old one.
///
/// Threads: any. A mutex guards the tables, the scan of a class directory included; checks on disk of what was found
/// run outside it. An exception inside an operation becomes `exceptionCaught`.
class OSTContainerCache {
public:
    static OSTContainerCache& sharedInstance();

    /// Finds a container by its identifier. Fails with `invalidCacheInput`, `cacheRebuildFailed`, `notFound` (not
    /// logged), or `cacheInconsistent` when the container's metadata file has gone from the disk; the record then
    /// stays.
    [[nodiscard]] OSTResult<OSTMetadataRecord> containerForUser(std::uint32_t userId, OSTContainerClass contentClass,
                                                                std::string_view identifier, bool transient);

    /// Finds the container with that internal UUID, among the live ones first; null when neither table has it.
    [[nodiscard]] OSTMetadataRecord containerForUser(std::uint32_t userId, OSTContainerClass contentClass,
                                                     std::string_view identifier, const platform::UUID& uuid);

    /// All containers whose metadata file is on disk; the errors of others are logged and not returned.
    [[nodiscard]] OSTResult<std::vector<OSTMetadataRecord>>
    allContainersForUser(std::uint32_t userId, OSTContainerClass contentClass, bool transient);

    /// The identifiers of all containers, without a look at the disk.
    [[nodiscard]] OSTResult<std::vector<std::string>>
    allContainerIdentifiersForUser(std::uint32_t userId, OSTContainerClass contentClass, bool transient);

    /// Puts `metadata`, found at `url` from now on, into the table of the user and the record's class. Gives the record
    /// as it is held. Fails with `invalidCacheInput` or `cacheRebuildFailed`.
    [[nodiscard]] OSTResult<OSTMetadataRecord> addContainerMetadata(OSTMetadata metadata, std::uint32_t userId,
                                                                    std::string_view url, bool transient);

    /// Forgets a container; one that is not there is no error. Fails with `invalidCacheInput` or `cacheRebuildFailed`.
    [[nodiscard]] OSTResult<void> removeContainerForUser(std::uint32_t userId, OSTContainerClass contentClass,
                                                         std::string_view identifier, bool transient);

private:
    /// Hashes and compares records by identifier, and finds them by a plain string.
    struct ByIdentifier {
        using is_transparent = void;
        static std::string_view key(std::string_view identifier) { return identifier; }
        static std::string_view key(const OSTMetadataRecord& record) { return record->identifier; }
        std::size_t operator()(const auto& value) const { return std::hash<std::string_view>{}(key(value)); }
        bool operator()(const auto& a, const auto& b) const { return key(a) == key(b); }
    };
    using ClassTable = std::unordered_set<OSTMetadataRecord, ByIdentifier, ByIdentifier>;
    using ClassKey = std::pair<std::uint32_t, OSTContainerClass>;
    using ClassTables = std::map<ClassKey, ClassTable>;

    /// The table of a user and class, read from disk when there is none. Call with the mutex held.
    [[nodiscard]] OSTResult<ClassTable*> _getCacheForUserId(std::uint32_t userId, OSTContainerClass contentClass,
                                                            bool transient);
    /// The same for the public operations, which report any failure as `cacheRebuildFailed`.
    [[nodiscard]] OSTResult<ClassTable*> _tableForUserId(std::uint32_t userId, OSTContainerClass contentClass,
                                                         bool transient, std::source_location where);
    [[nodiscard]] static OSTResult<ClassTable> _readClassDirectory(const std::string& directory, std::uint32_t userId,
                                                                   bool transient);
    static void _put(ClassTable& table, OSTMetadataRecord record);

    std::mutex _cacheLock;
    // Guarded by _cacheLock.
    ClassTables _liveContainerCache;
    ClassTables _transientContainerCache;
};

} // namespace ost
