// TarnClientConnection: operations on one existing container, found in the
// container cache by its concrete identity (identifier, class, user identity
// and UUID).
//
// Locking: each operation locks the container's UUID string (canonical form)
// in gTarnLocks, for reading or for writing, so that operations on different
// containers run side by side. UUID regeneration renames the directory and
// therefore takes the global write lock instead. Disk measurement runs with
// no lock at all: a walk of a large bundle must not hold up writers.
#include <string>
#include <utility>

#include "Daemon/TarnClientConnection.h"
#include "Daemon/TarnContainerCache.h"
#include "Daemon/TarnError.h"
#include "Daemon/TarnFileManager.h"
#include "Daemon/TarnLocks.h"
#include "Daemon/TarnLog.h"
#include "Daemon/TarnTestLocks.h"
#include "Platform/HostConfiguration.h"

namespace tarn {

namespace {

// A bundle's size, measured once and remembered in its metadata.
constexpr const char* kStaticDiskUsageKey = "StaticDiskUsage";
// The test gate that holds disk measurement (see TarnTestLocks.h).
constexpr uint64_t kDiskUsageTestGate = 2;

// The lock name of a container: its UUID in canonical (upper-case) form.
std::string lockNameFor(const TarnConcreteContainerIdentityRef& identity) {
    return identity->uuid().string();
}

TarnMetadataRef lookUp(const TarnConcreteContainerIdentityRef& identity) {
    return TarnContainerCache::sharedInstance().containerForContainerIdentity(identity);
}

// The failure a client sees: a domain error passes as it is; a file-layer
// error (or none) answers `code`, silently, with the original underneath.
TarnErrorRef answeringAs(const char* operation, const TarnErrorRef& error, uint64_t code) {
    if (error && error->isTarn()) return error;
    return TARN_ERROR_CODE_IN(operation, code, error);
}

TarnErrorRef noContainer(const char* operation, const TarnConcreteContainerIdentityRef& identity) {
    return TARN_ERROR_IN(operation, TarnErrorNotFound, nullptr, "No Container with identity: %@",
                         identity);
}

enum class Access { Read, Write };

// The opening every per-container operation shares: no identity, or no such
// container in the cache, fails with TarnErrorNotFound ("No Container with
// identity: %@"); otherwise `body` runs with the cached record while the
// container's identifier lock is held (when `useLocking`).
template <class Body>
auto withLockedContainer(const char* operation, const TarnConcreteContainerIdentityRef& identity,
                         Access access, bool useLocking, Body&& body)
    -> decltype(body(std::declval<const TarnMetadataRef&>())) {
    if (!identity) return noContainer(operation, identity);
    TarnScopedIdentifierLock lock(lockNameFor(identity), access == Access::Write, useLocking);
    const TarnMetadataRef metadata = lookUp(identity);
    if (!metadata) return noContainer(operation, identity);
    return body(metadata);
}

}  // namespace

TarnResult<TarnMetadataRef> TarnClientConnection::metadataWithContainerIdentity(
    const TarnConcreteContainerIdentityRef& identity) {
    TarnMetadataRef metadata;
    if (identity) {
        TarnScopedIdentifierLock lock(lockNameFor(identity), /*writing=*/false);
        metadata = lookUp(identity);
    }
    // Checked after the lock is let go: the record is immutable.
    if (!metadata) {
        return TARN_ERROR(TarnErrorNotFound, nullptr, "No Container with user identity: %@",
                          identity);
    }
    return metadata;
}

TarnResult<PlistValue> TarnClientConnection::infoValueForKey(
    const std::optional<std::string>& key,
    const TarnConcreteContainerIdentityRef& containerIdentity, bool useLocking) {
    const char* const operation = __func__;
    if (!key) {
        return TARN_ERROR(TarnErrorBadInput, nullptr, "Can't get nil or non-string key: %@", key);
    }
    return withLockedContainer(
        operation, containerIdentity, Access::Read, useLocking,
        [&](const TarnMetadataRef& metadata) -> TarnResult<PlistValue> {
            const PlistValue* value = metadata->info() ? metadata->info()->find(*key) : nullptr;
            // An absent key is an ordinary answer (every first disk-usage
            // request of a bundle asks), so it stays out of the log.
            if (!value) {
                return TARN_ERROR_SILENT_IN(operation, TarnErrorInfoValueNotFound, nullptr,
                                            "Didn't find info value for key: %@", key);
            }
            return *value;
        });
}

TarnStatus TarnClientConnection::setInfoValue(
    const std::optional<PlistValue>& value, const std::optional<std::string>& forKey,
    const TarnConcreteContainerIdentityRef& containerIdentity, bool useLocking) {
    const char* const operation = __func__;
    if (!forKey) {
        return TARN_ERROR(TarnErrorBadInput, nullptr, "Can't set nil or non-string key: %@",
                          forKey);
    }
    return withLockedContainer(
        operation, containerIdentity, Access::Write, useLocking,
        [&](const TarnMetadataRef& metadata) -> TarnStatus {
            PlistValue info = metadata->info().value_or(PlistValue(PlistDict{}));
            // A file from an older build may hold something else under the
            // key; the new value replaces it rather than failing every later write.
            if (!info.isDict()) info = PlistValue(PlistDict{});
            // A Null value cannot be written to a property list: it removes, as nil does.
            if (value && !value->isNull())
                info.set(*forKey, *value);
            else
                info.erase(*forKey);

            TarnMutableMetadataRef changed = metadata->copy();
            changed->setInfo(std::move(info));
            if (const TarnStatus written = changed->writeMetadataToDiskWithError(); !written.ok())
                return answeringAs(operation, written.error(), TarnErrorWriteFailed);
            if (const TarnStatus added = TarnContainerCache::sharedInstance().addContainerMetadata(
                    changed, changed->url(), changed->transient(), /*updateSandbox=*/false);
                !added.ok()) {
                return TARN_ERROR_IN(operation, TarnErrorCacheAddFailed, added.error(),
                                     "Failed to add to cache: %@, url: %@, transient: %d", changed,
                                     changed->url(), changed->transient());
            }
            return {};
        });
}

TarnResult<uint64_t> TarnClientConnection::diskUsageWithContainerIdentity(
    const TarnConcreteContainerIdentityRef& identity) {
    const char* const operation = __func__;
    const bool fastSizing = HostConfiguration::shared().featureEnabled("fast_container_sizing");
    if (!identity) return noContainer(operation, identity);
    const bool isBundle = TarnContainerClassIsBundle(identity->containerClass());
    TarnMetadataRef metadata;
    std::optional<uint64_t> remembered;
    {
        TarnScopedIdentifierLock lock(lockNameFor(identity), /*writing=*/false);
        metadata = lookUp(identity);
        if (!metadata) {
            // A plain line and a code here, not an error value.
            TarnLog(kLogError, operation, "No Container with identity: %@", identity);
            return TARN_ERROR_CODE_IN(operation, TarnErrorNotFound, nullptr);
        }
        if (isBundle) {
            auto value = infoValueForKey(std::string(kStaticDiskUsageKey), identity,
                                         /*useLocking=*/false);
            if (value.ok())
                remembered = value->asUInt64();
            else if (const uint64_t code = value.code(TarnErrorInvalidArgument);
                     code != TarnErrorInfoValueNotFound)
                TarnLog(kLogError, operation, "Error looking up info value for identity: %@: %llu",
                        identity, code);
        }
    }
    if (remembered) return *remembered;

    TarnTestLocks::sharedInstance().waitOnLock(kDiskUsageTestGate);
    const uint64_t bytes = TarnFileManager::defaultManager().fastDiskUsageForURL(
        metadata->url(), metadata->projectID());

    // With fast sizing the file system keeps the figure current itself;
    // without it a bundle (which never changes in place) is walked once.
    // 0 is what a failed measurement answers; remembering it would make the
    // failure permanent.
    if (!fastSizing && isBundle && bytes != 0) {
        const TarnStatus set = setInfoValue(PlistValue(bytes), std::string(kStaticDiskUsageKey),
                                            identity, /*useLocking=*/true);
        if (!set.ok())
            TarnLog(kLogError, operation, "Error setting info value for identity: %@: %llu",
                    identity, set.code(TarnErrorInvalidArgument));
    }
    return bytes;
}

TarnStatus TarnClientConnection::recreateDefaultStructureWithContainerIdentity(
    const TarnConcreteContainerIdentityRef& identity) {
    const char* const operation = __func__;
    return withLockedContainer(
        operation, identity, Access::Write, /*useLocking=*/true,
        [&](const TarnMetadataRef& metadata) -> TarnStatus {
            if (const TarnStatus made = _createSubDirectories(metadata->url(), metadata);
                !made.ok())
                return answeringAs(operation, made.error(), TarnErrorCreateDirectoryFailed);
            // New subdirectories of a system container need the system-users
            // ACL that the rest of the tree carries.
            if (TarnContainerClassIsSystem(metadata->containerClass())) {
                const TarnStatus acl =
                    TarnFileManager::defaultManager().standardizeACLsForSystemContainerAtURL(
                        metadata->url());
                if (!acl.ok()) return answeringAs(operation, acl.error(), TarnErrorACLFailed);
            }
            return {};
        });
}

TarnStatus TarnClientConnection::regenerateDirectoryUUIDWithContainerIdentity(
    const TarnConcreteContainerIdentityRef& identity) {
    const char* const operation = __func__;
    if (!identity || !lookUp(identity)) return noContainer(operation, identity);
    TarnGlobalLockHolder lock(TarnGlobalLockHolder::Mode::Write);
    // Looked up again under the lock: a write that finished in between must
    // not be undone by putting the earlier record back.
    const TarnMetadataRef metadata = lookUp(identity);
    if (!metadata) return noContainer(operation, identity);
    const FileURL oldURL = metadata->url();
    const std::string lastComponent = PathLastComponent(oldURL);
    // Well-known system containers keep their fixed name.
    if (!Uuid::parse(lastComponent)) {
        return TARN_ERROR(TarnErrorInvalidArgument, nullptr,
                          "Non-UUID last path component: %@ for %@", lastComponent, identity);
    }
    const FileURL newURL = PathJoin(PathParent(oldURL), Uuid::generate().string());
    if (const TarnStatus moved = TarnFileManager::defaultManager().moveItemAtURL(oldURL, newURL);
        !moved.ok()) {
        return TARN_ERROR(TarnErrorUUIDMoveFailed, moved.error(),
                          "Failed to move dir: %@ to new UUID dir: %@", oldURL, newURL);
    }
    if (const TarnStatus added = TarnContainerCache::sharedInstance().addContainerMetadata(
            metadata, newURL, metadata->transient(), /*updateSandbox=*/true);
        !added.ok()) {
        return TARN_ERROR(TarnErrorCacheAddFailed, added.error(),
                          "Failed to add to cache: %@, url: %@, transient: %d", metadata, newURL,
                          metadata->transient());
    }
    return {};
}

}  // namespace tarn
