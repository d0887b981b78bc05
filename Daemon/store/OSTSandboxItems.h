#pragma once

#include "model/OSTMetadata.h"

#include <cstdint>
#include <vector>

namespace ost {

/// Items of the sandbox that were lost. Only a container that was once moved has an item, so each that is about to be
/// moved is given a note, which stays with it. Any thread; the caller sees to it that nobody moves the containers.

/// Notes on the directory of a live container that the sandbox is about to have an item for it. A failure is logged:
/// the item cannot be restored then.
void OSTNoteSandboxItem(const OSTMetadata& container);

/// Sets the items that live containers of one user and class should have and do not. Failures are logged.
void OSTRestoreSandboxItems(std::uint32_t userId, OSTContainerClass containerClass,
                            const std::vector<OSTMetadataRecord>& containers);

} // namespace ost
