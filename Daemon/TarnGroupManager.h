// TarnGroupManager: group containers as a whole. The boot reconciliation
// removes the group containers no stored entitlement names any more, and the
// owner look-up answers which groups an identifier may use.
//
// One shared object (defaultManager), made on first use, living for the
// whole process. It holds no state of its own: the reference counts come
// from the code-signing mapping, the containers from the container cache.
// Deletions are staged on the caller's command queue, never done inline.
#pragma once

#include <optional>
#include <string>
#include <vector>

#include "Daemon/TarnCodeSigningMapping.h"
#include "Daemon/TarnContainerClass.h"
#include "Daemon/TarnResult.h"
#include "Daemon/TarnUserIdentity.h"

namespace tarn {

class TarnCommandQueue;
class TarnUserIdentitySharedCache;

class TarnGroupManager {
  public:
    static TarnGroupManager& defaultManager();
    // initWithUserIdentityCache:
    explicit TarnGroupManager(TarnUserIdentitySharedCache& userIdentityCache);

    TarnUserIdentitySharedCache& userIdentityCache() const { return userIdentityCache_; }

    // Stages the deletion of every group container of the type that no stored
    // entitlement names (application groups for every user whose base
    // directory exists; system groups for the default user). The caller holds
    // the global write lock.
    void reconcileGroupContainersOfType(TarnGroupType type, TarnCommandQueue* commandQueue);
    void _cleanupUnreferencedGroupContainersForUserIdentity(const TarnUserIdentityRef& userIdentity,
                                                            TarnContainerClass containerClass,
                                                            const TarnCountedSet& referenceCounts,
                                                            TarnCommandQueue* commandQueue);

    // The group identifiers the owner's entitlements name (system groups for
    // class 13, application groups otherwise); an empty list when none.
    // `ownerIdentifier` empty: the request's value was not a string
    // (TarnErrorInvalidArgument). With `useLocking` the global write lock is
    // held for the call. An exception inside is TarnErrorException.
    TarnResult<std::vector<std::string>> groupContainerIdentifiersForOwnerIdentifier(
        const std::optional<std::string>& ownerIdentifier, TarnContainerClass groupContainerClass,
        bool useLocking);

  private:
    TarnUserIdentitySharedCache& userIdentityCache_;
};

}  // namespace tarn
