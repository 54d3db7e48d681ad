#include "Daemon/TarnContainerMigrator.h"

#include "Daemon/TarnUserIdentityCache.h"

namespace tarn {

TarnContainerMigrator& TarnContainerMigrator::sharedInstance() {
    static TarnContainerMigrator migrator(TarnUserIdentitySharedCache::sharedInstance());
    return migrator;
}

// Placeholders until the migrations are built.
TarnStatus TarnContainerMigrator::performSynchronousBuildUpgradeMigration(TarnMigrationStatus&) {
    return {};
}
TarnStatus TarnContainerMigrator::performDataMigratorMigrationForClientConnection(
    TarnClientConnection&) {
    return {};
}
TarnStatus TarnContainerMigrator::performPerUserDataMigrationForClientConnection(
    TarnClientConnection&) {
    return {};
}

}  // namespace tarn
