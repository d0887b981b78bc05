#pragma once

#include <cstddef>
#include <cstdint>

namespace ost {

/// What a request asks for: the number under its "Command". It is a client's to choose, so a value of this type may be
/// any number.
enum class OSTCommand : std::uint64_t {
    createOrLookup = 0,
    list = 1,
    replace = 2,
    stageForDelete = 3,
    destroyDeathRow = 4,
    setInfoValue = 5,
    infoValue = 6,
    metadata = 7, ///< path, transience and info values
    recreateDefaultStructure = 8,
    regenerateDirectoryUUID = 9,
    deleteContainer = 10,
    wipePlugInData = 11, ///< of the identifiers that the caller's entitlement lists
    wipeData = 12,
    groupContainerPaths = 13,
    groupIdentifiers = 14,
    systemContainerPath = 15,
    systemGroupContainerPaths = 16,
    systemGroupContainerPath = 17,
    registerCodeSigning = 18,
    codeSigningInfo = 19,
    invalidateCodeSigning = 20, ///< of applications without a bundle container
    setDataProtection = 21,
    recreateDefaultStructureAgain = 22, ///< a second number of 8
    diskUsage = 23,
    performDataMigration = 24,
    retryTest = 25,
};

/// The commands are numbered from 0 without a gap.
inline constexpr std::size_t OSTCommandCount = 26;

} // namespace ost
