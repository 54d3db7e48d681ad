#include "Daemon/TarnGroupManager.h"

#include "Daemon/TarnCommandQueue.h"
#include "Daemon/TarnCommandStageForDelete.h"
#include "Daemon/TarnContainerCache.h"
#include "Daemon/TarnExceptionFence.h"
#include "Daemon/TarnGlobalConfiguration.h"
#include "Daemon/TarnLocks.h"
#include "Daemon/TarnLog.h"
#include "Daemon/TarnPerUserConfiguration.h"
#include "Daemon/TarnUserIdentityCache.h"

namespace tarn {

TarnGroupManager& TarnGroupManager::defaultManager() {
    static auto* shared = new TarnGroupManager(TarnUserIdentitySharedCache::sharedInstance());
    return *shared;
}

TarnGroupManager::TarnGroupManager(TarnUserIdentitySharedCache& userIdentityCache)
    : userIdentityCache_(userIdentityCache) {}

void TarnGroupManager::reconcileGroupContainersOfType(TarnGroupType type,
                                                      TarnCommandQueue* commandQueue) {
    TarnCodeSigningMapping* mapping = TarnCodeSigningMapping::sharedInstance();
    // Without the store, or for a type without entitlement keys, every group
    // would read as unreferenced: better to remove nothing.
    if (!mapping || (type != TarnGroupTypeApplication && type != TarnGroupTypeSystem)) {
        TarnLog(kLogError, "reconcileGroupContainersOfType",
                "Failed to get reference count information for group type: %ld",
                static_cast<int64_t>(type));
        return;
    }
    const TarnCountedSet referenceCounts = mapping->copyReferenceCountSetOfType(type);

    if (type == TarnGroupTypeSystem) {
        // System groups are global: one list serves every user.
        _cleanupUnreferencedGroupContainersForUserIdentity(
            TarnUserIdentityCache::defaultUserIdentity(), TarnContainerClassSystemGroup,
            referenceCounts, commandQueue);
        return;
    }
    userIdentityCache_.forEachAccessibleUserIdentitySynchronouslyExecuteBlock(
        [&](const TarnUserIdentityRef& userIdentity) {
            // A user whose home is missing has no containers to lose, and
            // listing them would create directories below it.
            if (!TarnGlobalConfiguration::sharedInstance()
                     .getPerUserConfigurationForUserIdentity(userIdentity)
                     ->existsUserBaseDirectory())
                return;
            _cleanupUnreferencedGroupContainersForUserIdentity(
                userIdentity, TarnContainerClassAppGroup, referenceCounts, commandQueue);
        });
}

void TarnGroupManager::_cleanupUnreferencedGroupContainersForUserIdentity(
    const TarnUserIdentityRef& userIdentity, TarnContainerClass containerClass,
    const TarnCountedSet& referenceCounts, TarnCommandQueue* commandQueue) {
    TarnResult<std::vector<TarnMetadataRef>> containers =
        TarnContainerCache::sharedInstance().allContainersForUserIdentity(
            userIdentity, containerClass, /*transient=*/false);
    if (!containers.ok()) {
        TarnLog(kLogError, "_cleanupUnreferencedGroupContainersForUserIdentity",
                "Failed to fetch group container list for %@: %@", userIdentity,
                containers.error());
        return;
    }
    for (const TarnMetadataRef& container : *containers) {
        if (referenceCounts.countForObject(container->identifier()) != 0) continue;
        TarnLog(kLogError, "_cleanupUnreferencedGroupContainersForUserIdentity",
                "Removing group container %@ for %@ at %@", container->identifier(), userIdentity,
                container->url());
        // The exact container found (by its UUID), not whichever one holds the
        // identifier by the time the command runs.
        TarnContainerIdentityRef identity = container->containerIdentity();
        if (!identity || !commandQueue) continue;
        // Without locking: the caller holds the global write lock for the
        // whole boot pass.
        commandQueue->insertCommand(
            TarnCommandStageForDelete::commandForStageForDeleteWithContainerIdentities(
                {std::move(identity)}, /*useLocking=*/false,
                [groupIdentifier = container->identifier(), userIdentity](uint64_t error) {
                    TarnLog(kLogError, "_cleanupUnreferencedGroupContainersForUserIdentity",
                            "Failed to destroy group container with identifier %@ for %@: %llu",
                            groupIdentifier, userIdentity, error);
                }));
    }
}

TarnResult<std::vector<std::string>> TarnGroupManager::groupContainerIdentifiersForOwnerIdentifier(
    const std::optional<std::string>& ownerIdentifier, TarnContainerClass groupContainerClass,
    bool useLocking) {
    if (!ownerIdentifier) {
        return TARN_ERROR(TarnErrorInvalidArgument, nullptr,
                          "Can't act on an invalid object: ID: %@", ownerIdentifier);
    }
    // Held around the fence, so it is let go however the look-up ends.
    TarnGlobalLockHolder lock(useLocking ? TarnGlobalLockHolder::Mode::Write
                                         : TarnGlobalLockHolder::Mode::None);
    return TarnFenceExceptions(
        "groupContainerIdentifiersForOwnerIdentifier",
        [&]() -> TarnResult<std::vector<std::string>> {
            TarnCodeSigningMapping* mapping = TarnCodeSigningMapping::sharedInstance();
            // No store: nothing is known about the owner, as for an owner
            // without group entitlements.
            if (!mapping) return std::vector<std::string>{};
            std::optional<std::vector<std::string>> groups =
                groupContainerClass == TarnContainerClassSystemGroup
                    ? mapping->systemGroupIdentifiersForIdentifier(*ownerIdentifier)
                    : mapping->appGroupIdentifiersForIdentifier(*ownerIdentifier);
            if (!groups) return std::vector<std::string>{};
            return std::move(*groups);
        });
}

}  // namespace tarn
