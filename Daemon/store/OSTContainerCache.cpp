#include "store/OSTContainerCache.h"

#include "files/OSTDictionaryFile.h"
#include "files/OSTFileManager.h"
#include "model/OSTFailureReport.h"
#include "model/OSTGlobalConfiguration.h"
#include "platform/base/Immortal.h"
#include "platform/base/Log.h"
#include "platform/base/PassingReason.h"
#include "platform/base/Path.h"
#include "platform/base/Unicode.h"
#include "platform/threads/BlockingSection.h"
#include "store/OSTSandboxItems.h"

#include <cerrno>
#include <future>
#include <ranges>
#include <system_error>
#include <thread>

namespace ost {

using platform::pathByAppending;

namespace {

std::string_view suffix(bool transient) { return transient ? "(transient)" : ""; }

/// A scan of a large class directory holds the mutex for long; a listener's worker that waits for it lets others be
/// served.
class OST_SCOPED_CAPABILITY CacheLock {
public:
    explicit CacheLock(platform::Mutex& mutex) OST_ACQUIRE(mutex) : _mutex(mutex) {
        if (_mutex.try_lock())
            return;
        const platform::BlockingSection blocking(platform::BlockingSection::Turn::keep);
        _mutex.lock();
    }
    CacheLock(const CacheLock&) = delete;
    CacheLock& operator=(const CacheLock&) = delete;
    ~CacheLock() OST_RELEASE() { _mutex.unlock(); }

private:
    platform::Mutex& _mutex;
};

OSTError invalidContentClass(OSTContainerClass contentClass, std::source_location where) {
    return OSTCreateErrorAt(where, OSTErrorCode::invalidCacheInput, nullptr, "Invalid Content Class: %ld",
                            contentClass);
}

OSTResult<void> checkName(const OSTContainerName& name, std::source_location where) {
    if (!isValidContainerClass(name.containerClass))
        return std::unexpected(invalidContentClass(name.containerClass, where));
    if (!name.identifier)
        return std::unexpected(OSTCreateErrorAt(where, OSTErrorCode::invalidCacheInput, nullptr,
                                                "Invalid identifier: %@", name.identifier));
    return {};
}

/// Whether a look-up failed because there is no such container, and not because nobody could tell.
bool saysThereIsNone(const OSTError& error) {
    const auto& cause = error.underlyingError();
    return error.is(OSTErrorCode::notFound) || error.is(OSTErrorCode::cacheInconsistent) ||
           error.is(OSTErrorCode::invalidCacheInput) || (cause && cause->is(OSTErrorCode::invalidCacheInput)) ||
           platform::isAbsence(error);
}

/// The record of an item of a class directory; null, with the reason in the log, when the item is no valid container.
/// Fails when that cannot be found out.
OSTResult<OSTMetadataRecord> readItem(int open, const std::string& directory, const std::string& name,
                                      std::uint32_t userId, bool transient, std::string& buffer) {
    if (!platform::isValidText(name)) { // no answer could hold its path
        platform::logError("Skipping %@ in %@, whose name is not UTF-8", name, directory);
        return nullptr;
    }
    const auto url = pathByAppending(directory, name);
    const auto read = OSTFileManager::defaultManager().readFile(open, pathByAppending(name, OSTMetadataFileName),
                                                                OSTSmallDictionaryFileSize, buffer);
    auto metadata = OSTMetadata::readAndValidateMetadataAtUrl(
        read ? OSTResult<std::string_view>(buffer)
             : std::unexpected(OSTCreatePOSIXError(read.error(), "read of %@ failed: %s", url, read.error())),
        url, userId, OSTCheckClassPath::yes);
    if (!metadata && platform::isReasonThatPasses(metadata.error()))
        return std::unexpected(metadata.error());
    if (!metadata)
        return nullptr;
    metadata->transient = transient;
    return std::make_shared<const OSTMetadata>(*std::move(metadata));
}

/// Whether the metadata is the daemon's. An application can put another file in the place of its container's, but not
/// give it to root.
OSTResult<bool> isGenuine(const OSTMetadata& metadata) {
    const auto owner = OSTFileManager::defaultManager().ownerOfItemAtURL(metadata.metadataFileURL());
    if (!owner && platform::isReasonThatPasses(owner.error()))
        return std::unexpected(owner.error());
    return owner == OSTRootUserId;
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
    static platform::Immortal cache([] { return OSTContainerCache(); });
    return *cache;
}

void OSTContainerCache::expectChangesOfEarlierProcess() {
    const CacheLock lock(_cacheLock);
    _changesOfEarlierProcess = true;
}

OSTResult<OSTMetadataRecord> OSTContainerCache::containerForUser(const OSTContainerName& name) {
    return OST_TRY(entryForUser(name)).record;
}

OSTResult<OSTCacheEntry> OSTContainerCache::entryForUser(const OSTContainerName& name) {
    const auto here = std::source_location::current();
    return OSTGuarded([&]() -> OSTResult<OSTCacheEntry> {
        OST_TRY(checkName(name, here));
        const auto className = pathComponentForContainerClass(name.containerClass);
        auto held = OST_TRY(_heldForUser(name, here));
        if (!held.entry.record)
            return std::unexpected(OSTCreateError(OSTErrorCode::notFound, OSTLogging::silent, nullptr,
                                                  "Cache: %@%@: Container Not Found with ID: %@", className,
                                                  suffix(name.transient), name.identifier));
        OST_TRY(_checkOnDisk(held, here));
        platform::logDebug("Cache: %@%@: Found Identifier: %@", className, suffix(name.transient), name.identifier);
        return std::move(held.entry);
    });
}

OSTResult<OSTContainerCache::Held> OSTContainerCache::_heldForUser(const OSTContainerName& name,
                                                                   std::source_location where) {
    const CacheLock lock(_cacheLock);
    const ClassTable* const table = OST_TRY(_tableForUserId(name, where));
    const auto found = table->find(*name.identifier);
    return found == table->end() ? Held() : found->second;
}

OSTResult<void> OSTContainerCache::_checkOnDisk(const Held& held, std::source_location where) {
    const auto& record = *held.entry.record;
    const auto className = pathComponentForContainerClass(record.containerClass);
    if (record.url.empty())
        return std::unexpected(OSTCreateErrorAt(where, OSTErrorCode::invalidCacheInput, nullptr,
                                                "Cache: %@%@: Invalid URL path string: %@", className,
                                                suffix(record.transient), record.url));
    auto metadataFile = held.metadataFile;
    const auto exists = metadataFile.look(record.url, OSTMetadataFileName.data());
    if (!exists) {
        const auto cause = OSTCreatePOSIXError(exists.error(), "look at %@ failed: %s", record.url, exists.error());
        return std::unexpected(OSTCreateErrorAt(where, OSTErrorCode::cacheRebuildFailed, &cause,
                                                "Cache: %@%@: Failed to look for metadata at: %@", className,
                                                suffix(record.transient), record.metadataFileURL()));
    }
    if (!*exists)
        return std::unexpected(OSTCreateErrorAt(where, OSTErrorCode::cacheInconsistent, nullptr,
                                                "Cache: %@%@: INCONSISTENT-No Metadata at: %@", className,
                                                suffix(record.transient), record.metadataFileURL()));
    if (metadataFile != held.metadataFile)
        _remember(held.entry.record, metadataFile);
    return {};
}

void OSTContainerCache::_remember(const OSTMetadataRecord& record, const OSTKnownFile& metadataFile) {
    const CacheLock lock(_cacheLock);
    const auto table = _getCacheForUserId(record->name());
    if (!table)
        return;
    const auto found = (*table)->find(record->identifier);
    if (found != (*table)->end() && found->second.entry.record == record)
        found->second.metadataFile = metadataFile;
}

OSTResult<OSTMetadataRecord> OSTContainerCache::containerForUser(const OSTContainerName& name,
                                                                 const platform::UUID& uuid) {
    return OST_TRY(entryForUser(name, uuid)).record;
}

OSTResult<OSTCacheEntry> OSTContainerCache::entryForUser(OSTContainerName name, const platform::UUID& uuid) {
    for (const bool transient : {false, true}) {
        name.transient = transient;
        auto found = entryForUser(name);
        if (found ? found->record->uuid == uuid : !saysThereIsNone(found.error()))
            return found;
    }
    return OSTCacheEntry();
}

OSTResult<std::vector<OSTMetadataRecord>>
OSTContainerCache::allContainersForUser(std::uint32_t userId, OSTContainerClass contentClass, bool transient) {
    std::vector<OSTMetadataRecord> records;
    for (auto& entry : OST_TRY(allEntriesForUser(userId, contentClass, transient)))
        records.push_back(std::move(entry.record));
    return records;
}

OSTResult<std::vector<OSTCacheEntry>>
OSTContainerCache::allEntriesForUser(std::uint32_t userId, OSTContainerClass contentClass, bool transient) {
    const auto here = std::source_location::current();
    return OSTGuarded([&]() -> OSTResult<std::vector<OSTCacheEntry>> {
        if (!isValidContainerClass(contentClass))
            return std::unexpected(invalidContentClass(contentClass, here));
        std::vector<Held> all;
        {
            const CacheLock lock(_cacheLock);
            const ClassTable* const table = OST_TRY(
                _tableForUserId({.userId = userId, .containerClass = contentClass, .transient = transient}, here));
            const auto values = *table | std::views::values;
            all.assign(values.begin(), values.end());
        }
        std::vector<OSTCacheEntry> entries;
        entries.reserve(all.size());
        for (auto& held : all) {
            const auto checked = _checkOnDisk(held, here);
            if (!checked && !saysThereIsNone(checked.error()))
                return std::unexpected(checked.error());
            if (!checked)
                continue;
            platform::logDebug("Cache: %@%@: ALL Found Identifier: %@", pathComponentForContainerClass(contentClass),
                               suffix(transient), held.entry.record->identifier);
            entries.push_back(std::move(held.entry));
        }
        return entries;
    });
}

OSTResult<std::vector<std::string>> OSTContainerCache::allContainerIdentifiersForUser(std::uint32_t userId,
                                                                                      OSTContainerClass contentClass,
                                                                                      bool transient) {
    const auto here = std::source_location::current();
    return OSTGuarded([&]() -> OSTResult<std::vector<std::string>> {
        if (!isValidContainerClass(contentClass))
            return std::unexpected(invalidContentClass(contentClass, here));
        const CacheLock lock(_cacheLock);
        const ClassTable* const table =
            OST_TRY(_tableForUserId({.userId = userId, .containerClass = contentClass, .transient = transient}, here));
        std::vector<std::string> identifiers;
        identifiers.reserve(table->size());
        for (const auto identifier : *table | std::views::keys)
            identifiers.emplace_back(identifier);
        return identifiers;
    });
}

OSTResult<OSTMetadataRecord> OSTContainerCache::addContainerMetadata(OSTMetadata metadata, OSTPlacement placement) {
    const auto here = std::source_location::current();
    return OSTGuarded([&]() -> OSTResult<OSTMetadataRecord> {
        const auto contentClass = metadata.containerClass;
        if (!isValidContainerClass(contentClass))
            return std::unexpected(
                OSTCreateError(OSTErrorCode::invalidCacheInput, "Invalid Metadata Content Class: %lld", contentClass));
        if (metadata.url.empty())
            return std::unexpected(
                OSTCreateError(OSTErrorCode::invalidCacheInput, "Invalid input: URL: %@", metadata.url));
        auto record = std::make_shared<const OSTMetadata>(std::move(metadata));
        {
            const CacheLock lock(_cacheLock);
            ClassTable* const table = OST_TRY(_tableForUserId(record->name(), here));
            _put(*table, {record, placement});
        }
        platform::logDebug("Cache: %@%@: Added Identifier: %@", pathComponentForContainerClass(contentClass),
                           suffix(record->transient), record->identifier);
        return record;
    });
}

void OSTContainerCache::placementReachedDisk(const OSTMetadata& metadata) {
    const CacheLock lock(_cacheLock);
    const auto table = _getCacheForUserId(metadata.name());
    if (!table)
        return;
    const auto found = (*table)->find(metadata.identifier);
    if (found != (*table)->end() && found->second.entry.record->url == metadata.url)
        found->second.entry.placement = OSTPlacement::durable;
}

OSTResult<void> OSTContainerCache::removeContainerForUser(const OSTContainerName& name) {
    const auto here = std::source_location::current();
    return OSTGuarded([&]() -> OSTResult<void> {
        OST_TRY(checkName(name, here));
        {
            const CacheLock lock(_cacheLock);
            ClassTable* const table = OST_TRY(_tableForUserId(name, here));
            table->erase(*name.identifier);
        }
        platform::logDebug("Cache: %@%@: Removed Identifier: %@", pathComponentForContainerClass(name.containerClass),
                           suffix(name.transient), name.identifier);
        return {};
    });
}

OSTResult<OSTContainerCache::ClassTable*> OSTContainerCache::_tableForUserId(const OSTContainerName& name,
                                                                             std::source_location where) {
    auto table = _getCacheForUserId(name);
    if (!table)
        return std::unexpected(OSTCreateErrorAt(
            where, OSTErrorCode::cacheRebuildFailed, &table.error(), "Cache: %u-%@%@: Failed to rebuild", name.userId,
            pathComponentForContainerClass(name.containerClass), suffix(name.transient)));
    return table;
}

OSTResult<OSTContainerCache::ClassTable*> OSTContainerCache::_getCacheForUserId(const OSTContainerName& name) {
    const auto& [userId, contentClass, identifier, transient] = name;
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
        return std::unexpected(OSTCreatePOSIXError(directory.error(), "User %u has no container directories", userId));
    ClassTable table = OST_TRY(_readClassDirectory(*directory, userId, transient));
    if (!transient) {
        std::vector<OSTMetadataRecord> containers;
        for (const auto& held : table | std::views::values)
            containers.push_back(held.entry.record);
        OSTRestoreSandboxItems(userId, contentClass, containers);
    }
    return &tables.emplace(key, std::move(table)).first->second;
}

OSTResult<OSTContainerCache::ClassTable>
OSTContainerCache::_readClassDirectory(const std::string& directory, std::uint32_t userId, bool transient) const {
    const auto& files = OSTFileManager::defaultManager();
    const auto items = OST_TRY(files.urlsForItemsInDirectoryAtURL(directory));
    // An earlier process may have been killed before it had waited for what it moved. This one answers for it.
    OST_TRY(_changesOfEarlierProcess ? files.makeFileSystemDurable(directory) : files.makeDirectoryDurable(directory));
    const auto open = OST_TRY(files.openDirectoryAtURL(directory));
    std::vector<OSTResult<OSTMetadataRecord>> records(items.size());
    const auto read = [&](std::size_t first, std::size_t last) {
        std::string buffer;
        for (; first < last; ++first)
            records[first] = readItem(open.get(), directory, items[first].name, userId, transient, buffer);
    };
    inTwoHalves(items.size(), read);

    ClassTable table;
    table.reserve(items.size());
    for (auto& record : records)
        if (auto valid = OST_TRY(std::move(record)))
            OST_TRY(_putFound(table, std::move(valid)));
    return table;
}

OSTResult<void> OSTContainerCache::_putFound(ClassTable& table, OSTMetadataRecord found) {
    if (const auto old = table.find(found->identifier); old != table.end()) {
        const auto other = old->second.entry.record;
        const bool foundIsGenuine = OST_TRY(isGenuine(*found)), otherIsGenuine = OST_TRY(isGenuine(*other));
        if (foundIsGenuine != otherIsGenuine)
            platform::logError("Skipping container at %@, whose metadata is not the daemon's and says that it is %@",
                               foundIsGenuine ? other->url : found->url, found->identifier);
        if (otherIsGenuine && !foundIsGenuine)
            return {};
    }
    _put(table, {std::move(found)});
    return {};
}

void OSTContainerCache::_put(ClassTable& table, OSTCacheEntry entry) {
    const std::string_view identifier = entry.record->identifier;
    if (const auto old = table.find(identifier); old != table.end()) {
        const auto& [record, placement] = old->second.entry;
        if (record->url == entry.record->url && placement == OSTPlacement::pending)
            entry.placement = OSTPlacement::pending;
        table.erase(old); // with its key, which the old record owns
    }
    table.emplace(identifier, Held{std::move(entry)});
}

} // namespace ost
