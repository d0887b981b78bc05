#include "files/OSTDictionaryFile.h"

#include "files/OSTFileManager.h"
#include "platform/codec/PropertyList.h"

#include <cerrno>

namespace ost {

namespace {

/// Deeper than any value that comes from a request or a program's signature, which are at most 64 deep, and is then
/// stored some levels down: whatever is written can be read again. No object takes less than a byte.
constexpr std::size_t maximumDepth = 128;

} // namespace

OSTResult<OSTDictionary> OST_dictionaryWithContents(std::string_view bytes, std::string_view path) {
    const auto value = platform::parsePropertyList(bytes, {.depth = maximumDepth, .objectCount = bytes.size()});
    if (!value)
        return std::unexpected(OSTCreatePropertyListError("%@ is no property list: %@", path, value.error()));
    const OSTDictionary* const dictionary = value->asDictionary();
    if (!dictionary)
        return std::unexpected(OSTCreatePropertyListError("The property list at %@ is no dictionary", path));
    return *dictionary;
}

OSTResult<OSTDictionary> OST_dictionaryWithContentsOfURL(std::string_view path, std::size_t maximumSize) {
    const std::string bytes = OST_TRY(OSTFileManager::defaultManager().readFileAtURL(path, maximumSize));
    return OST_dictionaryWithContents(bytes, path);
}

OSTResult<std::string> OST_contentsOfDictionary(const OSTDictionary& dictionary, std::string_view path,
                                                std::size_t maximumSize) {
    std::string bytes = platform::serializeBinaryPropertyList(dictionary);
    if (bytes.size() > maximumSize)
        return std::unexpected(OSTCreatePOSIXError(EFBIG, "%@ would hold %llu bytes", path, bytes.size()));
    return bytes;
}

OSTResult<void> OST_writeToURL(const OSTDictionary& dictionary, std::string_view path, std::size_t maximumSize,
                               OSTWorkshop workshop) {
    const std::string bytes = OST_TRY(OST_contentsOfDictionary(dictionary, path, maximumSize));
    return OSTFileManager::defaultManager().writeFileAtomicallyAtURL(path, bytes, {}, workshop);
}

} // namespace ost
