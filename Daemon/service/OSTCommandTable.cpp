#include "service/OSTCommandTable.h"

#include "Protocol/OSTEntitlements.h"
#include "service/OSTAttributeCommands.h"
#include "service/OSTCodeSigningCommands.h"
#include "service/OSTContainerCommands.h"
#include "service/OSTMaintenanceCommands.h"
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
    {setInfoValue, OSTSetInfoValueCommand, allowed, dispatcher},
    {infoValue, OSTInfoValueCommand, allowed, dispatcher},
    {metadata, OSTMetadataCommand, allowed, dispatcher},
    {recreateDefaultStructure, OSTRecreateDefaultStructureCommand, allowed, dispatcher},
    {regenerateDirectoryUUID, OSTRegenerateDirectoryUUIDCommand, allowed, dispatcher},
    {deleteContainer, OSTDeleteCommand, allowed, dispatcher},
    {wipePlugInData, OSTWipePluginContainerCommand, wipeContainer, dispatcher},
    {wipeData, OSTWipeContainerCommand, allowed, dispatcher},
    {groupContainerPaths, OSTGroupContainerPathsCommand, none, dispatcher},
    {groupIdentifiers, OSTGroupIdentifiersCommand, allowed, dispatcher},
    {systemContainerPath, OSTSystemContainerPathCommand, none, dispatcher},
    {systemGroupContainerPaths, OSTSystemGroupContainerPathsCommand, none, dispatcher},
    {systemGroupContainerPath, OSTSystemGroupContainerPathCommand, none, dispatcher},
    {registerCodeSigning, OSTRegisterCodeSigningCommand, allowed, dispatcher},
    {codeSigningInfo, OSTCodeSigningInfoCommand, allowed, dispatcher},
    {invalidateCodeSigning, OSTInvalidateCodeSigningCommand, allowed, dispatcher},
    {setDataProtection, OSTSetDataProtectionCommand, allowed, handler},
    {recreateDefaultStructureAgain, OSTRecreateDefaultStructureCommand, allowed, dispatcher},
    {diskUsage, OSTDiskUsageCommand, allowed, dispatcher},
    {performDataMigration, OSTPerformDataMigrationCommand, dataMigration, dispatcher},
    {retryTest, OSTRetryTestCommand, allowed, dispatcher},
}};

} // namespace ost
