#include "Daemon/TarnMigrationCommands.h"

#include "Daemon/TarnClientConnection.h"
#include "Daemon/TarnContainerMigrator.h"
#include "Daemon/TarnError.h"
#include "Daemon/TarnLog.h"

namespace tarn {

namespace {

// A failure without a domain code of its own still must not read as success.
constexpr uint64_t kHandlerFallback = TarnErrorException;

}  // namespace

void TarnHandleDataMigrationCommand(const TarnRequestContext&, const PlistValue&, PlistValue&,
                                    TarnClientConnection* connection, uint64_t* error) {
    const TarnStatus migrated =
        TarnContainerMigrator::sharedInstance().performDataMigratorMigrationForClientConnection(
            *connection);
    if (!migrated.ok())
        TarnLog(kLogError, "performDataMigration", "Failed to perform data migration : %@",
                migrated.error());
    (void)TarnReport(migrated, error, kHandlerFallback);
}

void TarnHandlePerUserDataMigrationCommand(const TarnRequestContext&, const PlistValue&,
                                           PlistValue&, TarnClientConnection* connection,
                                           uint64_t* error) {
    const TarnStatus migrated =
        TarnContainerMigrator::sharedInstance().performPerUserDataMigrationForClientConnection(
            *connection);
    if (!migrated.ok())
        TarnLog(kLogError, "performPerUserDataMigration",
                "Failed to perform per-user data migration : %@", migrated.error());
    (void)TarnReport(migrated, error, kHandlerFallback);
}

}  // namespace tarn
