#include "Daemon/TarnCommandTable.h"

#include "Daemon/TarnAssetCommands.h"
#include "Daemon/TarnCodeSigningCommands.h"
#include "Daemon/TarnCodeSigningMapping.h"
#include "Daemon/TarnContainerCommands.h"
#include "Daemon/TarnDataProtectionCommands.h"
#include "Daemon/TarnError.h"
#include "Daemon/TarnGroupCommands.h"
#include "Daemon/TarnMigrationCommands.h"
#include "Daemon/TarnReplaceCommands.h"
#include "Daemon/TarnTestLocks.h"

namespace tarn {

void TarnHandleUnsupportedCommand(const TarnRequestContext&, const PlistValue&, PlistValue&,
                                  TarnClientConnection*, uint64_t* error) {
    TarnSetError(error, TarnErrorInvalidCommand);
}

// Rows name only what differs from the defaults (replyOnReturn 1, anyClient 0,
// lookupAllowed 0).
constexpr const char* kAllowed = kTarnEntitlementAllowed;

// clang-format off
const TarnCommandTableRow gTarnCommandTable[kTarnCommandCount] = {
    {.command = 0, .handler = TarnHandleCreateOrLookupCommand, .entitlement = kAllowed, .anyClient = 1, .lookupAllowed = 1},  // create or look up a container
    {.command = 1, .handler = TarnHandleContainersWithClassCommand, .entitlement = kAllowed, .lookupAllowed = 1},  // list the containers of a class
    {.command = 2, .handler = TarnHandleReplaceCommand, .entitlement = kAllowed},  // replace one container by another
    {.command = 3, .handler = TarnHandleStageForDeleteCommand, .entitlement = kAllowed},  // stage containers for deletion
    {.command = 4, .handler = TarnHandleDeleteDeathRowCommand, .entitlement = kTarnEntitlementUserManagedAssets, .replyOnReturn = 0},  // delete death row
    {.command = 5, .handler = TarnHandleSetInfoValueCommand, .entitlement = kAllowed},  // set a metadata info value
    {.command = 6, .handler = TarnHandleInfoValueCommand, .entitlement = kAllowed},  // read a metadata info value
    {.command = 7, .handler = TarnHandleMetadataCommand, .entitlement = kAllowed},  // read a container's metadata
    {.command = 8, .handler = TarnHandleRecreateStructureCommand, .entitlement = kAllowed},  // recreate the default structure
    {.command = 9, .handler = TarnHandleRegenerateUUIDCommand, .entitlement = kAllowed},  // new directory UUID
    {.command = 10, .handler = TarnHandleDeleteContainerCommand, .entitlement = kAllowed},  // delete a container
    {.command = 11, .handler = TarnHandleWipeContainerCommand, .entitlement = kTarnEntitlementWipeContainer},  // wipe an entitled data container
    {.command = 12, .handler = TarnHandleWipeAnyContainerCommand, .entitlement = kTarnEntitlementDeleteContainerContent},  // wipe any container
    {.command = 13, .handler = TarnHandleGroupContainersCommand, .entitlement = kAllowed, .anyClient = 1, .lookupAllowed = 1},  // the client's group containers
    {.command = 14, .handler = TarnHandleGroupIdentifiersCommand, .entitlement = kAllowed, .lookupAllowed = 1},  // group identifiers of an owner
    {.command = 15, .handler = TarnHandleSystemContainerPathCommand, .entitlement = kAllowed, .anyClient = 1, .lookupAllowed = 1},  // path of a system container
    {.command = 16, .handler = TarnHandleSystemGroupContainersCommand, .entitlement = kAllowed, .anyClient = 1, .lookupAllowed = 1},  // system group containers of an owner
    {.command = 17, .handler = TarnHandleSystemGroupContainerPathCommand, .entitlement = kAllowed, .anyClient = 1, .lookupAllowed = 1},  // path of one system group container
    {.command = 18, .handler = TarnHandleProcessCodeSigningInfoCommand, .entitlement = kAllowed},  // record code-signing information
    {.command = 19, .handler = TarnHandleGetCodeSigningInfoCommand, .entitlement = kAllowed},  // read code-signing information
    {.command = 20, .handler = TarnHandleInvalidateAppsWithoutBundleCommand, .entitlement = kAllowed},  // invalidate code-signing info without bundle
    {.command = 21, .handler = TarnHandleSetDataProtectionCommand, .entitlement = kAllowed, .replyOnReturn = 0},  // set data protection
    {.command = 22, .handler = TarnHandleRecreateStructureCommand, .entitlement = kAllowed},  // same as 8
    {.command = 23, .handler = TarnHandleDiskUsageCommand, .entitlement = kAllowed, .lookupAllowed = 1},  // disk usage
    {.command = 24, .handler = TarnHandleDataMigrationCommand, .entitlement = kTarnEntitlementDataMigration},  // data-migrator migration
    {.command = 25, .handler = TarnHandleRetryTestCommand, .entitlement = kTarnEntitlementTestability},  // crash-and-retry test
    {.command = 26, .handler = TarnHandleStageSharedContentCommand, .entitlement = kTarnEntitlementStageSharedContent},  // stage shared content
    {.command = 27, .handler = TarnHandleUnsupportedCommand, .entitlement = kAllowed},  // not supported
    {.command = 28, .handler = TarnHandleUserManagedAssetsPathCommand, .entitlement = kTarnEntitlementUserManagedAssets, .anyClient = 1},  // user-managed assets path
    {.command = 29, .handler = TarnHandleDeleteUserManagedAssetCommand, .entitlement = kTarnEntitlementUserManagedAssets},  // delete a user-managed asset
    {.command = 30, .handler = TarnHandlePerUserDataMigrationCommand, .entitlement = kAllowed},  // per-user data migration
    {.command = 31, .handler = TarnHandleTestLockCommand, .entitlement = kTarnEntitlementTestability},  // test locks
    {.command = 32, .handler = TarnHandlePersonaStringsCommand, .entitlement = kAllowed, .anyClient = 1, .lookupAllowed = 1},  // persona unique strings
};
// clang-format on

}  // namespace tarn
