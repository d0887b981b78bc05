#include "service/OSTCommandTable.h"

#include "Protocol/OSTEntitlements.h"
#include "service/OSTCodeSigningCommands.h"
#include "service/OSTContainerCommands.h"
#include "service/OSTRemovalCommands.h"

namespace ost {

namespace {

using enum OSTCommand;
using enum OSTReplyBy;

constexpr auto allowed = OSTEntitlementAllowed;
constexpr auto none = OSTEntitlementNone;
constexpr auto wipeContainer = OSTEntitlementWipeContainer;
constexpr auto dataMigration = OSTEntitlementDataMigration;

} // namespace

const std::array<OSTCommandEntry, OSTCommandCount> OSTCommandTable = {{
    {createOrLookup, OSTCreateOrLookupCommand, none, dispatcher},
    {list, OSTListCommand, allowed, dispatcher},
    {replace, OSTReplaceCommand, allowed, dispatcher},
    {stageForDelete, OSTStageForDeleteCommand, allowed, dispatcher},
    {destroyDeathRow, OSTDestroyDeathRowCommand, allowed, handler},
    {setInfoValue, nullptr, allowed, dispatcher},
    {infoValue, nullptr, allowed, dispatcher},
    {metadata, nullptr, allowed, dispatcher},
    {recreateDefaultStructure, nullptr, allowed, dispatcher},
    {regenerateDirectoryUUID, nullptr, allowed, dispatcher},
    {deleteContainer, OSTDeleteCommand, allowed, dispatcher},
    {wipePlugInData, nullptr, wipeContainer, dispatcher},
    {wipeData, nullptr, allowed, dispatcher},
    {groupContainerPaths, OSTGroupContainerPathsCommand, none, dispatcher},
    {groupIdentifiers, OSTGroupIdentifiersCommand, allowed, dispatcher},
    {systemContainerPath, OSTSystemContainerPathCommand, none, dispatcher},
    {systemGroupContainerPaths, OSTSystemGroupContainerPathsCommand, none, dispatcher},
    {systemGroupContainerPath, OSTSystemGroupContainerPathCommand, none, dispatcher},
    {registerCodeSigning, OSTRegisterCodeSigningCommand, allowed, dispatcher},
    {codeSigningInfo, OSTCodeSigningInfoCommand, allowed, dispatcher},
    {invalidateCodeSigning, OSTInvalidateCodeSigningCommand, allowed, dispatcher},
    {setDataProtection, nullptr, allowed, handler},
    {recreateDefaultStructureAgain, nullptr, allowed, dispatcher},
    {diskUsage, nullptr, allowed, dispatcher},
    {performDataMigration, nullptr, dataMigration, dispatcher},
    {retryTest, nullptr, allowed, dispatcher},
}};

} // namespace ost
