#include "Daemon/TarnCommandTable.h"

#include "Daemon/TarnCodeSigningMapping.h"
#include "Daemon/TarnContainerCommands.h"
#include "Daemon/TarnError.h"
#include "Daemon/TarnTestLocks.h"

namespace tarn {

void TarnHandleUnsupportedCommand(const PlistValue&, PlistValue&, TarnClientConnection*,
                                  uint64_t* error) {
    TarnSetError(error, TarnErrorInvalidCommand);
}

#define ALLOWED kTarnEntitlementAllowed

// clang-format off
const TarnCommandTableRow gTarnCommandTable[kTarnCommandCount] = {
    // command, handler, entitlement, replyOnReturn, anyClient, lookupAllowed
    { 0, TarnHandleCreateOrLookupCommand, ALLOWED, 1, 1, 1},  // create or look up a container
    { 1, TarnHandleContainersWithClassCommand, ALLOWED, 1, 0, 1},  // list the containers of a class
    { 2, nullptr, ALLOWED, 1, 0, 0},  // replace one container by another
    { 3, TarnHandleStageForDeleteCommand, ALLOWED, 1, 0, 0},  // stage containers for deletion
    { 4, TarnHandleDeleteDeathRowCommand, kTarnEntitlementUserManagedAssets, 0, 0, 0},  // delete death row
    { 5, TarnHandleSetInfoValueCommand, ALLOWED, 1, 0, 0},  // set a metadata info value
    { 6, TarnHandleInfoValueCommand, ALLOWED, 1, 0, 0},  // read a metadata info value
    { 7, TarnHandleMetadataCommand, ALLOWED, 1, 0, 0},  // read a container's metadata
    { 8, TarnHandleRecreateStructureCommand, ALLOWED, 1, 0, 0},  // recreate the default structure
    { 9, TarnHandleRegenerateUUIDCommand, ALLOWED, 1, 0, 0},  // new directory UUID
    {10, TarnHandleDeleteContainerCommand, ALLOWED, 1, 0, 0},  // delete a container
    {11, nullptr, kTarnEntitlementWipeContainer, 1, 0, 0},  // wipe an entitled data container
    {12, nullptr, kTarnEntitlementDeleteContainerContent, 1, 0, 0},  // wipe any container
    {13, nullptr, ALLOWED, 1, 1, 1},  // the client's group containers
    {14, nullptr, ALLOWED, 1, 0, 1},  // group identifiers of an owner
    {15, nullptr, ALLOWED, 1, 1, 1},  // path of a system container
    {16, nullptr, ALLOWED, 1, 1, 1},  // system group containers of an owner
    {17, nullptr, ALLOWED, 1, 1, 1},  // path of one system group container
    {18, nullptr, ALLOWED, 1, 0, 0},  // record code-signing information
    {19, TarnHandleGetCodeSigningInfoCommand, ALLOWED, 1, 0, 0},  // read code-signing information
    {20, nullptr, ALLOWED, 1, 0, 0},  // invalidate code-signing info without bundle
    {21, nullptr, ALLOWED, 0, 0, 0},  // set data protection
    {22, TarnHandleRecreateStructureCommand, ALLOWED, 1, 0, 0},  // same as 8
    {23, TarnHandleDiskUsageCommand, ALLOWED, 1, 0, 1},  // disk usage
    {24, nullptr, kTarnEntitlementDataMigration, 1, 0, 0},  // data-migrator migration
    {25, nullptr, kTarnEntitlementTestability, 1, 0, 0},  // crash-and-retry test
    {26, nullptr, kTarnEntitlementStageSharedContent, 1, 0, 0},  // stage shared content
    {27, TarnHandleUnsupportedCommand, ALLOWED, 1, 0, 0},  // not supported
    {28, nullptr, kTarnEntitlementUserManagedAssets, 1, 1, 0},  // user-managed assets path
    {29, nullptr, kTarnEntitlementUserManagedAssets, 1, 0, 0},  // delete a user-managed asset
    {30, nullptr, ALLOWED, 1, 0, 0},  // per-user data migration
    {31, TarnHandleTestLockCommand, kTarnEntitlementTestability, 1, 0, 0},  // test locks
    {32, nullptr, ALLOWED, 1, 1, 1},  // persona unique strings
};
// clang-format on

}  // namespace tarn
