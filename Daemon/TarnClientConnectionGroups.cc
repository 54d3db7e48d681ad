// TarnClientConnection: the group containers of an owner, and the retry test.
#include <chrono>
#include <cstdlib>
#include <thread>

#include "Daemon/TarnClientConnection.h"
#include "Daemon/TarnCommandStageForDelete.h"
#include "Daemon/TarnGroupManager.h"
#include "Daemon/TarnLocks.h"
#include "Daemon/TarnLog.h"
#include "Daemon/TarnUserIdentityCache.h"
#include "Platform/PlatformLog.h"

namespace tarn {

namespace {

constexpr const char* kRetryTestIdentifier = "com.ostrea.retryTest";
constexpr const char* kRetryTestCounterKey = "CrashCounter";
// Long enough for the client to be waiting on its reply when the daemon goes.
constexpr auto kRetryTestCrashDelay = std::chrono::seconds(2);

}  // namespace

TarnResult<std::map<std::string, TarnMetadataRef>>
TarnClientConnection::groupContainersForOwnerIdentifier(const std::string& ownerIdentifier,
                                                        const TarnUserIdentityRef& userIdentity,
                                                        TarnContainerClass groupContainerClass) {
    TARN_TRY(_passesGroupOwnerRuleForContainerClass(groupContainerClass, ownerIdentifier));
    // The owner's groups carry identifiers of their own: the lookup rule must
    // let them through.
    setAllowGroupIdLookup(true);

    // One write lock across the whole walk: creations below run without locking.
    TarnGlobalLockHolder globalLock(TarnGlobalLockHolder::Mode::Write);
    std::vector<std::string> groups =
        TARN_TRY(TarnGroupManager::defaultManager().groupContainerIdentifiersForOwnerIdentifier(
            ownerIdentifier, groupContainerClass, /*useLocking=*/false));

    std::map<std::string, TarnMetadataRef> containers;
    for (const std::string& group : groups) {
        TarnResult<TarnMetadataRef> container = [&]() -> TarnResult<TarnMetadataRef> {
            TarnContainerIdentityRef identity =
                TARN_TRY(TarnContainerIdentity::containerIdentityWithUserIdentity(
                    userIdentity, group, groupContainerClass));
            return createOrLookupContainerWithContainerIdentity(
                identity, /*createIfNecessary=*/true, /*transient=*/false, /*useLocking=*/false);
        }();
        if (!container.ok()) {
            // One damaged group must not hide the owner's others.
            TarnLog(kLogError, __func__, "Failed to create or lookup group container: %@ : %llu",
                    group, container.code(TarnErrorInvalidArgument));
            continue;
        }
        containers.emplace(group, std::move(*container));
    }
    return containers;
}

TarnStatus TarnClientConnection::retryTestWithNumCrashes(uint64_t numCrashes) {
    // Whoever asks, the test container is the daemon's own: act as the
    // anonymous privileged connection, which passes every lookup rule.
    setClientIdentity(TarnClientIdentity::anonymousPrivilegedClientIdentity());
    setUnrestricted(true);

    TarnContainerIdentityRef identity =
        TARN_TRY(TarnContainerIdentity::containerIdentityWithUserIdentity(
            userIdentityCache_.userIdentityForPersonalPersona(), std::string(kRetryTestIdentifier),
            TarnContainerClassAppData));
    TarnResult<TarnMetadataRef> found = createOrLookupContainerWithContainerIdentity(
        identity, /*createIfNecessary=*/true, /*transient=*/false, /*useLocking=*/true);
    if (!found.ok()) {
        TarnLog(kLogError, __func__,
                "Failed to create or lookup lookup existing container for retry test: %@",
                found.error());
        return found.error();
    }
    const TarnMetadataRef& container = *found;
    TarnConcreteContainerIdentityRef concrete = container->containerIdentity();
    if (!concrete) {
        TarnLog(kLogError, __func__, "Failed to delete retry container at : %@", container->url());
        return TARN_ERROR_CODE(TarnErrorInvalidArgument, nullptr);
    }

    // The counter left by the previous launch wins over the request: the
    // client repeats the same request after every crash.
    uint64_t remaining = numCrashes;
    const std::optional<PlistValue>& info = container->info();
    if (const PlistValue* counter = info ? info->find(kRetryTestCounterKey) : nullptr) {
        const uint64_t left = counter->asUInt64().value_or(0);
        remaining = left > 0 ? left - 1 : 0;
    }
    TarnLog(kLogNotice, __func__, "Crashes Remaining in retry test: %llu", remaining);
    // A counter that cannot be stored would never run down: fail rather than
    // crash forever.
    TARN_TRY(setInfoValue(PlistValue(remaining), std::string(kRetryTestCounterKey), concrete,
                          /*useLocking=*/true));

    if (remaining != 0) {
        TarnLog(kLogNotice, __func__, "Crashing");
        std::this_thread::sleep_for(kRetryTestCrashDelay);
        PlatformLogFlush();
        // As the termination handler does: no static destructors while the
        // other threads still run.
        std::_Exit(0);
    }

    commandQueue_->insertCommand(
        TarnCommandStageForDelete::commandForStageForDeleteWithContainerIdentities(
            {concrete}, /*useLocking=*/true, nullptr));
    TarnLog(kLogNotice, __func__, "Returning Successfully");
    return {};
}

}  // namespace tarn
