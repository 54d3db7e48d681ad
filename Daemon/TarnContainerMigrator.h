// TarnContainerMigrator: brings an existing device's containers up to the
// running build's layout and rules: once per build upgrade (first start after
// boot), once per device for the platform's data migrator (command 24), and
// per user on request (command 30). Completed migrations are recorded in the
// status files (TarnMigrationStatus) and skipped afterwards.
#pragma once

#include "Daemon/TarnResult.h"

namespace tarn {

class TarnClientConnection;
class TarnMigrationStatus;
class TarnUserIdentitySharedCache;

class TarnContainerMigrator {
  public:
    static TarnContainerMigrator& sharedInstance();
    explicit TarnContainerMigrator(TarnUserIdentitySharedCache& userIdentityCache)
        : userIdentityCache_(userIdentityCache) {}

    // Called by the reboot set-up when the build changed; the caller then
    // records the running build.
    TarnStatus performSynchronousBuildUpgradeMigration(TarnMigrationStatus& status);
    TarnStatus performDataMigratorMigrationForClientConnection(TarnClientConnection& connection);
    TarnStatus performPerUserDataMigrationForClientConnection(TarnClientConnection& connection);

    TarnUserIdentitySharedCache& userIdentityCache() const { return userIdentityCache_; }

  private:
    TarnUserIdentitySharedCache& userIdentityCache_;
};

}  // namespace tarn
