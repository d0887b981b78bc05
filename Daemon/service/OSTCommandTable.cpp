#include "service/OSTCommandTable.h"

#include "service/OSTCodeSigningCommands.h"
#include "service/OSTContainerCommands.h"
#include "service/OSTRemovalCommands.h"

namespace ost {

namespace {

constexpr auto allowed = OSTEntitlementAllowed;
constexpr auto none = OSTEntitlementNone;
constexpr auto wipeContainer = OSTEntitlementWipeContainer;
constexpr auto dataMigration = OSTEntitlementDataMigration;

} // namespace

const std::array<OSTCommandEntry, OSTCommandCount> OSTCommandTable = {{
    {0, OSTCreateOrLookupCommand, none, OSTReplyBy::dispatcher},
    {1, OSTListCommand, allowed, OSTReplyBy::dispatcher},
    {2, OSTReplaceCommand, allowed, OSTReplyBy::dispatcher},
    {3, OSTStageForDeleteCommand, allowed, OSTReplyBy::dispatcher},
    {4, OSTDestroyDeathRowCommand, allowed, OSTReplyBy::handler},
    {5, nullptr, allowed, OSTReplyBy::dispatcher}, // set an info value of a container
    {6, nullptr, allowed, OSTReplyBy::dispatcher}, // get an info value of a container
    {7, nullptr, allowed, OSTReplyBy::dispatcher}, // get a container's path, transient flag and info
    {8, nullptr, allowed, OSTReplyBy::dispatcher}, // recreate a container's default structure
    {9, nullptr, allowed, OSTReplyBy::dispatcher}, // regenerate a container's directory UUID
    {10, OSTDeleteCommand, allowed, OSTReplyBy::dispatcher},
    {11, nullptr, wipeContainer, OSTReplyBy::dispatcher}, // wipe an entitled plug-in data container
    {12, nullptr, allowed, OSTReplyBy::dispatcher},       // wipe a data container
    {13, OSTGroupContainerPathsCommand, none, OSTReplyBy::dispatcher},
    {14, OSTGroupIdentifiersCommand, allowed, OSTReplyBy::dispatcher},
    {15, OSTSystemContainerPathCommand, none, OSTReplyBy::dispatcher},
    {16, OSTSystemGroupContainerPathsCommand, none, OSTReplyBy::dispatcher},
    {17, OSTSystemGroupContainerPathCommand, none, OSTReplyBy::dispatcher},
    {18, OSTRegisterCodeSigningCommand, allowed, OSTReplyBy::dispatcher},
    {19, OSTCodeSigningInfoCommand, allowed, OSTReplyBy::dispatcher},
    {20, OSTInvalidateCodeSigningCommand, allowed, OSTReplyBy::dispatcher},
    {21, nullptr, allowed, OSTReplyBy::handler},          // set a data container's protection class
    {22, nullptr, allowed, OSTReplyBy::dispatcher},       // recreate a container's default structure, as 8
    {23, nullptr, allowed, OSTReplyBy::dispatcher},       // disk usage of a container
    {24, nullptr, dataMigration, OSTReplyBy::dispatcher}, // run the data migration
    {25, nullptr, allowed, OSTReplyBy::dispatcher},       // retry test
}};

} // namespace ost
