#include "Daemon/TarnCommandStageForDelete.h"

#include <exception>

#include "Daemon/TarnCodeSigningMapping.h"
#include "Daemon/TarnContainerCache.h"
#include "Daemon/TarnError.h"
#include "Daemon/TarnFileManager.h"
#include "Daemon/TarnGlobalConfiguration.h"
#include "Daemon/TarnLocks.h"
#include "Daemon/TarnLog.h"
#include "Daemon/TarnRequestProcessor.h"
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

bool TarnCommandStageForDelete::fromQueue(TarnCommandQueue* queue, uint64_t* error) {
    if (useLocking_) gTarnLocks.write_lock_all_identifiers();
    uint64_t code = TarnSuccess;
    bool ok = false;
    try {
        ok = stageAll(queue, &code);
    } catch (const std::exception& e) {
        code = TarnHandleCaughtException(__func__, &e);
    } catch (...) {
        code = TarnHandleCaughtException(__func__, nullptr);
    }
    if (useLocking_) gTarnLocks.unlock_all_identifiers();
    if (ok) return true;
    try {
        if (onError_) onError_(code);
    } catch (const std::exception& e) {
        (void)TarnHandleCaughtException(__func__, &e);  // the staging's own code is the answer
    } catch (...) {
        (void)TarnHandleCaughtException(__func__, nullptr);
    }
    TarnSetError(error, code);
    return false;
}

bool TarnCommandStageForDelete::stageAll(TarnCommandQueue* queue, uint64_t* error) {
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
            TarnErrorRef e = TARN_ERROR_IN(
                "fromQueue", TarnErrorCacheRemoveFailed, removed.error(),
                "Failed to remove from cache id: %@, class: %ld, transient: %d",
                container->identifier(), static_cast<int64_t>(container->containerClass()),
                container->transient());
            TarnSetError(error, e->code());
            return false;
        }
    }
    return true;
}

}  // namespace tarn
