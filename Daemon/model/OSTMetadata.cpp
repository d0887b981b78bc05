#include "model/OSTMetadata.h"

#include "files/OSTDictionaryFile.h"
#include "files/OSTFileManager.h"
#include "platform/base/Path.h"

#include <optional>

namespace ost {

namespace {

constexpr const char* identifierKey = "OSTMetadataIdentifier";
constexpr const char* uuidKey = "OSTMetadataUUID";
constexpr const char* contentClassKey = "OSTMetadataContentClass";
constexpr const char* personaKey = "OSTMetadataPersona";
constexpr const char* infoKey = "OSTMetadataInfo";

/// A value of a dictionary as messages show it.
std::optional<OSTValue> shown(const OSTValue* value) { return value ? std::optional(*value) : std::nullopt; }

/// Every class directory lies two levels below its base, and the container directory one below that.
bool liesInDirectoryOfClass(std::string_view url, OSTContainerClass containerClass) {
    const auto holder = platform::pathByDeletingLastComponent(url);
    const auto base = platform::pathByDeletingLastComponent(platform::pathByDeletingLastComponent(holder));
    return holder.size() > base.size() && holder.starts_with(base) &&
           holder.substr(base.size() + 1) == pathComponentForContainerClass(containerClass);
}

} // namespace

OSTResult<OSTMetadata> OSTMetadata::readAndValidateMetadataAtUrl(std::string_view url, std::uint32_t userId,
                                                                 OSTCheckClassPath checkClassPath) {
    const auto contents = OSTFileManager::defaultManager().readFileAtURL(
        platform::pathByAppending(url, OSTMetadataFileName), OSTSmallDictionaryFileSize);
    if (!contents)
        return readAndValidateMetadataAtUrl(std::unexpected(contents.error()), url, userId, checkClassPath);
    return readAndValidateMetadataAtUrl(std::string_view(*contents), url, userId, checkClassPath);
}

OSTResult<OSTMetadata> OSTMetadata::readAndValidateMetadataAtUrl(const OSTResult<std::string_view>& contents,
                                                                 std::string_view url, std::uint32_t userId,
                                                                 OSTCheckClassPath checkClassPath) {
    const auto dictionary = contents ? OST_dictionaryWithContents(*contents, url) : std::unexpected(contents.error());
    if (!dictionary)
        return std::unexpected(OSTCreateError(OSTErrorCode::metadataUnreadable, dictionary.error(),
                                              "Failed to read metadata at URL %@", url));

    const OSTValue* const identifier = dictionary->find(identifierKey);
    if (!identifier || !identifier->asString())
        return std::unexpected(OSTCreateError(OSTErrorCode::metadataInvalid, "Invalid metadata Identifier: %@ at %@",
                                              shown(identifier), url));

    const OSTValue* const uuidText = dictionary->find(uuidKey);
    if (!uuidText || !uuidText->asString())
        return std::unexpected(OSTCreateError(OSTErrorCode::metadataInvalid, "Invalid metadata UUID String: %@ at %@",
                                              shown(uuidText), url));
    const auto uuid = platform::UUID::parse(*uuidText->asString());
    if (!uuid)
        return std::unexpected(
            OSTCreateError(OSTErrorCode::metadataInvalid, "Invalid metadata UUID: %@ at %@", nullptr, url));

    const OSTValue* const classNumber = dictionary->find(contentClassKey);
    if (!classNumber || !classNumber->isNumber())
        return std::unexpected(
            OSTCreateError(OSTErrorCode::metadataInvalid, "Invalid metadata Class: %@ at %@", shown(classNumber), url));
    const auto containerClass = static_cast<OSTContainerClass>(*classNumber->unsignedValue());
    if (!isValidContainerClass(containerClass))
        return std::unexpected(OSTCreateError(OSTErrorCode::metadataInvalid,
                                              "Invalid metadata Content Class: %ld at %@", containerClass, url));

    // A file that names no user was written when there was one user for each class: it belongs to whoever is expected.
    const OSTValue* const persona = dictionary->find(personaKey);
    if (persona && (!persona->isNumber() || static_cast<std::uint32_t>(*persona->unsignedValue()) != userId))
        return std::unexpected(OSTCreateError(OSTErrorCode::metadataInvalid,
                                              "Incorrect UserId: %@, expecting: %u for %@ at %@", *persona, userId,
                                              *identifier->asString(), url));

    const OSTValue* const info = dictionary->find(infoKey);
    if (info && !info->asDictionary())
        return std::unexpected(
            OSTCreateError(OSTErrorCode::metadataInvalid, "Invalid metadata Info: %@ at %@", *info, url));

    if (checkClassPath == OSTCheckClassPath::yes && !liesInDirectoryOfClass(url, containerClass)) {
        const auto base = platform::pathByDeletingLastComponent(
            platform::pathByDeletingLastComponent(platform::pathByDeletingLastComponent(url)));
        return std::unexpected(
            OSTCreateError(OSTErrorCode::metadataInvalid, "Invalid metadata-URLs should match: %@ : %@", url,
                           platform::pathByAppending(base, pathComponentForContainerClass(containerClass))));
    }

    return OSTMetadata{.uid = userId,
                       .uuid = *uuid,
                       .containerClass = containerClass,
                       .identifier = *identifier->asString(),
                       .info = info ? info->sharedDictionary() : nullptr,
                       .url = std::string(url)};
}

OSTDictionary OSTMetadata::dictionary() const {
    std::vector<OSTDictionary::Entry> entries;
    entries.reserve(5);
    entries.emplace_back(contentClassKey, static_cast<std::uint64_t>(containerClass));
    entries.emplace_back(identifierKey, identifier);
    if (info)
        entries.emplace_back(infoKey, info);
    entries.emplace_back(personaKey, std::uint64_t{uid});
    entries.emplace_back(uuidKey, uuid.string());
    return OSTDictionary(std::move(entries));
}

template<typename T>
OSTResult<T> OSTMetadata::_written(OSTResult<T> result) const {
    if (!result)
        return std::unexpected(OSTCreateError(OSTErrorCode::dictionaryWriteFailed, result.error(),
                                              "Failed to write metadata dictionary to URL %@", url));
    return result;
}

OSTResult<void> OSTMetadata::writeMetadataToDisk() const {
    // A start looks for unfinished files where they are few: in the class directories.
    return _written(
        OST_writeToURL(dictionary(), metadataFileURL(), OSTSmallDictionaryFileSize, OSTWorkshop::directoryAbove));
}

std::vector<OSTResult<void>> OSTMetadata::writeMetadataToDisk(const std::vector<OSTMetadata>& containers) {
    std::vector<OSTResult<void>> results(containers.size());
    std::vector<OSTFileContent> files;
    std::vector<std::size_t> numbers; // of the containers that the files belong to
    for (std::size_t i = 0; i < containers.size(); ++i) {
        auto contents =
            OST_contentsOfDictionary(containers[i].dictionary(), containers[i].url, OSTSmallDictionaryFileSize);
        if (!contents) {
            results[i] = containers[i]._written(OSTResult<void>(std::unexpected(contents.error())));
            continue;
        }
        files.push_back({containers[i].metadataFileURL(), *std::move(contents)});
        numbers.push_back(i);
    }
    auto written = OSTFileManager::defaultManager().writeFilesAtomicallyAtURLs(files);
    for (std::size_t i = 0; i < numbers.size(); ++i)
        results[numbers[i]] = containers[numbers[i]]._written(std::move(written[i]));
    return results;
}

OSTResult<OSTNewFile> OSTMetadata::writeMetadataToNewDirectory() const {
    const auto contents = OST_contentsOfDictionary(dictionary(), url, OSTSmallDictionaryFileSize);
    return _written(contents ? OSTFileManager::defaultManager().createFileAtURL(metadataFileURL(), *contents)
                             : std::unexpected(contents.error()));
}

OSTResult<void> OSTMetadata::makeMetadataDurable(OSTNewFile file) const { return _written(file.makeDurable()); }

std::string OSTMetadata::metadataFileURL() const { return platform::pathByAppending(url, OSTMetadataFileName); }

std::string OSTMetadata::description() const {
    return platform::formatMessage("<OSTMetadata user: %u, class: %llu, identifier: %@, uuid: %@, url: %@>", uid,
                                   containerClass, identifier, uuid.string(), url);
}

} // namespace ost
