#pragma once

#include "files/OSTFileManager.h"
#include "files/OSTOwnFiles.h"
#include "platform/base/OSTError.h"
#include "protection/OSTDataProtectionChange.h"
#include "store/OSTLocks.h"

#include <optional>
#include <string>

namespace ost {

/// One pass over the user data of a container. Holds the container's lock for reading from its making to its end, but
/// lets whoever waits for all identifiers go first at every item; then it makes sure that the container is still the
/// same.
///
/// Threads: one. Borrows what it is made of.
class OSTDataProtectionPass {
public:
    OSTDataProtectionPass(const OSTDataProtectionChange& change, const std::optional<OSTItemIdentity>& directory);

    /// Changes every item that is to be changed. Fails with `notFound` or `unexpectedPath` when the container is not
    /// the one that was meant, else with the error of the item that could not be changed.
    [[nodiscard]] OSTResult<void> run();

    /// Whether the pass came to its end at an item that nobody may change.
    [[nodiscard]] bool metFixedItem() const { return _metFixedItem; }

private:
    [[nodiscard]] OSTResult<void> _checkContainer();
    [[nodiscard]] OSTResult<void> _walk(const std::string& item);
    [[nodiscard]] OSTResult<void> _visit(const OSTTreeEntry& entry);
    [[nodiscard]] OSTResult<void> _changeDirectory(const OSTTreeEntry& entry);
    [[nodiscard]] OSTResult<void> _changeFile(const OSTTreeEntry& entry);
    [[nodiscard]] OSTResult<void> _setClass(const OSTTreeEntry& entry, std::int32_t toClass,
                                            const OSTClassPredicate& ifPredicate);
    [[nodiscard]] bool _changes(std::int32_t bit) const;

    const OSTDataProtectionChange& _change;
    const std::optional<OSTItemIdentity>& _directory;
    OSTIdentifierLock _lock;
    OSTMetadataRecord _live; ///< the container's record at the last look
    OSTOwnFiles _ownFiles;
    bool _metFixedItem = false;
};

} // namespace ost
