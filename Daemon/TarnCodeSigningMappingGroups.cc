// TarnCodeSigningMapping: reference counting of group containers. A group
// container has no owner; it goes when the last stored entitlement naming it
// drops it. Deletions are only queued here, never performed inline.
#include <algorithm>

#include "Daemon/TarnCodeSigningMapping.h"
#include "Daemon/TarnCommandQueue.h"
#include "Daemon/TarnCommandStageForDelete.h"
#include "Daemon/TarnContainerIdentity.h"
#include "Daemon/TarnGlobalConfiguration.h"
#include "Daemon/TarnLog.h"
#include "Daemon/TarnPerUserConfiguration.h"
#include "Daemon/TarnUserIdentityCache.h"
#include "Platform/PlatformLog.h"

namespace tarn {

namespace {

// A list of group identifiers as a log line shows it.
PlistValue describeGroupIdentifiers(const std::vector<std::string>& identifiers) {
    return PlistValue(PlistArray(identifiers.begin(), identifiers.end()));
}

}  // namespace

void TarnCodeSigningMapping::_onQueue_handleChangeFromOldGroupContainerIds(
    const std::optional<std::vector<std::string>>& oldGroupContainerIds,
    const std::optional<std::vector<std::string>>& toNewGroupContainerIds, TarnGroupType ofType,
    TarnCommandQueue* commandQueue) {
    assertOnQueue();
    if (!oldGroupContainerIds && !toNewGroupContainerIds) return;
    if (oldGroupContainerIds && toNewGroupContainerIds &&
        *oldGroupContainerIds == *toNewGroupContainerIds)
        return;
    if (!oldGroupContainerIds) return;  // nothing was named before, so nothing is dropped

    // Duplicates in the old list stay: each occurrence was counted once.
    std::vector<std::string> dropped;
    for (const std::string& group : *oldGroupContainerIds) {
        const bool kept = toNewGroupContainerIds &&
                          std::find(toNewGroupContainerIds->begin(), toNewGroupContainerIds->end(),
                                    group) != toNewGroupContainerIds->end();
        if (!kept) dropped.push_back(group);
    }
    _onQueue_removeReferenceForGroupIdentifiers(dropped, ofType, commandQueue);
}

void TarnCodeSigningMapping::_onQueue_removeReferenceForGroupIdentifiers(
    const std::vector<std::string>& groupIdentifiers, TarnGroupType ofType,
    TarnCommandQueue* commandQueue) {
    assertOnQueue();
    if (groupIdentifiers.empty()) return;
    // A type without entitlement keys has no counts; judging by an empty set
    // would read every group as unreferenced.
    if (ofType != TarnGroupTypeApplication && ofType != TarnGroupTypeSystem) {
        TarnLog(kLogError, "_onQueue_removeReferenceForGroupIdentifiers",
                "Failed to get reference count information for group type: %ld",
                static_cast<int64_t>(ofType));
        return;
    }
    const TarnCountedSet referenceCounts = _onQueue_copyReferenceCountSetOfType(ofType);

    // System-group containers hold platform state that a changed signature
    // must not take away.
    if (ofType == TarnGroupTypeSystem) {
        TarnLog(kLogNotice, "_onQueue_removeReferenceForGroupIdentifiers",
                "Would have removed system group container references for %@",
                describeGroupIdentifiers(groupIdentifiers));
        return;
    }

    // Tests that do no group clean-up build the mapping without users.
    if (!userIdentityCache_) return;
    userIdentityCache_->forEachAccessibleUserIdentitySynchronouslyExecuteBlock(
        [&](const TarnUserIdentityRef& userIdentity) {
            // A user whose home is missing has no containers to lose, and
            // looking them up would create directories below it.
            if (!TarnGlobalConfiguration::sharedInstance()
                     .getPerUserConfigurationForUserIdentity(userIdentity)
                     ->existsUserBaseDirectory())
                return;
            // Every user is judged on the same counts.
            TarnCountedSet counts = referenceCounts;
            _onQueue_removeGroupContainersIfNeededforUserIdentity(
                userIdentity, TarnContainerClassAppGroup, groupIdentifiers, counts, commandQueue);
        });
}

void TarnCodeSigningMapping::_onQueue_removeGroupContainersIfNeededforUserIdentity(
    const TarnUserIdentityRef& userIdentity, TarnContainerClass groupContainerClass,
    const std::vector<std::string>& identifiers, TarnCountedSet& referenceCounts,
    TarnCommandQueue* commandQueue) {
    assertOnQueue();
    for (const std::string& groupIdentifier : identifiers) {
        const size_t count = referenceCounts.countForObject(groupIdentifier);
        // The counts were taken before the changing identifier's new entry is
        // written, so 1 is its own old reference and nobody else's. 0 means
        // no stored entitlement names the group: boot reconciliation owns that.
        if (count == 1) {
            TarnResult<TarnContainerIdentityRef> identity =
                TarnContainerIdentity::containerIdentityWithUserIdentity(
                    userIdentity, groupIdentifier, groupContainerClass);
            if (identity.ok() && commandQueue) {
                commandQueue->insertCommand(
                    TarnCommandStageForDelete::commandForStageForDeleteWithContainerIdentities(
                        {std::move(*identity)}, /*useLocking=*/true,
                        [groupIdentifier, userIdentity](uint64_t error) {
                            TarnLog(
                                kLogError, "_onQueue_removeGroupContainersIfNeededforUserIdentity",
                                "Failed to destroy group container with identifier %@ for %@: %llu",
                                groupIdentifier, userIdentity, error);
                        }));
            }
        } else {
            PlatformLog("codesignmapping", PlatformLogType::Default,
                        "Reference count for user: %@, ID: %@ is %ld", userIdentity,
                        groupIdentifier, static_cast<int64_t>(count));
        }
        // A group dropped twice in one list is judged the second time on
        // what the first occurrence left.
        referenceCounts.removeObject(groupIdentifier);
    }
}

}  // namespace tarn
