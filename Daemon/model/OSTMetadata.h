#pragma once

#include "files/OSTFileManager.h"
#include "model/OSTContainerName.h"
#include "platform/base/OSTError.h"
#include "platform/base/OSTValue.h"
#include "platform/base/UUID.h"

#include <cstdint>
#include <memory>
#include <string>
#include <string_view>
#include <vector>

namespace ost {

/// Whether reading a metadata file also checks that the container lies in the directory of its class.
enum class OSTCheckClassPath : bool { no, yes };

/// What is known of one container.
///
/// A value type. Records that are shared (`OSTMetadataRecord`) never change; a change is made in a copy.
///
/// On disk: a binary property list with "OSTMetadataIdentifier", "OSTMetadataUUID" (canonical text),
/// "OSTMetadataContentClass", "OSTMetadataPersona" (the user id) and, when there is info, "OSTMetadataInfo". Old files
/// lack the user id.
struct OSTMetadata {
    std::uint32_t uid = 0;
    platform::UUID uuid = {}; ///< the internal UUID, which is not the directory's name
    OSTContainerClass containerClass = OSTContainerClass::undefined;
    std::string identifier = {};
    std::shared_ptr<const OSTDictionary> info = nullptr; ///< null when there is none
    std::string url = {};                                ///< path of the container directory
    bool transient = false;                              ///< lies in a transient directory; not in the file
    bool existed = true; ///< false when the look-up that gave this record made the container; not in the file

    /// The name under which the container is found, for as long as this record lives.
    [[nodiscard]] OSTContainerName name() const { return {uid, containerClass, identifier, transient}; }

    /// Reads the metadata file of the container at `url` and validates it for the user.
    /// Fails with `metadataUnreadable` or `metadataInvalid`, logged.
    [[nodiscard]] static OSTResult<OSTMetadata> readAndValidateMetadataAtUrl(std::string_view url, std::uint32_t userId,
                                                                             OSTCheckClassPath checkClassPath);

    /// The second half of the above, for a caller that has the file's bytes: `contents` is what was read, or why it was
    /// not.
    [[nodiscard]] static OSTResult<OSTMetadata>
    readAndValidateMetadataAtUrl(const OSTResult<std::string_view>& contents, std::string_view url,
                                 std::uint32_t userId, OSTCheckClassPath checkClassPath);

    /// The dictionary that the file holds.
    [[nodiscard]] OSTDictionary dictionary() const;

    /// Writes the metadata file at `url`, atomically; durable when this returns. Fails with `dictionaryWriteFailed`,
    /// logged.
    [[nodiscard]] OSTResult<void> writeMetadataToDisk() const;

    /// The same for the files of many containers, which share the waits for the disk. The results are in their order.
    [[nodiscard]] static std::vector<OSTResult<void>> writeMetadataToDisk(const std::vector<OSTMetadata>& containers);

    /// The same for a directory that nobody else can see yet; what it returns still has to be made durable.
    [[nodiscard]] OSTResult<OSTNewFile> writeMetadataToNewDirectory() const;
    [[nodiscard]] OSTResult<void> makeMetadataDurable(OSTNewFile file) const;

    /// The path of the metadata file.
    [[nodiscard]] std::string metadataFileURL() const;

    [[nodiscard]] std::string description() const;

private:
    /// A write's result, its failure as `dictionaryWriteFailed`.
    template<typename T>
    [[nodiscard]] OSTResult<T> _written(OSTResult<T> result) const;
};

using OSTMetadataRecord = std::shared_ptr<const OSTMetadata>;

} // namespace ost
