// Boot work of the shared connection: set-up before the listener opens,
// clean-up on the background queue while requests are already served.
//
// Nothing here stops start-up: every failure is logged and the step goes on
// with the next item. All destruction goes through death row; the one
// deletion pass of a start is the one the staging sweep starts, and since the
// background queue is serial it sees everything the orphan sweeps moved.
#include <cerrno>
#include <initializer_list>

#include "Daemon/TarnClientConnection.h"
#include "Daemon/TarnCodeSigningMapping.h"
#include "Daemon/TarnContainerCache.h"
#include "Daemon/TarnContainerMigrator.h"
#include "Daemon/TarnDataProtectionManager.h"
#include "Daemon/TarnExceptionFence.h"
#include "Daemon/TarnFileManager.h"
#include "Daemon/TarnGlobalConfiguration.h"
#include "Daemon/TarnGroupManager.h"
#include "Daemon/TarnLocks.h"
#include "Daemon/TarnLog.h"
#include "Daemon/TarnMigrationStatus.h"
#include "Daemon/TarnPerUserConfiguration.h"
#include "Daemon/TarnUserIdentityCache.h"
#include "Daemon/TarnWhitelist.h"
#include "Platform/Failpoints.h"
#include "Platform/HostConfiguration.h"

namespace tarn {

namespace {

// The system group container that keeps its directory across build upgrades:
// diagnostics collected before the upgrade are read from it afterwards.
constexpr const char* kAnalyticsSystemGroup = "systemgroup.com.ostrea.osanalytics";

// The multi-user mode bit of the host's multi-user configuration flags.
constexpr uint64_t kMultiUserModeBit = 1ull << 31;

bool isNoSuchFile(const TarnErrorRef& error) { return error && error->posixCode() == ENOENT; }

bool deviceIsInMultiUserMode() {
    const std::optional<uint64_t>& flags = HostConfiguration::shared().multiUserFlags;
    return flags && (*flags & kMultiUserModeBit) != 0;
}

// Items of a restored container that cannot be installed are kept for a
// person to look at, below the failed path in the identifier's directory.
void _moveFailedPathAside(const FileURL& itemURL, const FileURL& failedDirectoryURL,
                          const std::string& itemName) {
    auto& fm = TarnFileManager::defaultManager();
    if (const TarnStatus created =
            fm.createDirectoryAtURL(failedDirectoryURL, /*withIntermediateDirectories=*/true, 0777);
        !created.ok()) {
        TarnLog(kLogError, __func__, "Failed to create %@: %@", failedDirectoryURL,
                created.error());
        return;
    }
    const FileURL destination = PathJoin(failedDirectoryURL, itemName);
    if (const TarnStatus moved = fm.moveItemAtURL(itemURL, destination); !moved.ok())
        TarnLog(kLogError, __func__, "Failed to move %@ to %@: %@", itemURL, destination,
                moved.error());
}

// Installs one restored container (a child of an in-progress directory) as
// the live container of its identifier: its items replace the container's.
void _moveSystemContainerIntoPlace(const FileURL& itemURL, TarnContainerClass containerClass,
                                   TarnClientConnection& connection) {
    static constexpr const char* kTag = "_moveSystemContainerIntoPlace";
    auto& fm = TarnFileManager::defaultManager();
    const std::string identifier = PathLastComponent(itemURL);
    const FileURL failedDirectoryURL = PathJoin(PathParent(itemURL) + ".failed", identifier);

    auto identity =
        TarnContainerIdentity::containerIdentityWithIdentifier(identifier, containerClass);
    if (!identity.ok()) {
        TarnLog(kLogError, kTag, "Failed to create container identity %@: %llu", identifier,
                identity.code(TarnErrorInvalidArgument));
        return;
    }
    auto container = connection.createOrLookupContainerWithContainerIdentity(
        *identity, /*createIfNecessary=*/true, /*transient=*/false, /*useLocking=*/true);
    if (!container.ok()) {
        TarnLog(kLogError, kTag, "Failed to create system container %@: %llu", identifier,
                container.code(TarnErrorInvalidArgument));
        return;
    }
    const FileURL containerURL = (*container)->url();
    TarnLog(kLogError, kTag, "Restoring container for %@ at %@ to %@", identifier, itemURL,
            containerURL);

    auto items = fm.urlsForItemsInDirectoryAtURL(itemURL);
    if (!items.ok()) {
        TarnLog(kLogError, kTag,
                "Failed to enumerate contents of restored system container %@ at %@: %@",
                identifier, itemURL, items.error());
        return;
    }
    for (const FileURL& item : *items) {
        const std::string name = PathLastComponent(item);
        const FileURL target = PathJoin(containerURL, name);
        const std::optional<int> injected = TARN_FAILPOINT("boot.restore.removeTarget");
        const TarnStatus removed =
            injected ? TarnStatus(TARN_POSIX_ERROR(*injected, "remove %@", target))
                     : fm.removeItemAtURL(target);
        if (!removed.ok()) {
            TarnLog(kLogError, kTag, "Failed to remove destination %@:%@: %@", identifier, name,
                    removed.error());
            _moveFailedPathAside(item, failedDirectoryURL, name);
            continue;
        }
        if (const TarnStatus moved = fm.moveItemAtURL(item, target); !moved.ok()) {
            TarnLog(kLogError, kTag,
                    "Failed to move file in restored system container %@:%@ to destination %@: %@",
                    identifier, name, target, moved.error());
            _moveFailedPathAside(item, failedDirectoryURL, name);
        }
    }

    // The restored tree may lack standard subdirectories or the ACL.
    const TarnConcreteContainerIdentityRef concrete = (*container)->containerIdentity();
    const TarnStatus recreated =
        concrete ? connection.recreateDefaultStructureWithContainerIdentity(concrete)
                 : TarnStatus(TARN_ERROR_CODE(TarnErrorInvalidArgument, nullptr));
    if (!recreated.ok())
        TarnLog(kLogError, kTag, "Error processing restored system container %@: %llu", identifier,
                recreated.code(TarnErrorInvalidArgument));
}

// Renames a backup directory to its in-progress path, replacing what an
// interrupted installation left there. Answers the in-progress path, or
// nothing when there is no backup or it could not be moved.
std::optional<FileURL> moveBackupToInProgress(const FileURL& backupURL,
                                              const char* moveFailureFormat) {
    static constexpr const char* kTag = "rebootKeeperSetup";
    auto& fm = TarnFileManager::defaultManager();
    if (!fm.itemExistsAtURL(backupURL)) return std::nullopt;
    const FileURL inProgressURL = backupURL + ".inprogress";
    if (const TarnStatus removed = fm.removeItemAtURL(inProgressURL); !removed.ok())
        TarnLog(kLogError, kTag, "Failed to remove existing inprogress system containers: %@",
                removed.error());
    if (const TarnStatus moved = fm.renameItemAtURL(backupURL, inProgressURL); !moved.ok()) {
        TarnLog(kLogError, kTag, moveFailureFormat, moved.error());
        return std::nullopt;
    }
    return inProgressURL;
}

void installEachRestoredContainer(const FileURL& inProgressURL, TarnContainerClass containerClass,
                                  const char* listFailureFormat, TarnClientConnection& connection) {
    auto children = TarnFileManager::defaultManager().urlsForItemsInDirectoryAtURL(inProgressURL);
    if (!children.ok()) {
        TarnLog(kLogError, "rebootKeeperSetup", listFailureFormat, inProgressURL, children.error());
        return;
    }
    for (const FileURL& child : *children)
        _moveSystemContainerIntoPlace(child, containerClass, connection);
}

// System containers restored from a backup, for the current context's user.
void installRestoredSystemContainers(TarnClientConnection& connection) {
    static constexpr const char* kTag = "rebootKeeperSetup";
    auto& configuration = TarnGlobalConfiguration::sharedInstance();
    const TarnUserIdentityRef userIdentity =
        connection.userIdentityCache().userIdentityForCurrentContext(std::nullopt);
    const std::shared_ptr<TarnPerUserConfiguration> perUser =
        configuration.getPerUserConfigurationForUserIdentity(userIdentity);
    if (!perUser) return;

    const std::optional<FileURL> systemInProgress =
        moveBackupToInProgress(perUser->systemContainerBackupDirectory(),
                               "Failed to move system containers to inprogress: %@");
    const std::optional<FileURL> groupInProgress =
        moveBackupToInProgress(perUser->systemGroupContainerBackupDirectory(),
                               "Failed to move shared system containers to inprogress: %@");
    if (systemInProgress) {
        TarnLog(kLogError, kTag, "Installing system containers");
        installEachRestoredContainer(*systemInProgress, TarnContainerClassSystemData,
                                     "Couldn't find any system containers at %@: %@", connection);
    }
    if (groupInProgress) {
        TarnLog(kLogError, kTag, "Installing system group containers");
        installEachRestoredContainer(*groupInProgress, TarnContainerClassSystemGroup,
                                     "Couldn't find any system shared containers at %@: %@",
                                     connection);
    }
    // Internal builds keep what failed to install for a person to look at.
    if (configuration.isInternalImage()) return;
    const FileURL baseURL = perUser->systemContainerBackupBaseDirectory();
    if (const TarnStatus removed = TarnFileManager::defaultManager().removeItemAtURL(baseURL);
        !removed.ok())
        TarnLog(kLogError, kTag, "Failed to remove system container base dir %@: %@", baseURL,
                removed.error());
}

// Application groups that no stored entitlement names any more.
void reconcileApplicationGroups() {
    // The staged deletions run without their own locking.
    TarnGlobalLockHolder lock(TarnGlobalLockHolder::Mode::Write);
    TarnCommandQueue queue;
    TarnGroupManager::defaultManager().reconcileGroupContainersOfType(TarnGroupTypeApplication,
                                                                      &queue);
    // Every queued deletion is tried: each logs its own failure.
    for (;;) {
        const TarnStatus ran = queue.executeNextCommandWithError();
        if (!ran.ok() && ran.code(TarnSuccess) == TarnErrorQueueEmpty) break;
    }
}

// Runs `block` for every accessible user whose home exists: one without a
// home has nothing to sweep, and asking for its directories would make them.
void forEachUserWithAHome(
    TarnUserIdentitySharedCache& users,
    const std::function<void(const TarnUserIdentityRef&, TarnPerUserConfiguration&)>& block) {
    auto& configuration = TarnGlobalConfiguration::sharedInstance();
    users.forEachAccessibleUserIdentitySynchronouslyExecuteBlock(
        [&](const TarnUserIdentityRef& userIdentity) {
            const std::shared_ptr<TarnPerUserConfiguration> perUser =
                configuration.getPerUserConfigurationForUserIdentity(userIdentity);
            if (perUser && perUser->existsUserBaseDirectory()) block(userIdentity, *perUser);
        });
}

// Where the orphan sweep of one class looks.
TarnResult<std::vector<FileURL>> listContainerDirectory(const std::optional<FileURL>& directory) {
    if (!directory) return TARN_ERROR_CODE(TarnErrorInvalidArgument, nullptr);
    return TarnFileManager::defaultManager().urlsForItemsInDirectoryAtURL(*directory);
}

}  // namespace

// ---- First start after boot ----

void TarnClientConnection::rebootKeeperSetup() {
    static constexpr const char* kTag = "rebootKeeperSetup";
    // An unreadable status file skips the upgrade work, as it does the migrations.
    if (const std::unique_ptr<TarnMigrationStatus> status =
            TarnMigrationStatus::initForSystemMigration();
        status && status->isBuildUpgrade()) {
        _regenerateAllSystemContainerPaths();
        if (const TarnStatus migrated =
                TarnContainerMigrator::sharedInstance().performSynchronousBuildUpgradeMigration(
                    *status);
            !migrated.ok())
            TarnLog(kLogError, kTag, "Failed to perform build upgrade migration : %@",
                    migrated.error());
        // A failed write logs itself; the next boot then counts as an upgrade again.
        (void)status->writeCurrentBuildInfoToDisk();
    }
    installRestoredSystemContainers(*this);
    if (deviceIsInMultiUserMode()) reconcileApplicationGroups();
}

void TarnClientConnection::_regenerateAllSystemContainerPaths() {
    TarnLog(kLogNotice, __func__, "Rolling system container directory UUIDs on disk");
    const TarnUserIdentityRef userIdentity = clientIdentity_
                                                 ? clientIdentity_->userIdentity()
                                                 : TarnUserIdentityCache::defaultUserIdentity();
    const TarnWhitelist& whitelist = TarnWhitelist::sharedWhitelist();
    for (TarnContainerClass containerClass :
         {TarnContainerClassSystemData, TarnContainerClassSystemGroup}) {
        auto containers = TarnContainerCache::sharedInstance().allContainersForUserIdentity(
            userIdentity, containerClass, /*transient=*/false, /*populateSandboxCache=*/false);
        if (!containers.ok()) {
            TarnLog(kLogError, __func__,
                    "Failed to get list of system containers for migration: %@",
                    containers.error());
            continue;
        }
        for (const TarnMetadataRef& container : *containers) {
            const std::string& identifier = container->identifier();
            // Well-known containers have fixed names that clients rely on.
            if (identifier.empty() ||
                whitelist.containerIdIsWellknown(identifier, containerClass) ||
                identifier == kAnalyticsSystemGroup)
                continue;
            const TarnConcreteContainerIdentityRef identity = container->containerIdentity();
            if (!identity || !regenerateDirectoryUUIDWithContainerIdentity(identity).ok())
                TarnLog(kLogError, __func__,
                        "Failed to regenerate directory UUID for identifier: %@, class: %llu",
                        identifier, containerClass);
        }
    }
}

// ---- Every start ----

void TarnClientConnection::keeperSetup() {
    if (auto recovered = _recoverFromReplaceOperationsWithError(); !recovered)
        TarnLog(kLogError, "keeperSetup", "Failed recovering from replace operations: %@",
                recovered.error());
    if (auto restarted = TarnDataProtectionManager::defaultManager()
                             .restartPendingDataProtectionOperationsWithError();
        !restarted)
        TarnLog(kLogError, "keeperSetup",
                "Failed restarting pending data protection operations: %@", restarted.error());
}

// ---- Clean-up after boot ----

void TarnClientConnection::rebootKeeperCleanupWithCompletion(std::function<void()> completion) {
    static constexpr const char* kTag = "rebootKeeperCleanupWithCompletion";
    Transaction::begin();  // ended once the completion has run
    // A step that throws costs the rest of the listing, never the completion.
    (void)TarnFenceExceptions(kTag, [&] {
        auto& configuration = TarnGlobalConfiguration::sharedInstance();
        // Transient data does not outlive a boot.
        auto discard = [&](const FileURL& url, const char* failureFormat) {
            if (const TarnStatus moved = _moveItemAtURLToDeathRow(url, true, false); !moved.ok())
                TarnLog(kLogError, kTag, failureFormat, url, moved.error());
        };
        discard(configuration.transientDirectory(),
                "Failed to delete shared transient URL %@ : %@");
        if (const std::optional<FileURL> legacyURL =
                configuration.legacyTransientBundleDirectory()) {
            TarnLog(kLogNotice, kTag,
                    "Sentencing legacy transient bundle directory [%@] to final deletion",
                    *legacyURL);
            discard(*legacyURL, "Failed to delete legacy shared transient bundle URL %@ : %@");
        }
        discard(configuration.transientBundleDirectory(),
                "Failed to delete shared transient bundle URL %@ : %@");

        forEachUserWithAHome(
            userIdentityCache_, [&](const TarnUserIdentityRef&, TarnPerUserConfiguration& perUser) {
                discard(perUser.transientDirectory(),
                        "Failed to delete per-user transient URL %@ : %@");
                for (TarnContainerClass containerClass : {2, 4, 6, 7, 9, 10, 11})
                    _submitOrphanSweep(
                        listContainerDirectory(perUser.containerDirectoryURLForContentClass(
                            containerClass, /*transient=*/false)),
                        containerClass);
            });
        const TarnUserIdentityRef defaultUser = TarnUserIdentityCache::defaultUserIdentity();
        for (TarnContainerClass containerClass : {1, 3, 5, 8, 12, 13})
            _submitOrphanSweep(
                listContainerDirectory(configuration.containerDirectoryURLForUserIdentity(
                    defaultUser, containerClass, /*transient=*/false)),
                containerClass);
        backgroundQueue_->async([this] {
            (void)TarnFenceExceptions("_cleanupOprhanedCodeSigningMappingData",
                                      [this] { _cleanupOprhanedCodeSigningMappingData(); });
        });
    });
    backgroundQueue_->async([completion = std::move(completion)] {
        (void)TarnFenceExceptions(kTag, [&] {
            if (completion) completion();
        });
        Transaction::end();
    });
}

void TarnClientConnection::_submitOrphanSweep(TarnResult<std::vector<FileURL>> directories,
                                              TarnContainerClass containerClass) {
    backgroundQueue_->async([this, directories = std::move(directories), containerClass] {
        (void)TarnFenceExceptions("_cleanupOrphanedDataForDirectories", [&] {
            _cleanupOrphanedDataForDirectories(directories, containerClass);
        });
    });
}

void TarnClientConnection::_cleanupOrphanedDataForDirectories(
    const TarnResult<std::vector<FileURL>>& directories, TarnContainerClass containerClass) {
    if (!directories.ok()) {
        if (!isNoSuchFile(directories.error()))
            TarnLog(kLogError, __func__, "Failed to get items : %@", directories.error());
        return;
    }
    auto& fm = TarnFileManager::defaultManager();
    const TarnContainerCache& cache = TarnContainerCache::sharedInstance();
    const bool internal = TarnGlobalConfiguration::sharedInstance().isInternalImage();
    for (const FileURL& directory : *directories) {
        if (fm.itemDoesNotExistAtURL(directory)) {
            TarnLog(kLogNotice, __func__, "Ignoring deleted container path during cleanup: [%@]",
                    directory);
            continue;
        }
        if (cache.containerURL(directory, containerClass)) {
            if (fm.itemExistsAtURL(PathJoin(directory, kTarnMetadataFileName))) continue;
            TarnLog(kLogNotice, __func__, "Deleting orphaned data missing a metadata file at: %@",
                    directory);
        }
        if (internal) {
            TarnLog(kLogError, __func__,
                    "***INTERNAL BUILD REQUEST: please file a problem report against tarnkeeperd "
                    "with this log attached***");
            TarnLog(kLogError, __func__,
                    "\tSomeone is writing invalid data to a container, which has now been "
                    "orphaned. Here are the invalid files:");
            fm.printDirectoryStructureAtURL(directory);
            TarnLog(kLogError, __func__, "***END INTERNAL BUILD REQUEST");
        }
        // A move that fails leaves the directory for the sweep of the next boot.
        (void)_moveItemAtURLToDeathRow(directory, /*isDir=*/true, /*startDeletionThread=*/false);
    }
}

void TarnClientConnection::_cleanupOprhanedCodeSigningMappingData() {
    TarnCodeSigningMapping* mapping = TarnCodeSigningMapping::sharedInstance();
    if (!mapping) return;  // no store: nothing recorded in advance either
    if (const TarnStatus removed = mapping->removeAllAdvanceCopiesWithError(); !removed.ok())
        TarnLog(kLogError, __func__, "Could not remove advance copies of code sign data: %@",
                removed.error());
}

// ---- Clean-up at every start ----

void TarnClientConnection::keeperCleanupWithCompletion(std::function<void()> completion) {
    static constexpr const char* kTag = "keeperCleanupWithCompletion";
    Transaction::begin();  // ended once the completion has run
    std::vector<FileURL> staged;
    (void)TarnFenceExceptions(kTag, [&] {
        auto& configuration = TarnGlobalConfiguration::sharedInstance();
        auto& fm = TarnFileManager::defaultManager();
        const FileURL globalStagingURL = configuration.stagingDirectory();
        if (auto items = fm.urlsForItemsInDirectoryAtURL(globalStagingURL); items.ok())
            staged = std::move(*items);
        else if (!isNoSuchFile(items.error()))
            TarnLog(kLogError, kTag, "Failed to get items at global staging URL: %@ : %@",
                    globalStagingURL, items.error());
        // Nothing is staged below a home that does not exist.
        forEachUserWithAHome(
            userIdentityCache_,
            [&](const TarnUserIdentityRef& userIdentity, TarnPerUserConfiguration&) {
                const FileURL stagingURL = configuration.stagingDirectoryURLForUserIdentity(
                    userIdentity, TarnContainerClassAppData);
                auto items = fm.urlsForItemsInDirectoryAtURL(stagingURL);
                if (items.ok())
                    staged.insert(staged.end(), items->begin(), items->end());
                else if (!isNoSuchFile(items.error()))
                    TarnLog(kLogError, kTag, "Failed to get items at per-user staging URL: %@ : %@",
                            stagingURL, items.error());
            });
    });
    backgroundQueue_->async([this, staged = std::move(staged), completion = std::move(completion)] {
        (void)TarnFenceExceptions(kTag, [&] {
            // A failed move leaves the item for the sweep of the next start.
            for (const FileURL& item : staged)
                (void)_moveItemAtURLToDeathRow(item, /*isDir=*/true, /*startDeletionThread=*/false);
        });
        deleteContainersOnDeathRowWithCompletion([completion](uint64_t) {
            (void)TarnFenceExceptions(kTag, [&] {
                if (completion) completion();
            });
            Transaction::end();
        });
    });
}

}  // namespace tarn
