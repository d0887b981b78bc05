#include "store/OSTReplaceFile.h"

#include "files/OSTDictionaryFile.h"
#include "files/OSTFileManager.h"
#include "model/OSTGlobalConfiguration.h"
#include "platform/base/Errno.h"
#include "platform/base/Immortal.h"
#include "platform/base/Mutex.h"
#include "platform/base/Path.h"
#include "platform/base/Try.h"

#include <cerrno>
#include <cstring>
#include <expected>
#include <optional>
#include <utility>

namespace ost {

namespace {

constexpr const char* oldKey = "OSTReplaceOperationOldURL";
constexpr const char* newKey = "OSTReplaceOperationNewURL";
constexpr const char* stagingKey = "OSTReplaceOperationStagingURL";
constexpr const char* destinationKey = "OSTReplaceOperationDestURL";

/// What has to be waited for in the replace directory.
struct Discards {
    platform::Mutex mutex;
    bool pending OST_GUARDED_BY(mutex) = true; ///< an earlier process may have left some

    static Discards& shared() {
        static platform::Immortal discards([] { return Discards(); });
        return *discards;
    }
};

/// Whether a container may be parked there: directly in the staging directory. What is there must not be a link or a
/// file. Fails with the errno of looking.
std::expected<bool, platform::Errno> isStagingURL(const std::string& url) {
    const auto name = platform::lastPathComponent(url);
    const auto directory = platform::pathByDeletingLastComponent(url);
    if (name.empty() || name == "." || name == ".." ||
        directory != OSTGlobalConfiguration::sharedInstance().stagingDirectory())
        return false;
    const auto& files = OSTFileManager::defaultManager();
    if (files.itemDoesNotExistAtURL(url))
        return true;
    const auto parked = files.openDirectoryAtURL(url);
    if (parked || parked.error().isPOSIX(ENOTDIR) || parked.error().isPOSIX(ELOOP))
        return parked.has_value();
    return std::unexpected(static_cast<int>(parked.error().code()));
}

/// Whether all the paths are such as a replacement has. Fails with the errno of looking.
std::expected<bool, platform::Errno> isPlausible(const OSTReplaceFile& file) {
    const auto& layout = OSTGlobalConfiguration::sharedInstance();
    for (const auto* const url : {&file.oldURL, &file.newURL, &file.destinationURL})
        if (!OST_TRY(layout.isContainerURL(*url)))
            return false;
    return isStagingURL(file.stagingURL);
}

} // namespace

std::string OSTReplaceFile::urlOfToken(std::string_view token) {
    return platform::pathByAppending(OSTGlobalConfiguration::sharedInstance().replaceDirectory(),
                                     std::string(token) + ".plist");
}

void OSTReplaceFile::wasDiscarded() {
    auto& discards = Discards::shared();
    const platform::MutexLock lock(discards.mutex);
    discards.pending = true;
}

OSTResult<void> OSTReplaceFile::makeDiscardsDurable() {
    auto& discards = Discards::shared();
    const platform::MutexLock lock(discards.mutex); // during the wait, for which others would have to wait as well
    if (!discards.pending)
        return {};
    const auto durable = OSTFileManager::defaultManager().makeDirectoryDurable(
        OSTGlobalConfiguration::sharedInstance().replaceDirectory());
    if (!durable && durable.error().isPOSIX(ENOENT))
        return {}; // Nothing can come back.
    OST_TRY(durable);
    discards.pending = false;
    return {};
}

OSTResult<void> OSTReplaceFile::_writeToDiskReplaceAt(const std::string& url) const {
    if (oldURL.empty() || newURL.empty() || stagingURL.empty() || destinationURL.empty())
        return std::unexpected(OSTCreateError(OSTErrorCode::replaceDescriptionIncomplete,
                                              "Invalid Replace File Info: old: %@, new: %@, staging: %@, dest: %@",
                                              oldURL, newURL, stagingURL, destinationURL));
    const OSTDictionary dictionary(
        {{oldKey, oldURL}, {newKey, newURL}, {stagingKey, stagingURL}, {destinationKey, destinationURL}});
    auto& discards = Discards::shared();
    const platform::MutexLock lock(discards.mutex);
    const auto written = OST_writeToURL(dictionary, url, OSTSmallDictionaryFileSize);
    if (written)
        discards.pending = false; // the directory has been waited for
    else
        return std::unexpected(OSTCreateError(OSTErrorCode::dictionaryWriteFailed, written.error(),
                                              "Failed to write replace dictionary to URL %@", url));
    return {};
}

OSTResult<OSTReplaceFile> OSTReplaceFile::readReplaceFileAtUrl(const std::string& url) {
    const auto dictionary = OST_dictionaryWithContentsOfURL(url, OSTSmallDictionaryFileSize);
    if (!dictionary)
        return std::unexpected(OSTCreateError(OSTErrorCode::replaceFileInvalid, dictionary.error(),
                                              "Failed to read replace file at URL %@", url));
    const auto value = [&](const char* key) {
        const auto* const found = dictionary->find(key);
        return found ? std::optional(*found) : std::nullopt;
    };
    OSTReplaceFile file;
    for (const auto& [key, path] : {std::pair(oldKey, &file.oldURL),
                                    {newKey, &file.newURL},
                                    {stagingKey, &file.stagingURL},
                                    {destinationKey, &file.destinationURL}}) {
        const auto* const found = dictionary->find(key);
        if (!found || !found->asString())
            return std::unexpected(OSTCreateError(
                OSTErrorCode::replaceFileInvalid, "Invalid replace data: Old: %@, New: %@, Staging: %@, Dest: %@",
                value(oldKey), value(newKey), value(stagingKey), value(destinationKey)));
        *path = *found->asString();
    }
    return file;
}

OSTResult<OSTReplaceFile> OSTReplaceFile::_readAndValidateReplaceFileAtUrl(const std::string& url) {
    auto file = OST_TRY(readReplaceFileAtUrl(url));
    const auto plausible = isPlausible(file);
    if (plausible && *plausible)
        return file;
    std::optional<OSTError> cause;
    if (!plausible)
        cause = OSTCreatePOSIXError(plausible.error(), "check of the paths in %@ failed: %s", url, plausible.error());
    return std::unexpected(OSTCreateError(OSTErrorCode::replaceFileInvalid, OSTLogging::logged,
                                          cause ? &*cause : nullptr,
                                          "Invalid replace data: Old: %@, New: %@, Staging: %@, Dest: %@", file.oldURL,
                                          file.newURL, file.stagingURL, file.destinationURL));
}

std::string OSTReplaceFile::description() const {
    return platform::formatMessage("{old: %@, new: %@, staging: %@, dest: %@}", oldURL, newURL, stagingURL,
                                   destinationURL);
}

} // namespace ost
