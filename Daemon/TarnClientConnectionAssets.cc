// TarnClientConnection: the user-managed assets directory of a data
// container and the staging of shared content inside a system group
// container. Clients name paths relative to a container the daemon acts on
// as root, so every path is checked to stay inside it.
//
// Containment: the container directory is opened once, from the path the
// daemon keeps for it. Everything below it ("Library", the assets directory,
// the client's path) is resolved relative to that descriptor, one component
// at a time, never through a link and never above it
// (TarnFileManager::itemBelowDirectory). The rename, mode, owner and ACL
// changes then act through the descriptors so obtained: no path string is
// checked and later handed to the kernel again, so a link swapped in while
// the request runs cannot redirect the work.
//
// Locking: each operation holds the container's per-identifier write lock
// (its UUID) across its file-system work, and reads the container's record
// again once it holds it, so that two requests never make two assets
// directories for one container.
#include <algorithm>
#include <string>
#include <utility>

#include "Daemon/TarnClientConnection.h"
#include "Daemon/TarnCodeSigningMapping.h"
#include "Daemon/TarnContainerCache.h"
#include "Daemon/TarnError.h"
#include "Daemon/TarnFileManager.h"
#include "Daemon/TarnGlobalConfiguration.h"
#include "Daemon/TarnLocks.h"
#include "Daemon/TarnLog.h"
#include "Daemon/TarnPropertyListFile.h"
#include "Daemon/TarnUserIdentityCache.h"

namespace tarn {

namespace {

// The assets operations' answer when the data container is not there.
TarnErrorRef assetsContainerNotFound(const char* operation,
                                     const TarnContainerIdentityRef& identity,
                                     const TarnErrorRef& error) {
    return TARN_ERROR_IN(operation, TarnErrorInvalidArgument, error,
                         "Failed to create app data container for user managed assets path for "
                         "%@: %@",
                         identity, error);
}

constexpr const char* kLibraryDirName = "Library";
constexpr const char* kAssetsDirNamePrefix = "com.ostrea.UserManagedAssets.";
constexpr mode_t kAssetsDirMode = 0755;

using ItemInDirectory = TarnFileManager::ItemInDirectory;

TarnFileManager& fileManager() { return TarnFileManager::defaultManager(); }

int posixCodeOf(const TarnErrorRef& error) { return error ? error->posixCode() : 0; }

// The text of the system error under a file-layer failure.
std::string systemErrorText(const TarnErrorRef& error) {
    return FsErrorText(error && error->isPosix() ? error->posixCode() : EIO);
}

// The assets directory's name as the record keeps it, when it is one plain
// name. The record is read back from a file inside the container, which
// its owner can replace; a name that would reach elsewhere counts as none.
std::optional<std::string> plainAssetsDirName(const TarnMetadata& container) {
    const std::optional<std::string>& name = container.userManagedAssetsDirName();
    if (!name || name->empty() || *name == "." || *name == ".." ||
        name->find('/') != std::string::npos)
        return std::nullopt;
    return name;
}

std::string assetsRelativePath(const std::string& assetsDirName) {
    return PathJoin(kLibraryDirName, assetsDirName);
}

// The container of `identity` in the permanent tree; its sandbox mapping is
// brought up to date when the cache has to be rebuilt.
TarnResult<TarnMetadataRef> lookUpContainer(const TarnContainerIdentityRef& identity) {
    return TarnContainerCache::sharedInstance().containerForContainerIdentity(
        identity, /*transient=*/false, /*updateSandbox=*/true);
}

// The opening the three operations share: the container from the cache, its
// write lock, and the record read again under the lock (a request that held
// it before may have changed it). A failed look-up is answered by
// `notFound(error)`; `body` runs with the lock held.
template <class NotFound, class Body>
auto withWriteLockedContainer(const TarnContainerIdentityRef& identity, NotFound&& notFound,
                              Body&& body)
    -> decltype(body(std::declval<const TarnMetadataRef&>())) {
    TarnResult<TarnMetadataRef> found = lookUpContainer(identity);
    if (!found.ok()) return notFound(found.error());
    const Uuid uuid = (*found)->uuid();
    TarnScopedIdentifierLock lock(uuid.string(), /*writing=*/true);
    TarnResult<TarnMetadataRef> locked = lookUpContainer(identity);
    if (!locked.ok()) return notFound(locked.error());
    // Replaced meanwhile: this lock does not guard the new directory.
    if ((*locked)->uuid() != uuid) {
        return notFound(TARN_ERROR_CODE(TarnErrorNotFound, nullptr));
    }
    return body(*locked);
}

// _moveItemAtURLToDeathRow (no pass) for an item resolved below a directory
// held open: the rename is relative to that directory, so it moves the very
// entry that was checked, wherever the directory's path leads by now.
// Death row is on the containers' volume, so one rename suffices; `url`
// names the item in messages.
TarnStatus moveItemToDeathRow(const ItemInDirectory& item, const FileURL& url) {
    TarnFileManager& fm = fileManager();
    TarnResult<bool> moved = TarnClientConnection::_moveIntoDeathRowSlot(
        url,
        [&](const FileURL& slot) -> TarnStatus {
            FsFd slotDirectory;
            if (int err = fm.openDirectoryAtURL(slot, &slotDirectory))
                return TARN_POSIX_ERROR(err, "opendir of %@ failed: %s", slot, FsErrorText(err));
            return fm.renameItemInDirectory(item.directory, item.name, slotDirectory, item.name);
        },
        [&] {
            TarnResult<ItemInDirectory> still = fm.itemBelowDirectory(item.directory, item.name);
            return still.ok() && !still->stat;
        });
    if (!moved.ok()) return moved.error();
    return {};
}

}  // namespace

// ---- User-managed assets ----

TarnResult<TarnClientConnection::AssetsPath>
TarnClientConnection::userManagedAssetsPathWithContainerIdentity(
    const TarnContainerIdentityRef& identity, bool isRelative, bool createIfNecessary) {
    const char* const operation = __func__;
    if (!identity) {
        return TARN_ERROR(TarnErrorInvalidArgument, nullptr,
                          "Failed to create app data container for user managed assets path for "
                          "%@: %@",
                          identity, TarnErrorRef());
    }
    if (!entitled_ && identity->identifier() != clientBundleIdentifier()) {
        return TARN_ERROR(TarnErrorBadInput, nullptr,
                          "%@ trying to retrieve path for identifier: %@ without entitlement",
                          clientBundleIdentifier(), identity->identifier());
    }
    auto notFound = [&](const TarnErrorRef& error) {
        return assetsContainerNotFound(operation, identity, error);
    };
    return withWriteLockedContainer(
        identity, notFound, [&](const TarnMetadataRef& container) -> TarnResult<AssetsPath> {
            if (container->url().empty()) {
                return TARN_ERROR_IN(operation, TarnErrorInvalidArgument, nullptr,
                                     "No URL in container metadata object: %@", container);
            }
            TarnFileManager& fm = fileManager();
            const FileURL libraryURL = PathJoin(container->url(), kLibraryDirName);
            auto answer = [&](const std::string& name, bool existed) {
                return AssetsPath{
                    .path = isRelative ? assetsRelativePath(name) : PathJoin(libraryURL, name),
                    .existed = existed};
            };

            FsFd containerDirectory;
            const int openError = fm.openDirectoryAtURL(container->url(), &containerDirectory);
            if (const std::optional<std::string> name = plainAssetsDirName(*container);
                name && openError == 0) {
                // Only a real directory counts: a link planted under the
                // name is not the assets directory.
                TarnResult<ItemInDirectory> existing =
                    fm.itemBelowDirectory(containerDirectory, assetsRelativePath(*name));
                if (existing.ok() && existing->stat && existing->stat->isDirectory())
                    return answer(*name, /*existed=*/true);
            }
            if (!createIfNecessary) {
                return TARN_ERROR_SILENT_IN(operation, TarnErrorUserManagedPathNotFound, nullptr,
                                            "User managed path for %@:%@ Not Found",
                                            identity->identifier(), container->url());
            }

            // Made inside "Library" as opened below the container: a link
            // planted as "Library" cannot place a root-made directory elsewhere.
            TarnResult<FsFd> library =
                openError == 0
                    ? fm.openDirectoryBelowDirectory(containerDirectory, kLibraryDirName)
                    : TarnResult<FsFd>(TARN_POSIX_ERROR(openError, "opendir of %@ failed: %s",
                                                        container->url(), FsErrorText(openError)));
            TarnResult<std::string> made = library.ok() ? fm.createTemporaryDirectoryInDirectory(
                                                              *library, kAssetsDirNamePrefix)
                                                        : TarnResult<std::string>(library.error());
            if (!made.ok()) {
                return TARN_ERROR_IN(operation, TarnErrorCreateDirectoryFailed, made.error(),
                                     "Failed to create user managed assets dir at %@: %@",
                                     libraryURL, made.error());
            }
            const FileURL assetsURL = PathJoin(libraryURL, *made);
            if (TarnStatus mode = fm.setModeOfItemInDirectory(*library, *made, kAssetsDirMode);
                !mode.ok()) {
                return TARN_ERROR_IN(operation, TarnErrorCreateDirectoryFailed, mode.error(),
                                     "Failed to chmod user managed assets dir at %@: %s", assetsURL,
                                     systemErrorText(mode.error()));
            }
            const TarnUserIdentityRef& owner =
                container->userIdentity() ? container->userIdentity() : identity->userIdentity();
            const TarnContainerClass containerClass = container->containerClass();
            if (TarnStatus chowned = fm.setOwnerOfItemInDirectory(
                    *library, *made, owner->posixUIDForContainerClass(containerClass),
                    owner->posixGIDForContainerClass(containerClass));
                !chowned.ok()) {
                return TARN_ERROR_IN(operation, TarnErrorCreateDirectoryFailed, chowned.error(),
                                     "Failed to chown user managed assets dir at %@: %s", assetsURL,
                                     systemErrorText(chowned.error()));
            }

            TarnMutableMetadataRef changed = container->copy();
            changed->setUserManagedAssetsDirName(*made);
            TARN_TRY(changed->writeMetadataToDiskWithError());
            if (TarnStatus added = TarnContainerCache::sharedInstance().addContainerMetadata(
                    changed, changed->url(), changed->transient(), /*updateSandbox=*/false);
                !added.ok()) {
                return TARN_ERROR_IN(operation, TarnErrorCacheAddFailed, added.error(),
                                     "Failed to add to cache: %@, url: %@, transient: %d", changed,
                                     changed->url(), changed->transient());
            }
            return answer(*made, /*existed=*/false);
        });
}

TarnStatus TarnClientConnection::deleteUserManagedAssetWithContainerIdentity(
    const TarnContainerIdentityRef& identity, const std::optional<std::string>& relativePath) {
    const char* const operation = __func__;
    if (!relativePath || !identity) {
        return TARN_ERROR(TarnErrorInvalidArgument, nullptr,
                          "Can't act on invalid input: ID: %@, Path: %@", identity, relativePath);
    }
    auto notFound = [&](const TarnErrorRef& error) {
        return assetsContainerNotFound(operation, identity, error);
    };
    return withWriteLockedContainer(
        identity, notFound, [&](const TarnMetadataRef& container) -> TarnStatus {
            const std::optional<std::string> name = plainAssetsDirName(*container);
            if (container->url().empty() || !name) {
                return TARN_ERROR_IN(operation, TarnErrorInvalidArgument, nullptr,
                                     "No userManagedAssetsDirName or URL in container metadata "
                                     "object: %@",
                                     container);
            }
            TarnFileManager& fm = fileManager();
            const FileURL assetsURL = PathJoin(PathJoin(container->url(), kLibraryDirName), *name);
            const FileURL targetURL = PathJoin(assetsURL, *relativePath);
            auto unresolved = [&](const FileURL& url, const TarnErrorRef& error) {
                return TARN_ERROR_IN(operation, TarnErrorInvalidPath, error,
                                     "Unable to get realpath for resource %@", url);
            };
            auto outside = [&](const TarnErrorRef& error) {
                return TARN_ERROR_IN(operation, TarnErrorInvalidPath, error,
                                     "Illegal attempt to delete asset not residing in user "
                                     "managed assets directory %@",
                                     targetURL);
            };

            FsFd containerDirectory;
            if (int err = fm.openDirectoryAtURL(container->url(), &containerDirectory)) {
                return unresolved(assetsURL, TARN_POSIX_ERROR(err, "opendir of %@ failed: %s",
                                                              container->url(), FsErrorText(err)));
            }
            TarnResult<FsFd> assets =
                fm.openDirectoryBelowDirectory(containerDirectory, assetsRelativePath(*name));
            if (!assets.ok()) return unresolved(assetsURL, assets.error());

            TarnResult<ItemInDirectory> target = fm.itemBelowDirectory(*assets, *relativePath);
            if (!target.ok()) {
                switch (posixCodeOf(target.error())) {
                    case EINVAL:
                        return TARN_ERROR_IN(operation, TarnErrorInvalidPath, target.error(),
                                             "Illegal attempt to delete user managed assets "
                                             "directory at %@",
                                             assetsURL);
                    case EXDEV:  // absolute, or climbs with ".."
                    case ELOOP:  // through a link
                        return outside(target.error());
                    default:
                        return unresolved(targetURL, target.error());
                }
            }
            if (!target->stat) return unresolved(targetURL, nullptr);
            // A link is refused rather than followed or removed: what it
            // points at is not known to be an asset.
            if (target->stat->isSymlink()) return outside(nullptr);

            if (TarnStatus moved = moveItemToDeathRow(*target, targetURL); !moved.ok()) {
                return TARN_ERROR_IN(operation, TarnErrorDeathRowMoveFailed, moved.error(),
                                     "Failed to remove asset at %@", targetURL);
            }
            return {};
        });
}

// ---- Shared content ----

TarnResult<FileURL> TarnClientConnection::stageSharedContentForIdentifier(
    const std::optional<std::string>& identifier,
    const std::optional<std::string>& sourceRelativePath,
    const std::optional<std::string>& destRelativePath) {
    const char* const operation = __func__;
    const TarnContainerIdentityRef identity =
        TARN_TRY(TarnContainerIdentity::containerIdentityWithUserIdentity(
            TarnUserIdentityCache::defaultUserIdentity(), identifier,
            TarnContainerClassSystemGroup));
    if (!identifier || !sourceRelativePath || !destRelativePath) {
        return TARN_ERROR(TarnErrorInvalidArgument, nullptr,
                          "Can't act on invalid input: ID: %@, source: %@, dest: %@", identifier,
                          sourceRelativePath, destRelativePath);
    }
    if (containsDotDotPathComponents(*sourceRelativePath) ||
        containsDotDotPathComponents(*destRelativePath)) {
        return TARN_ERROR(TarnErrorBadInput, nullptr,
                          "Paths can't contain dots. source: %@, dest: %@", sourceRelativePath,
                          destRelativePath);
    }
    TarnCodeSigningMapping* mapping = TarnCodeSigningMapping::sharedInstance();
    const std::optional<std::vector<std::string>> entitledGroups =
        mapping ? mapping->systemGroupIdentifiersForIdentifier(clientBundleIdentifier())
                : std::nullopt;
    if (!entitledGroups || std::find(entitledGroups->begin(), entitledGroups->end(), *identifier) ==
                               entitledGroups->end()) {
        return TARN_ERROR(TarnErrorNotEntitled, nullptr,
                          "%@ not entitled for system group container %@", clientBundleIdentifier(),
                          identifier);
    }
    auto notFound = [&](const TarnErrorRef& error) -> TarnErrorRef {
        return TARN_ERROR_IN(operation, TarnErrorNotFound, error,
                             "System group container with identifier %@ not found: %@", identifier,
                             error);
    };
    return withWriteLockedContainer(
        identity, notFound, [&](const TarnMetadataRef& container) -> TarnResult<FileURL> {
            TarnFileManager& fm = fileManager();
            const FileURL& containerURL = container->url();
            const FileURL sourceURL = PathJoin(containerURL, *sourceRelativePath);
            const FileURL destURL = PathJoin(containerURL, *destRelativePath);
            FsFd containerDirectory;
            if (int err = fm.openDirectoryAtURL(containerURL, &containerDirectory)) {
                return notFound(TARN_POSIX_ERROR(err, "opendir of %@ failed: %s", containerURL,
                                                 FsErrorText(err)));
            }
            // The container's own metadata file is the daemon's record, never
            // content: moving it away or over it would forge or lose it.
            auto isMetadataFile = [](const std::string& relativePath) {
                return PathStandardize(relativePath) == kTarnMetadataFileName;
            };
            // A missing directory on the way is no reason to refuse: the
            // item may simply not be there (yet). Everything else that does
            // not resolve below the container is.
            auto refused = [](const TarnResult<ItemInDirectory>& item) {
                if (!item.ok()) return posixCodeOf(item.error()) != ENOENT;
                return item->stat && item->stat->isSymlink();
            };

            TarnResult<ItemInDirectory> source =
                fm.itemBelowDirectory(containerDirectory, *sourceRelativePath);
            if (refused(source) || isMetadataFile(*sourceRelativePath)) {
                return TARN_ERROR_IN(operation, TarnErrorInvalidPath, source.error(),
                                     "Invalid source URL %@ for %@ at %@", sourceURL, identifier,
                                     containerURL);
            }
            TarnResult<ItemInDirectory> dest =
                fm.itemBelowDirectory(containerDirectory, *destRelativePath);
            if (refused(dest) || isMetadataFile(*destRelativePath)) {
                return TARN_ERROR_IN(operation, TarnErrorInvalidPath, dest.error(),
                                     "Invalid dest URL %@ for %@ at %@", destURL, identifier,
                                     containerURL);
            }

            TarnStatus standardized =
                !source.ok()    ? TarnStatus(source.error())
                : !source->stat ? TarnStatus(TARN_POSIX_ERROR(ENOENT, "No item at %@", sourceURL))
                                : fm.standardizeACLsOfItemInDirectory(source->directory,
                                                                      source->name, sourceURL,
                                                                      /*isSystemContainer=*/false);
            if (!standardized.ok()) {
                return TARN_ERROR_IN(operation, TarnErrorACLFailed, standardized.error(),
                                     "Failed to standardize ACLs for %@ at %@: %@", identifier,
                                     sourceURL, standardized.error());
            }
            TarnStatus moved = dest.ok() ? fm.renameItemInDirectory(source->directory, source->name,
                                                                    dest->directory, dest->name)
                                         : TarnStatus(dest.error());
            if (!moved.ok()) {
                return TARN_ERROR_IN(operation, TarnErrorStageMoveFailed, moved.error(),
                                     "Failed move for %@ from %@ to: %@: %@", identifier, sourceURL,
                                     destURL, moved.error());
            }
            return destURL;
        });
}

}  // namespace tarn
