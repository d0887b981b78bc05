#pragma once

#include "model/OSTMetadata.h"

#include <cstdint>

namespace ost {

/// Which items get the new class. Bit 1: directories; bit 2: regular files; bit 4: of those, none gets a higher class
/// than it has.
enum class OSTDataProtectionChangeType : std::int32_t { directories = 1, directoriesAndFiles = 7 };

/// What one change of a container's data-protection class is to do.
struct OSTDataProtectionChange {
    OSTMetadataRecord dataContainerMetadata; ///< the container as it was when the change was asked for
    std::int32_t newDataProtectionClass;
    bool retryIfLocked; ///< park and retry after the next unlock when the device is locked
    OSTDataProtectionChangeType operationType;
};

} // namespace ost
