#include "Daemon/TarnGroupManager.h"

#include "Daemon/TarnUserIdentityCache.h"

namespace tarn {

TarnGroupManager& TarnGroupManager::defaultManager() {
    static auto* shared = new TarnGroupManager(TarnUserIdentitySharedCache::sharedInstance());
    return *shared;
}

TarnGroupManager::TarnGroupManager(TarnUserIdentitySharedCache& userIdentityCache)
    : userIdentityCache_(userIdentityCache) {}

// Not built yet.
void TarnGroupManager::reconcileGroupContainersOfType(TarnGroupType, TarnCommandQueue*) {}

void TarnGroupManager::_cleanupUnreferencedGroupContainersForUserIdentity(
    const TarnUserIdentityRef&, TarnContainerClass, const TarnCountedSet&, TarnCommandQueue*) {}

TarnResult<std::vector<std::string>> TarnGroupManager::groupContainerIdentifiersForOwnerIdentifier(
    const std::optional<std::string>&, TarnContainerClass, bool) {
    return std::vector<std::string>{};
}

}  // namespace tarn
