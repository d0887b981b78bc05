#include "store/OSTContainerCache.h"

#include "files/OSTDictionaryFile.h"
#include "files/OSTFileManager.h"
#include "model/OSTFailureReport.h"
#include "model/OSTGlobalConfiguration.h"
#include "platform/base/Log.h"
#include "platform/base/Path.h"
#include "platform/base/Unicode.h"
#include "platform/threads/BlockingSection.h"

#include <cerrno>
#include <cstring>
#include <future>
#include <system_error>
#include <thread>

namespace ost {

using platform::pathByAppending;

namespace {

std::string_view suffix(bool transient) { return transient ? "(transient)" : ""; }

/// A scan of a large class directory holds the mutex for long; a listener's worker that waits for it lets others be
/// served.
std::unique_lock<std::mutex> lockCache(std::mutex& mutex) {
    std::unique_lock lock(mutex, std::try_to_lock);
    if (!lock) {
        const platform::BlockingSection blocking;
        lock.lock();
    }
    return lock;
}

OSTError invalidContentClass(OSTContainerClass contentClass, std::source_location where) {
    return OSTCreateErrorAt(where, OSTErrorCode::invalidCacheInput, nullptr, "Invalid Content Class: %ld",
                            contentClass);
}

/// Checks a record that the cache holds against the disk.
OSTResult<void> checkOnDisk(const OSTMetadata& record, bool transient, std::source_location where) {
    const auto className = pathComponentForContainerClass(record.containerClass);
    if (record.url.empty())
        return std::unexpected(OSTCreateErrorAt(where, OSTErrorCode::invalidCacheInput, nullptr,
                                                "Cache: %@%@: Invalid URL path string: %@", className,
                                                suffix(transient), record.url));
    const auto metadataFile = record.metadataFileURL();
    if (!OSTFileManager::defaultManager().itemExistsAtURL(metadataFile))
        return std::unexpected(OSTCreateErrorAt(where, OSTErrorCode::cacheInconsistent, nullptr,
                                                "Cache: %@%@: INCONSISTENT-No Metadata at: %@", className,
                                                suffix(transient), metadataFile));
    return {};
}

/// The record of an item of a class directory; null, with the reason in the log, when the item is no valid container.
OSTMetadataRecord readItem(int open, const std::string& directory, const std::string& name, std::uint32_t userId,
                           bool transient, std::string& buffer) {
    if (!platform::isValidText(name)) { // no answer could hold its path
        platform::logError("Skipping %@ in %@, whose name is not UTF-8", name, directory);
        return nullptr;
    }
    const auto url = pathByAppending(directory, name);
    const auto read = OSTFileManager::defaultManager().readFile(open, pathByAppending(name, OSTMetadataFileName),
                                                                OSTSmallDictionaryFileSize, buffer);
    auto metadata = OSTMetadata::readAndValidateMetadataAtUrl(
        read ? OSTResult<std::string_view>(buffer)
             : std::unexpected(
                   OSTCreatePOSIXError(read.error(), "read of %@ failed: %s", url, std::strerror(read.error()))),
        url, userId, OSTCheckClassPath::yes);
    if (!metadata)
        return nullptr;
    metadata->transient = transient;
    return std::make_shared<const OSTMetadata>(*std::move(metadata));
}

/// Below that many items, starting a thread takes longer than it saves.
constexpr std::size_t itemsWorthAThread = 512;

/// Work on the items from one index to before another.
using WorkOnItems = std::function<void(std::size_t first, std::size_t last)>;

/// Starts the work on a thread of its own, or gives nothing when no thread is to be had.
std::future<void> startAside(const WorkOnItems& work, std::size_t first, std::size_t last) {
    try {
        return std::async(std::launch::async, work, first, last);
    } catch (const std::system_error&) {
        return {};
    }
}

/// Calls `work` for two halves of `count` items, side by side where that is worth it.
void inTwoHalves(std::size_t count, const WorkOnItems& work) {
    const auto middle = count / 2;
    auto secondHalf = count >= itemsWorthAThread && std::thread::hardware_concurrency() > 1
                          ? startAside(work, middle, count)
                          : std::future<void>();
    work(0, secondHalf.valid() ? middle : count);
    if (secondHalf.valid())
        secondHalf.get();
}

} // namespace

OSTContainerCache& OSTContainerCache::sharedInstance() {
    // Never destroyed: workers may still ask while the process ends.
    static OSTContainerCache& cache = *new OSTContainerCache;
    return cache;
}

OSTResult<OSTMetadataRecord> OSTContainerCache::containerForUser(std::uint32_t userId, OSTContainerClass contentClass,
                                                                 std::string_view identifier, bool transient) {
    const auto here = std::source_location::current();
    return OSTGuarded([&]() -> OSTResult<OSTMetadataRecord> {
        if (!isValidContainerClass(contentClass))
            return std::unexpected(invalidContentClass(contentClass, here));
        const auto className = pathComponentForContainerClass(contentClass);
        OSTMetadataRecord record;
        {
            const auto lock = lockCache(_cacheLock);
            const ClassTable* const table = OST_TRY(_tableForUserId(userId, contentClass, transient, here));
            if (const auto found = table->find(identifier); found != table->end())
                record = *found;
        }
        if (!record)
            return std::unexpected(OSTCreateError(OSTErrorCode::notFound, OSTLogging::silent, nullptr,
                                                  "Cache: %@%@: Container Not Found with ID: %@", className,
                                                  suffix(transient), identifier));
        OST_TRY(checkOnDisk(*record, transient, here));
        platform::logDebug("Cache: %@%@: Found Identifier: %@", className, suffix(transient), identifier);
        return record;
    });
}

OSTMetadataRecord OSTContainerCache::containerForUser(std::uint32_t userId, OSTContainerClass contentClass,
                                                      std::string_view identifier, const platform::UUID& uuid) {
    for (const bool transient : {false, true}) {
        auto found = containerForUser(userId, contentClass, identifier, transient);
        if (found && (*found)->uuid == uuid)
            return *std::move(found);
    }
    return nullptr;
}

OSTResult<std::vector<OSTMetadataRecord>>
OSTContainerCache::allContainersForUser(std::uint32_t userId, OSTContainerClass contentClass, bool transient) {
    const auto here = std::source_location::current();
    return OSTGuarded([&]() -> OSTResult<std::vector<OSTMetadataRecord>> {
        if (!isValidContainerClass(contentClass))
            return std::unexpected(invalidContentClass(contentClass, here));
        std::vector<OSTMetadataRecord> records;
        {
            const auto lock = lockCache(_cacheLock);
            const ClassTable* const table = OST_TRY(_tableForUserId(userId, contentClass, transient, here));
            records.assign(table->begin(), table->end());
        }
        std::erase_if(records, [&](const OSTMetadataRecord& record) {
            if (!checkOnDisk(*record, transient, here))
                return true;
            platform::logDebug("Cache: %@%@: ALL Found Identifier: %@", pathComponentForContainerClass(contentClass),
                               suffix(transient), record->identifier);
            return false;
        });
        return records;
    });
}

OSTResult<std::vector<std::string>> OSTContainerCache::allContainerIdentifiersForUser(std::uint32_t userId,
                                                                                      OSTContainerClass contentClass,
                                                                                      bool transient) {
    const auto here = std::source_location::current();
    return OSTGuarded([&]() -> OSTResult<std::vector<std::string>> {
        if (!isValidContainerClass(contentClass))
            return std::unexpected(invalidContentClass(contentClass, here));
        const auto lock = lockCache(_cacheLock);
        const ClassTable* const table = OST_TRY(_tableForUserId(userId, contentClass, transient, here));
        std::vector<std::string> identifiers;
        identifiers.reserve(table->size());
        for (const auto& record : *table)
            identifiers.push_back(record->identifier);
        return identifiers;
    });
}

OSTResult<OSTMetadataRecord> OSTContainerCache::addContainerMetadata(OSTMetadata metadata, std::uint32_t userId,
                                                                     std::string_view url, bool transient) {
    const auto here = std::source_location::current();
    return OSTGuarded([&]() -> OSTResult<OSTMetadataRecord> {
        const auto contentClass = metadata.containerClass;
        if (!isValidContainerClass(contentClass))
            return std::unexpected(
                OSTCreateError(OSTErrorCode::invalidCacheInput, "Invalid Metadata Content Class: %lld", contentClass));
        if (url.empty())
            return std::unexpected(OSTCreateError(OSTErrorCode::invalidCacheInput, "Invalid input: URL: %@", url));
        metadata.url = url;
        metadata.transient = transient;
        auto record = std::make_shared<const OSTMetadata>(std::move(metadata));
        {
            const auto lock = lockCache(_cacheLock);
            ClassTable* const table = OST_TRY(_tableForUserId(userId, contentClass, transient, here));
            _put(*table, record);
        }
        platform::logDebug("Cache: %@%@: Added Identifier: %@", pathComponentForContainerClass(contentClass),
                           suffix(transient), record->identifier);
        return record;
    });
}

OSTResult<void> OSTContainerCache::removeContainerForUser(std::uint32_t userId, OSTContainerClass contentClass,
                                                          std::string_view identifier, bool transient) {
    const auto here = std::source_location::current();
    return OSTGuarded([&]() -> OSTResult<void> {
        if (!isValidContainerClass(contentClass))
            return std::unexpected(invalidContentClass(contentClass, here));
        {
            const auto lock = lockCache(_cacheLock);
            ClassTable* const table = OST_TRY(_tableForUserId(userId, contentClass, transient, here));
            if (const auto found = table->find(identifier); found != table->end())
                table->erase(found);
        }
        platform::logDebug("Cache: %@%@: Removed Identifier: %@", pathComponentForContainerClass(contentClass),
                           suffix(transient), identifier);
        return {};
    });
}

OSTResult<OSTContainerCache::ClassTable*> OSTContainerCache::_tableForUserId(std::uint32_t userId,
                                                                             OSTContainerClass contentClass,
                                                                             bool transient,
                                                                             std::source_location where) {
    auto table = _getCacheForUserId(userId, contentClass, transient);
    if (!table)
        return std::unexpected(OSTCreateErrorAt(where, OSTErrorCode::cacheRebuildFailed, &table.error(),
                                                "Cache: %u-%@%@: Failed to rebuild", userId,
                                                pathComponentForContainerClass(contentClass), suffix(transient)));
    return table;
}

OSTResult<OSTContainerCache::ClassTable*>
OSTContainerCache::_getCacheForUserId(std::uint32_t userId, OSTContainerClass contentClass, bool transient) {
    if (!OSTUserIdFitsClass(contentClass, userId))
        return std::unexpected(OSTCreateError(OSTErrorCode::invalidCacheInput,
                                              "Invalid cache get-userId %u for class %ld", userId, contentClass));
    const ClassKey key{userId, contentClass};
    ClassTables& tables = transient ? _transientContainerCache : _liveContainerCache;
    if (const auto found = tables.find(key); found != tables.end())
        return &found->second;

    platform::logDebug("Rebuilding container class cache: %u-%@%@", userId,
                       pathComponentForContainerClass(contentClass), suffix(transient));
    const auto directory =
        OSTGlobalConfiguration::sharedInstance().containerDirectoryURLForUser(userId, contentClass, transient);
    if (!directory)
        return std::unexpected(OSTCreatePOSIXError(ENOENT, "User %u has no container directories", userId));
    return &tables.emplace(key, OST_TRY(_readClassDirectory(*directory, userId, transient))).first->second;
}

OSTResult<OSTContainerCache::ClassTable> OSTContainerCache::_readClassDirectory(const std::string& directory,
                                                                                std::uint32_t userId, bool transient) {
    const auto& files = OSTFileManager::defaultManager();
    const auto items = OST_TRY(files.urlsForItemsInDirectoryAtURL(directory));
    const auto open = OST_TRY(files.openDirectoryAtURL(directory));
    std::vector<OSTMetadataRecord> records(items.size());
    const auto read = [&](std::size_t first, std::size_t last) {
        std::string buffer;
        for (; first < last; ++first)
            records[first] = readItem(open.get(), directory, items[first].name, userId, transient, buffer);
    };
    inTwoHalves(items.size(), read);

    ClassTable table;
    table.reserve(items.size());
    for (auto& record : records)
        if (record)
            _put(table, std::move(record));
    return table;
}

void OSTContainerCache::_put(ClassTable& table, OSTMetadataRecord record) {
    if (const auto old = table.find(record); old != table.end())
        table.erase(old);
    table.insert(std::move(record));
}

} // namespace ost
