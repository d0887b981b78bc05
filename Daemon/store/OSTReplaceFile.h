#pragma once

#include "platform/base/OSTError.h"

#include <string>
#include <string_view>

namespace ost {

/// What a replacement is about to move, written down before the first move so that the next start can undo it.
///
/// A value; the static functions may be called by any thread. On disk: one file in the replace directory, named by the
/// replacement's token, a binary property list with the four paths as strings under "OSTReplaceOperationOldURL",
/// "...NewURL", "...StagingURL" and "...DestURL".
struct OSTReplaceFile {
    std::string oldURL;         ///< where the old container lived
    std::string newURL;         ///< where the new container was before
    std::string stagingURL;     ///< where the old container is parked
    std::string destinationURL; ///< where the new container ends up

    /// The file of the replacement with that token.
    [[nodiscard]] static std::string urlOfToken(std::string_view token);

    /// Writes the file, durably. Fails with `replaceDescriptionIncomplete` or `dictionaryWriteFailed`.
    [[nodiscard]] OSTResult<void> _writeToDiskReplaceAt(const std::string& url) const;

    /// Reads the file, in either property-list encoding, whatever the paths are. Fails with `replaceFileInvalid`.
    [[nodiscard]] static OSTResult<OSTReplaceFile> readReplaceFileAtUrl(const std::string& url);
    /// Reads the file for its replacement to be undone. One that asks for a move outside the directories of
    /// containers, or of anything but a directory in staging, is invalid. Fails with `replaceFileInvalid`.
    [[nodiscard]] static OSTResult<OSTReplaceFile> _readAndValidateReplaceFileAtUrl(const std::string& url);

    /// To be called when a file has left the replace directory.
    static void wasDiscarded();
    /// Waits until no discarded file can come back in a power cut, those of an earlier process included. Before a
    /// container leaves the place that it got in a replacement: a start that found the file again would put the old
    /// container back. Costs nothing when no file was discarded since the last wait.
    [[nodiscard]] static OSTResult<void> makeDiscardsDurable();

    [[nodiscard]] std::string description() const;
};

} // namespace ost
