#include "Daemon/TarnCommandStageForDelete.h"

#include "Daemon/TarnCodeSigningMapping.h"
#include "Daemon/TarnContainerCache.h"
#include "Daemon/TarnError.h"
#include "Daemon/TarnExceptionFence.h"
#include "Daemon/TarnFileManager.h"
#include "Daemon/TarnGlobalConfiguration.h"
#include "Daemon/TarnLocks.h"
#include "Daemon/TarnLog.h"
#include "Platform/PlatformLog.h"

namespace tarn {

namespace {

// The cached record of one identity to stage, or nullptr when it is gone.
TarnMetadataRef cachedContainerForIdentity(TarnContainerCache& cache,
                                           const TarnContainerIdentityRef& identity) {
    if (auto concrete = std::dynamic_pointer_cast<const TarnConcreteContainerIdentity>(identity))
        return cache.containerForContainerIdentity(concrete);
    // Not found: nothing to stage.
    auto found =
        cache.containerForContainerIdentity(identity, /*transient=*/false, /*updateSandbox=*/true);
    return found.valueOr(nullptr);
}

// A transient bundle shares its identifier's code-signing records with the
// permanent bundle, if there is one; those records must stay.
bool keepsCodeSigningRecords(TarnContainerCache& cache, const TarnMetadata& container) {
    if (!container.transient()) return false;
    TarnResult<TarnContainerIdentityRef> made =
        TarnContainerIdentity::containerIdentityWithIdentifier(container.identifier(),
                                                               container.containerClass());
    if (!made.ok()) {
        TarnLog(kLogError, "fromQueue",
                "Could not construct container identity from %@ to check for permanent copy: %llu",
                container.identifier(), made.code(TarnErrorInvalidArgument));
        return false;
    }
    TarnContainerIdentityRef permanent = std::move(*made);
    const TarnResult<TarnMetadataRef> found = cache.containerForContainerIdentity(
        permanent, /*transient=*/false, /*updateSandbox=*/false);
    if (!found.ok()) return false;
    PlatformLog("unspecified", PlatformLogType::Default,
                "Skipping removal of code sign mapping since container to be deleted [%@] is "
                "transient and there's a permanent one; error = %@",
                container.description(), found.error());
    return true;
}

}  // namespace

std::shared_ptr<TarnCommandStageForDelete>
TarnCommandStageForDelete::commandForStageForDeleteWithContainerIdentities(
    std::vector<TarnContainerIdentityRef> containerIdentities, bool useLocking,
    ErrorCallback onError) {
    return std::make_shared<TarnCommandStageForDelete>(std::move(containerIdentities), useLocking,
                                                       std::move(onError));
}

TarnCommandStageForDelete::TarnCommandStageForDelete(
    std::vector<TarnContainerIdentityRef> containerIdentities, bool useLocking,
    ErrorCallback onError)
    : useLocking_(useLocking),
      containerIdentities_(std::move(containerIdentities)),
      onError_(std::move(onError)) {}

TarnStatus TarnCommandStageForDelete::fromQueue(TarnCommandQueue* queue) {
    // A fence of its own, inside the queue's: an exception is a failed run
    // that onError must hear of, with the global lock let go first.
    const TarnStatus staged = TarnFenceExceptions(__func__, [&] {
        TarnGlobalLockHolder lock(useLocking_ ? TarnGlobalLockHolder::Mode::Write
                                              : TarnGlobalLockHolder::Mode::None);
        return stageAll(queue);
    });
    if (staged.ok()) return {};
    const uint64_t code = staged.code(TarnErrorCacheRemoveFailed);
    // What the callback throws is reported; the staging's own error is the answer.
    (void)TarnFenceExceptions(__func__, [&] {
        if (onError_) onError_(code);
    });
    return staged;
}

TarnStatus TarnCommandStageForDelete::stageAll(TarnCommandQueue* queue) {
    auto& cache = TarnContainerCache::sharedInstance();
    auto& fm = TarnFileManager::defaultManager();
    const FileURL deathRow = TarnGlobalConfiguration::sharedInstance().deathrowDirectory();

    for (const TarnContainerIdentityRef& identity : containerIdentities_) {
        if (!identity) continue;
        TarnMetadataRef container = cachedContainerForIdentity(cache, identity);
        if (!container) continue;

        const FileURL& url = container->url();
        const FileURL deathRowURL = PathJoin(deathRow, PathLastComponent(url));

        if (TarnContainerClassIsBundle(container->containerClass()) &&
            !keepsCodeSigningRecords(cache, *container)) {
            if (TarnCodeSigningMapping* mapping = TarnCodeSigningMapping::sharedInstance())
                mapping->removeCodeSigningDictionariesForIdentifierAndItsChildren(
                    container->identifier(), queue);
        }

        if (const TarnStatus moved = fm.moveItemAtURL(url, deathRowURL); !moved.ok()) {
            TarnLog(kLogDebug, "fromQueue", "Couldn't stage for deletion from %@ to %@: %@", url,
                    deathRowURL, moved.error());
            if (const TarnStatus removed = fm.removeItemAtURL(url); !removed.ok()) {
                // Logged only: the container stays live and cached, the others go on.
                (void)TARN_ERROR_IN("fromQueue", TarnErrorDeleteFailed, removed.error(),
                                    "Failed to delete container at %@: %@", url, removed.error());
                continue;
            }
        }

        if (const TarnStatus removed = cache.removeContainerForUserIdentity(
                container->userIdentity(), container->containerClass(), container->identifier(),
                container->transient());
            !removed.ok()) {
            return TARN_ERROR_IN("fromQueue", TarnErrorCacheRemoveFailed, removed.error(),
                                 "Failed to remove from cache id: %@, class: %ld, transient: %d",
                                 container->identifier(),
                                 static_cast<int64_t>(container->containerClass()),
                                 container->transient());
        }
    }
    return {};
}

}  // namespace tarn
