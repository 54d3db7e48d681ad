#include "Daemon/TarnContainerMigrator.h"

#include <charconv>
#include <memory>

#include "Daemon/TarnClientConnection.h"
#include "Daemon/TarnCodeSigningMapping.h"
#include "Daemon/TarnCommandQueue.h"
#include "Daemon/TarnContainerCache.h"
#include "Daemon/TarnDaemon.h"
#include "Daemon/TarnDataProtectionManager.h"
#include "Daemon/TarnExceptionFence.h"
#include "Daemon/TarnFileManager.h"
#include "Daemon/TarnGlobalConfiguration.h"
#include "Daemon/TarnLog.h"
#include "Daemon/TarnMigrationStatus.h"
#include "Daemon/TarnPerUserConfiguration.h"
#include "Daemon/TarnUserIdentityCache.h"
#include "Daemon/TarnWhitelist.h"
#include "Platform/HostConfiguration.h"
#include "Platform/RootPrefix.h"

namespace tarn {

namespace {

// Where bundle containers lived when they still belonged to the mobile user.
constexpr const char* kOldBundleContainerLocation = "/private/var/mobile/Containers/Bundle";
// Owner of bundle container content: the installer's user and group.
constexpr uid_t kBundleContentOwner = 33;

// The per-user classes whose subdirectories the per-user migration recreates.
constexpr TarnContainerClass kSubdirectoryClasses[] = {TarnContainerClassAppData,
                                                       TarnContainerClassPluginData,
                                                       TarnContainerClassVPNPluginData,
                                                       TarnContainerClassAppGroup,
                                                       TarnContainerClassConduitServiceData,
                                                       TarnContainerClassDaemonData,
                                                       TarnContainerClassTempDir};

bool multiUserMode() {
    const auto& flags = HostConfiguration::shared().multiUserFlags;
    return flags && (*flags & 0x80000000u) != 0;
}

TarnContainerCache& cache() { return TarnContainerCache::sharedInstance(); }
TarnFileManager& fileManager() { return TarnFileManager::defaultManager(); }
TarnGlobalConfiguration& configuration() { return TarnGlobalConfiguration::sharedInstance(); }

// A user without a home has no containers to migrate; looking for them would
// create directories below the missing home.
bool hasHome(const TarnUserIdentityRef& userIdentity) {
    return configuration()
        .getPerUserConfigurationForUserIdentity(userIdentity)
        ->existsUserBaseDirectory();
}

// The rotation number of a rotated log file ("name.N"), if it has one.
std::optional<uint32_t> rotationNumber(const std::string& name) {
    const size_t dot = name.rfind('.');
    if (dot == std::string::npos || dot + 1 == name.size()) return std::nullopt;
    uint32_t n = 0;
    const char* first = name.data() + dot + 1;
    const char* last = name.data() + name.size();
    auto [end, ec] = std::from_chars(first, last, n);
    if (ec != std::errc() || end != last) return std::nullopt;
    return n;
}

}  // namespace

TarnContainerMigrator& TarnContainerMigrator::sharedInstance() {
    static TarnContainerMigrator migrator(TarnUserIdentitySharedCache::sharedInstance());
    return migrator;
}

const std::vector<std::pair<std::string, TarnContainerClass>>&
TarnContainerMigrator::deprecatedContainers() {
    // Platform configuration: the data containers of an application and its
    // plug-in that the platform no longer ships.
    static const std::vector<std::pair<std::string, TarnContainerClass>> table = {
        {"com.ostrea.LegacyShelf", TarnContainerClassAppData},
        {"com.ostrea.LegacyShelf.TodayWidget", TarnContainerClassPluginData},
    };
    return table;
}

// ---- build upgrade ----

TarnStatus TarnContainerMigrator::performSynchronousBuildUpgradeMigration(
    TarnMigrationStatus& status) {
    return TarnFenceExceptions(__func__, [&]() -> TarnStatus {
        _migrateLogFiles();
        TARN_TRY(_migrateBundleContainerLocation());
        _checkIfDeviceMayNeedSystemContainerACLMigration(status);
        if (TarnStatus wellKnown = _performWhitelistMigration(); !wellKnown.ok()) {
            TarnLog(kLogError, "performSynchronousBuildUpgradeMigration",
                    "Failed to migrate whitelisted bundle containers : %@", wellKnown.error());
            return wellKnown;
        }
        return {};
    });
}

void TarnContainerMigrator::_migrateLogFiles() {
    static constexpr const char* kTag = "_migrateLogFiles";
    if (multiUserMode()) return;
    const FileURL oldDirectory =
        configuration()
            .getPerUserConfigurationForUserIdentity(TarnUserIdentityCache::defaultUserIdentity())
            ->oldLoggingPath();
    if (oldDirectory.empty()) return;
    TarnResult<std::vector<FileURL>> items =
        fileManager().urlsForItemsInDirectoryAtURL(oldDirectory);
    if (!items.ok()) {
        if (!(items.error() && items.error()->posixCode() == ENOENT))
            TarnLog(kLogError, kTag, "Failed to get items for deletion: %@ : %@", oldDirectory,
                    items.error());
    } else {
        // Rotated files go one number up, as if the log had rotated once more;
        // those that would be beyond the kept count go with the old directory.
        const uint32_t rotations = TarnLogRotationCount();
        const FileURL logDirectory = configuration().logDirectory();
        for (const FileURL& item : *items) {
            const std::string name = PathLastComponent(item);
            const std::optional<uint32_t> n = rotationNumber(name);
            if (!n || *n >= rotations) continue;
            const std::string moved = name.substr(0, name.rfind('.') + 1) + std::to_string(*n + 1);
            if (TarnStatus done = fileManager().moveItemAtURL(item, PathJoin(logDirectory, moved));
                !done.ok()) {
                TarnLog(kLogError, kTag, "Failed to move to new logging directory from %@ : %@",
                        item, done.error());
            }
        }
        TarnLog(kLogNotice, kTag, "Migrated log files on %@",
                TarnMigrationStatus::currentBuildVersion());
    }
    if (TarnStatus removed = fileManager().removeItemAtURL(oldDirectory); !removed.ok())
        TarnLog(kLogError, kTag, "Failed to remove old Log directory: %@", removed.error());
}

TarnStatus TarnContainerMigrator::_migrateBundleContainerLocation() {
    static constexpr const char* kTag = "_migrateBundleContainerLocation";
    const FileURL oldLocation = RootPath(kOldBundleContainerLocation);
    if (!fileManager().itemExistsAtURL(oldLocation)) return {};
    TarnLog(kLogNotice, kTag, "Moving bundle containers from user to system location");
    // The global place exists (its getter makes it) and is empty on a device
    // that still has the old one: the rename replaces it.
    if (TarnStatus moved =
            fileManager().moveItemAtURL(oldLocation, configuration().bundleDirectory());
        !moved.ok()) {
        TarnLog(kLogError, kTag,
                "Failed to migrate to new bundle containers location : %@.  This is terrible.",
                moved.error());
        return moved;
    }
    return {};
}

void TarnContainerMigrator::_checkIfDeviceMayNeedSystemContainerACLMigration(
    TarnMigrationStatus& status) {
    if (status.hasMigrationOccurredForType(kTarnMigrationTypeACL)) return;
    for (TarnContainerClass systemClass :
         {TarnContainerClassSystemData, TarnContainerClassSystemGroup}) {
        const std::optional<FileURL> base = configuration().globalContainerBaseURLWithContentClass(
            systemClass, /*transient=*/false);
        if (base && !fileManager().itemDoesNotExistAtURL(*base)) return;
    }
    TarnLog(kLogNotice, "_checkIfDeviceMayNeedSystemContainerACLMigration",
            "No system containers requiring ACL migration");
    (void)status.setMigrationCompleteForType(
        kTarnMigrationTypeACL);  // a failed write is logged there
}

TarnStatus TarnContainerMigrator::_performWhitelistMigration() {
    static constexpr const char* kTag = "_performWhitelistMigration";
    const TarnUserIdentityRef userIdentity = TarnUserIdentityCache::defaultUserIdentity();
    const TarnWhitelist& wellKnown = TarnWhitelist::sharedWhitelist();
    for (TarnContainerClass systemClass :
         {TarnContainerClassSystemData, TarnContainerClassSystemGroup}) {
        // No base directory, no containers to rename; listing would make it.
        const std::optional<FileURL> base = configuration().globalContainerBaseURLWithContentClass(
            systemClass, /*transient=*/false);
        if (!base || !fileManager().itemExistsAtURL(*base)) continue;
        TarnResult<std::vector<TarnMetadataRef>> containers =
            cache().allContainersForUserIdentity(userIdentity, systemClass, /*transient=*/false);
        if (!containers.ok()) {
            TarnLog(kLogError, kTag,
                    "Failed to get list of system containers for migration: (error= %@ : %lld)",
                    containers.error(), containers.code(TarnErrorCacheRebuildFailed));
            return containers.error();
        }
        for (const TarnMetadataRef& container : *containers) {
            const std::string& identifier = container->identifier();
            if (!wellKnown.containerIdIsWellknown(identifier, systemClass)) continue;
            const std::optional<std::string> name =
                wellKnown.wellknownContainerForId(identifier, systemClass);
            if (!name) continue;
            const FileURL target = PathJoin(*base, *name);
            if (container->url() == target) continue;
            TarnLog(kLogNotice, kTag, "Migrating well-known container %@ from %@ to %@", identifier,
                    container->url(), target);
            if (TarnStatus removed = cache().removeContainerForUserIdentity(
                    container->userIdentity(), systemClass, identifier, /*transient=*/false);
                !removed.ok()) {
                TarnLog(
                    kLogError, kTag,
                    "%s: Failed to remove cache for whitelisted container %@: (error= %@: %lld)",
                    kTag, identifier, removed.error(), removed.code(TarnErrorCacheRemoveFailed));
                return removed;
            }
            if (TarnStatus moved = fileManager().moveItemAtURL(container->url(), target);
                !moved.ok()) {
                TarnLog(kLogError, kTag,
                        "%s: Failed to move system container %@ from %@ to whitelisted location "
                        "%@: (error= %@: %lld)",
                        kTag, identifier, container->url(), target, moved.error(),
                        moved.code(TarnErrorMoveFailed));
                return moved;
            }
            TarnMutableMetadataRef changed = container->copy();
            changed->setUrl(target);
            if (TarnStatus added =
                    cache().addContainerMetadata(changed, target, /*transient=*/false,
                                                 /*updateSandbox=*/true);
                !added.ok()) {
                TarnLog(
                    kLogError, kTag,
                    "%s: Failed to update cache for whitelisted container %@: (error= %@: %lld)",
                    kTag, identifier, added.error(), added.code(TarnErrorCacheAddFailed));
                return added;
            }
        }
    }
    return {};
}

// ---- data migrator ----

TarnStatus TarnContainerMigrator::performDataMigratorMigrationForClientConnection(
    TarnClientConnection& connection) {
    static constexpr const char* kTag = "performDataMigratorMigrationForClientConnection";
    return TarnFenceExceptions(kTag, [&]() -> TarnStatus {
        TarnLog(kLogNotice, kTag, "Performing Data Migration on %@",
                TarnMigrationStatus::currentBuildVersion());
        // An unreadable status file: the initialiser has said so, and the
        // recorded migrations wait for a readable one.
        if (std::unique_ptr<TarnMigrationStatus> status =
                TarnMigrationStatus::initForSystemMigration()) {
            if (!status->hasMigrationOccurredForType(kTarnMigrationTypeACL)) {
                if (TarnStatus acl = _performInternalACLMigration(); acl.ok())
                    (void)status->setMigrationCompleteForType(
                        kTarnMigrationTypeACL);  // logged there
                else
                    TarnLog(kLogError, kTag, "Failed to migrate ACLs on system containers : %@",
                            acl.error());
            }
            if (!status->hasMigrationOccurredForType(kTarnMigrationTypeBundle)) {
                if (TarnStatus owner = _performBundleContainerOwnershipMigration(); owner.ok())
                    (void)status->setMigrationCompleteForType(
                        kTarnMigrationTypeBundle);  // logged there
                else
                    TarnLog(kLogError, kTag,
                            "Failed to migrate bundle containers to system location : %@",
                            owner.error());
            }
        }
        if (TarnCodeSigningMapping* mapping = TarnCodeSigningMapping::sharedInstance())
            mapping->performAllCodeSigningMigrationAndReconciliationWithCommandQueue(
                connection.commandQueue().get());
        return {};
    });
}

TarnStatus TarnContainerMigrator::_performInternalACLMigration() {
    static constexpr const char* kTag = "_performInternalACLMigration";
    TarnStatus result;
    const std::pair<TarnContainerClass, const char*> passes[] = {
        {TarnContainerClassSystemData, "Failed to set ACLs on system containers : %@"},
        {TarnContainerClassSystemGroup, "Failed to set ACLs on system group containers : %@"},
    };
    for (const auto& [systemClass, failure] : passes) {
        const std::optional<FileURL> base = configuration().globalContainerBaseURLWithContentClass(
            systemClass, /*transient=*/false);
        if (!base || !fileManager().itemExistsAtURL(*base)) continue;
        if (TarnStatus done = fileManager().standardizeAllSystemContainerACLsAtURL(*base);
            !done.ok()) {
            TarnLog(kLogError, kTag, failure, done.error());
            result = done;
        }
    }
    return result;
}

TarnStatus TarnContainerMigrator::_performBundleContainerOwnershipMigration() {
    TarnLog(kLogNotice, "_performBundleContainerOwnershipMigration",
            "Changing ownership of bundle container content.");
    const FileURL bundles = configuration().bundleDirectory();
    if (TarnStatus owned = fileManager().standardizeOwnershipAtURL(bundles, kBundleContentOwner,
                                                                   kBundleContentOwner);
        !owned.ok()) {
        return TARN_ERROR(TarnErrorChangeOwnerFailed, owned.error(),
                          "Failed to change owner of %@: %@", bundles, owned.error());
    }
    return {};
}

// ---- per user ----

TarnStatus TarnContainerMigrator::performPerUserDataMigrationForClientConnection(
    TarnClientConnection& connection) {
    static constexpr const char* kTag = "performPerUserDataMigrationForClientConnection";
    return TarnFenceExceptions(kTag, [&]() -> TarnStatus {
        TarnLog(kLogNotice, kTag,
                "Container data migration requested by %@ for current mobile user: %u",
                connection.clientBundleIdentifier(), configuration().currentMobileUserId());
        TarnStatus result;
        std::unique_ptr<TarnMigrationStatus> status =
            TarnMigrationStatus::initForMobileUserMigration();
        if (status && !status->hasMigrationOccurredForType(kTarnMigrationTypeSubdirectory)) {
            if (TarnStatus subdirectories = _performPerUserSubdirectoryMigration();
                subdirectories.ok())
                (void)status->setMigrationCompleteForType(
                    kTarnMigrationTypeSubdirectory);  // logged there
            else
                result = subdirectories;
        }
        if (TarnStatus protection = _performPerUserDataProtectionMigration(); !protection.ok())
            result = protection;
        _deleteDeprecatedContainers(connection);
        return result;
    });
}

TarnStatus TarnContainerMigrator::_performPerUserSubdirectoryMigration() {
    static constexpr const char* kTag = "_performPerUserSubdirectoryMigration";
    TarnStatus result;
    userIdentityCache_.forEachAccessibleUserIdentitySynchronouslyExecuteBlock(
        [&](const TarnUserIdentityRef& userIdentity) {
            if (!hasHome(userIdentity)) return;
            TarnLog(kLogNotice, kTag, "Performing Per User Subdirectory Migration for %@ on %@",
                    userIdentity, TarnMigrationStatus::currentBuildVersion());
            std::shared_ptr<TarnClientConnection> connection =
                TarnClientConnection::privilegedClientConnectionWithUserIdentity(userIdentity);
            bool succeeded = true;
            for (TarnContainerClass containerClass : kSubdirectoryClasses) {
                TarnResult<std::vector<TarnMetadataRef>> containers =
                    cache().allContainersForUserIdentity(userIdentity, containerClass,
                                                         /*transient=*/false);
                if (!containers.ok()) {
                    TarnLog(
                        kLogError, kTag,
                        "Failed to fetch list of containers for userIdentity: %@, class %ld : %@",
                        userIdentity, static_cast<int64_t>(containerClass), containers.error());
                    result = containers.error();
                    succeeded = false;
                    continue;
                }
                for (const TarnMetadataRef& container : *containers) {
                    const TarnStatus made =
                        connection->recreateDefaultStructureWithContainerIdentity(
                            container->containerIdentity());
                    if (made.ok()) continue;
                    const uint64_t code = made.code(TarnErrorCreateDirectoryFailed);
                    result = TARN_ERROR_IN(
                        kTag, code, made.error(),
                        "Failed to recreate container directory structure for %@:%ld:%@ : %llu",
                        userIdentity, static_cast<int64_t>(containerClass), container->identifier(),
                        code);
                    succeeded = false;
                }
            }
            TarnLog(kLogNotice, kTag,
                    "Completed Per User Subdirectory Migration for %@ on %@ : Success: %c",
                    userIdentity, TarnMigrationStatus::currentBuildVersion(),
                    succeeded ? 'Y' : 'N');
        });
    return result;
}

TarnStatus TarnContainerMigrator::_performPerUserDataProtectionMigration() {
    static constexpr const char* kTag = "_performPerUserDataProtectionMigration";
    TarnStatus result;
    userIdentityCache_.forEachAccessibleUserIdentitySynchronouslyExecuteBlock(
        [&](const TarnUserIdentityRef& userIdentity) {
            if (!hasHome(userIdentity)) return;
            TarnLog(kLogNotice, kTag, "Performing User Data Protection Migration for %@ on %@",
                    userIdentity, TarnMigrationStatus::currentBuildVersion());
            bool succeeded = true;
            for (TarnContainerClass dataClass :
                 {TarnContainerClassAppData, TarnContainerClassPluginData}) {
                TarnResult<std::vector<TarnMetadataRef>> containers =
                    cache().allContainersForUserIdentity(userIdentity, dataClass,
                                                         /*transient=*/false);
                if (!containers.ok()) {
                    TarnLog(kLogError, kTag,
                            "Failed to fetch list of data containers for userIdentity: %@, class: "
                            "%ld: %@",
                            userIdentity, static_cast<int64_t>(dataClass), containers.error());
                    result = containers.error();
                    succeeded = false;
                    continue;
                }
                for (const TarnMetadataRef& container : *containers)
                    _setDataProtectionIfNecessaryOnContainer(container);
            }
            TarnLog(kLogNotice, kTag,
                    "Completed User Data Protection Migration for %@ on %@ : Success: %c",
                    userIdentity, TarnMigrationStatus::currentBuildVersion(),
                    succeeded ? 'Y' : 'N');
        });
    return result;
}

void TarnContainerMigrator::_deleteDeprecatedContainers(TarnClientConnection& connection) {
    static constexpr const char* kTag = "_deleteDeprecatedContainers";
    TarnCodeSigningMapping* mapping = TarnCodeSigningMapping::sharedInstance();
    const TarnClientIdentityRef& client = connection.clientIdentity();
    const uid_t uid = client ? client->posixUID() : configuration().currentMobileUserId();
    const gid_t gid = client ? client->posixGID() : configuration().currentMobileGroupId();
    for (const auto& [identifier, containerClass] : deprecatedContainers()) {
        if (mapping) {
            // Its own queue, run at once: the groups only these records held
            // go now, whatever becomes of the request.
            auto queue = std::make_shared<TarnCommandQueue>();
            mapping->removeCodeSigningDictionariesForIdentifierAndItsChildren(identifier,
                                                                              queue.get());
            if (TarnStatus ran = queue->executeAllUntilExhaustedOrError(); !ran.ok())
                TarnLog(kLogError, kTag, "Failed to remove code signing info of deprecated %@ : %@",
                        identifier, ran.error());
        }
        const TarnUserIdentityRef userIdentity =
            userIdentityCache_.userIdentityForPersonalPersonaWithUID(uid, gid);
        TarnResult<TarnContainerIdentityRef> identity =
            userIdentity ? TarnContainerIdentity::containerIdentityWithUserIdentity(
                               userIdentity, identifier, containerClass)
                         : TarnResult<TarnContainerIdentityRef>(
                               TARN_ERROR_CODE(TarnErrorInvalidArgument, nullptr));
        if (!identity.ok()) {
            TarnLog(
                kLogError, kTag,
                "Could not create container identity when trying to remove deprecated [%llu:%@]",
                containerClass, identifier);
            continue;
        }
        const TarnStatus deleted =
            connection.deleteContainerWithContainerIdentity(*identity, /*transient=*/false);
        // Already gone is the usual case once the first migration has run.
        if (!deleted.ok() && deleted.code(TarnErrorDeleteFailed) != TarnErrorNotFound)
            TarnLog(kLogError, kTag, "Could not delete deprecated container [%llu:%@]: %llu",
                    containerClass, identifier, deleted.code(TarnErrorDeleteFailed));
    }
}

// ---- data protection of data containers ----

TarnResult<TarnMetadataRef> TarnContainerMigrator::_bundleContainerForDataContainer(
    const TarnMetadataRef& container) {
    std::string bundleIdentifier;
    switch (container->containerClass()) {
        case TarnContainerClassAppData:
            bundleIdentifier = container->identifier();
            break;
        case TarnContainerClassPluginData: {
            TarnCodeSigningMapping* mapping = TarnCodeSigningMapping::sharedInstance();
            bundleIdentifier =
                mapping ? mapping->parentIdentifierForChildIdentifier(container->identifier()) : "";
            // Not logged: a plug-in without a recorded parent is an ordinary case.
            if (bundleIdentifier.empty())
                return TARN_ERROR_SILENT(TarnErrorNotFound, nullptr, "No parent identifier for %@",
                                         container->identifier());
            break;
        }
        default:
            return TARN_ERROR(TarnErrorInvalidContainerClass, nullptr,
                              "Passed an unexpected container type: %llu",
                              container->containerClass());
    }
    // Bundle containers are global: they belong to the default user identity.
    TarnResult<TarnContainerIdentityRef> identity =
        TarnContainerIdentity::containerIdentityWithUserIdentity(
            TarnUserIdentityCache::defaultUserIdentity(), bundleIdentifier,
            TarnContainerClassAppBundle);
    if (!identity.ok()) {
        return TARN_ERROR(identity.code(TarnErrorInvalidArgument), identity.error(),
                          "Could not create container identity from [%@]", bundleIdentifier);
    }
    return cache().containerForContainerIdentity(*identity, /*transient=*/false,
                                                 /*updateSandbox=*/true);
}

void TarnContainerMigrator::_setDataProtectionIfNecessaryOnContainer(
    const TarnMetadataRef& container) {
    static constexpr const char* kTag = "_setDataProtectionIfNecessaryOnContainer";
    const TarnResult<TarnMetadataRef> bundle = _bundleContainerForDataContainer(container);
    // An application with a bundle container got its class when it was installed.
    if (bundle.ok()) return;
    if (bundle.code(TarnErrorInvalidArgument) != TarnErrorNotFound) {
        TarnLog(kLogError, kTag, "Error looking up bundle container for %@ : %@",
                container->identifier(), bundle.error());
        return;
    }
    TarnDataProtectionManager& manager = TarnDataProtectionManager::defaultManager();
    const int32_t intended = manager.intendedDataProtectionClassBasedOnEntitlementsForIdentifier(
        container->identifier());
    manager.setDataProtectionOnDataContainerForContainerIdentity(
        container->containerIdentity(), intended, /*isSecondOrThirdPartyApp=*/false,
        /*retryIfLocked=*/false,
        [intended, identifier = container->identifier(),
         containerClass = container->containerClass(),
         userIdentity = container->userIdentity()](uint64_t code) {
            if (code != TarnSuccess)
                TarnLog(kLogError, kTag, "Error setting protection class %d on %@:%llu (%@) : %llu",
                        intended, identifier, containerClass, userIdentity, code);
        });
}

}  // namespace tarn
