// TarnCodeSigningMapping: reference counting of group containers. A group
// container has no owner; it goes when the last stored entitlement naming it
// drops it. Deletions are only queued here, never performed inline.
#include "Daemon/TarnCodeSigningMapping.h"

namespace tarn {

// Not built yet.
void TarnCodeSigningMapping::_onQueue_handleChangeFromOldGroupContainerIds(
    const std::optional<std::vector<std::string>>&, const std::optional<std::vector<std::string>>&,
    TarnGroupType, TarnCommandQueue*) {}

void TarnCodeSigningMapping::_onQueue_removeReferenceForGroupIdentifiers(
    const std::vector<std::string>&, TarnGroupType, TarnCommandQueue*) {}

void TarnCodeSigningMapping::_onQueue_removeGroupContainersIfNeededforUserIdentity(
    const TarnUserIdentityRef&, TarnContainerClass, const std::vector<std::string>&,
    TarnCountedSet&, TarnCommandQueue*) {}

}  // namespace tarn
