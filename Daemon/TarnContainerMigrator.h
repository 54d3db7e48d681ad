// TarnContainerMigrator: brings an existing device's containers up to the
// running build's layout and rules: once per build upgrade (first start after
// boot), once per device for the platform's data migrator (command 24), and
// per user on request (command 30). Completed migrations are recorded in the
// status files (TarnMigrationStatus) and skipped afterwards; one that did
// not complete is not recorded and runs again next time, so every step is
// written to be repeated after an interruption.
//
// Locks: the build-upgrade migration runs during the reboot set-up, before
// any request is taken, and takes no identifier lock. The other two run on a
// request thread and take the locks of the operations they call, so their
// caller holds none. Exceptions are fenced in each of the three entry points.
#pragma once

#include <string>
#include <utility>
#include <vector>

#include "Daemon/TarnContainerClass.h"
#include "Daemon/TarnMetadata.h"
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
    // records the running build. Fails only when the bundle containers could
    // not be moved or a well-known system container could not be renamed.
    TarnStatus performSynchronousBuildUpgradeMigration(TarnMigrationStatus& status);
    // ACLs of system containers, ownership of bundle container content, the
    // code-signing imports and the app-group reconciliation (staged on the
    // connection's command queue). Failures of the first two are logged only.
    TarnStatus performDataMigratorMigrationForClientConnection(TarnClientConnection& connection);
    // Subdirectories of every user's containers (once), data-protection
    // classes of data containers without an application bundle (every
    // time), and the deletion of deprecated containers (staged on the
    // connection's command queue).
    TarnStatus performPerUserDataMigrationForClientConnection(TarnClientConnection& connection);

    TarnUserIdentitySharedCache& userIdentityCache() const { return userIdentityCache_; }

    // ---- steps ----

    // Rotated log files of the old per-user log directory move to the global
    // one, one rotation number up; the old directory goes.
    void _migrateLogFiles();
    // The old per-user bundle container tree moves to the global place.
    TarnStatus _migrateBundleContainerLocation();
    // Records "ACLMigration" when there are no system containers to migrate.
    void _checkIfDeviceMayNeedSystemContainerACLMigration(TarnMigrationStatus& status);
    // Well-known system and system group containers move to their fixed names.
    TarnStatus _performWhitelistMigration();
    TarnStatus _performInternalACLMigration();
    TarnStatus _performBundleContainerOwnershipMigration();
    // Gives a data container whose application has no bundle container the
    // class its entitlements ask for; logs what fails.
    void _setDataProtectionIfNecessaryOnContainer(const TarnMetadataRef& container);
    // The application bundle container (class 1) of a data container (class 2)
    // or of a plug-in data container's parent (class 4); TarnErrorNotFound
    // when there is none.
    TarnResult<TarnMetadataRef> _bundleContainerForDataContainer(const TarnMetadataRef& container);

    // Identifier and class of every container the per-user migration deletes.
    static const std::vector<std::pair<std::string, TarnContainerClass>>& deprecatedContainers();

  private:
    // The per-user steps; each answers the last failure after trying every user.
    TarnStatus _performPerUserSubdirectoryMigration();
    TarnStatus _performPerUserDataProtectionMigration();
    void _deleteDeprecatedContainers(TarnClientConnection& connection);

    TarnUserIdentitySharedCache& userIdentityCache_;
};

}  // namespace tarn
