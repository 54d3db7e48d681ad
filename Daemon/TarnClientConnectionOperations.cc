// TarnClientConnection: operations on one existing container, found in the
// container cache by its concrete identity (identifier, class, user identity
// and UUID).
//
// Locking: each operation locks the container's UUID string (canonical form)
// in gTarnLocks, for reading or for writing, so that operations on different
// containers run side by side. UUID regeneration renames the directory and
// therefore takes the global write lock instead. Disk measurement runs with
// no lock at all: a walk of a large bundle must not hold up writers.
#include <exception>
#include <string>
#include <type_traits>

#include "Daemon/TarnClientConnection.h"
#include "Daemon/TarnContainerCache.h"
#include "Daemon/TarnError.h"
#include "Daemon/TarnFileManager.h"
#include "Daemon/TarnLocks.h"
#include "Daemon/TarnLog.h"
#include "Daemon/TarnRequestProcessor.h"
#include "Daemon/TarnTestLocks.h"
#include "Platform/HostConfiguration.h"

namespace tarn {

namespace {

// A bundle's size, measured once and remembered in its metadata.
constexpr const char* kStaticDiskUsageKey = "StaticDiskUsage";
// The test gate that holds disk measurement (see TarnTestLocks.h).
constexpr uint64_t kDiskUsageTestGate = 2;

// One identifier lock of gTarnLocks, let go when the scope ends (also when an
// exception leaves it). Identifier locks must be released on the taking
// thread, which a scope guarantees.
class ScopedIdentifierLock {
  public:
    ScopedIdentifierLock(std::string identifier, bool writing, bool enabled = true)
        : identifier_(std::move(identifier)), held_(enabled) {
        if (!held_) return;
        if (writing)
            gTarnLocks.write_lock_identifier(identifier_);
        else
            gTarnLocks.read_lock_identifier(identifier_);
    }
    ~ScopedIdentifierLock() { unlock(); }
    ScopedIdentifierLock(const ScopedIdentifierLock&) = delete;
    ScopedIdentifierLock& operator=(const ScopedIdentifierLock&) = delete;

    void unlock() {
        if (!held_) return;
        held_ = false;
        gTarnLocks.unlock_identifier(identifier_);
    }

  private:
    const std::string identifier_;
    bool held_;
};

// The global write lock of gTarnLocks for one scope.
class ScopedGlobalWriteLock {
  public:
    ScopedGlobalWriteLock() { gTarnLocks.write_lock_all_identifiers(); }
    ~ScopedGlobalWriteLock() { gTarnLocks.unlock_all_identifiers(); }
    ScopedGlobalWriteLock(const ScopedGlobalWriteLock&) = delete;
    ScopedGlobalWriteLock& operator=(const ScopedGlobalWriteLock&) = delete;
};

// Runs an operation's body so that no exception leaves the operation: a
// caught one becomes code 40 (or ends the process on internal builds). Each
// operation keeps its name in `operation` for the body's errors and lines:
// inside the lambda __func__ would read "operator()".
template <class Body>
auto catchingExceptions(const char* function, uint64_t* error, Body&& body) -> decltype(body()) {
    try {
        return body();
    } catch (const std::exception& e) {
        TarnSetError(error, TarnHandleCaughtException(function, &e));
    } catch (...) {
        TarnSetError(error, TarnHandleCaughtException(function, nullptr));
    }
    if constexpr (!std::is_void_v<decltype(body())>) return {};
}

// The lock name of a container: its UUID in canonical (upper-case) form.
std::string lockNameFor(const TarnConcreteContainerIdentityRef& identity) {
    return identity->uuid().string();
}

// Only domain codes reach a client; a file-layer error that got this far
// answers `fallback`.
void setErrorFrom(uint64_t* slot, const TarnErrorRef& error,
                  uint64_t fallback = TarnErrorInvalidArgument) {
    TarnSetError(slot, error ? TarnErrorCodeOf(error, fallback) : fallback);
}

TarnMetadataRef lookUp(const TarnConcreteContainerIdentityRef& identity) {
    return TarnContainerCache::sharedInstance().containerForContainerIdentity(identity);
}

}  // namespace

TarnMetadataRef TarnClientConnection::metadataWithContainerIdentity(
    const TarnConcreteContainerIdentityRef& identity, uint64_t* error) {
    const char* const operation = __func__;
    return catchingExceptions(operation, error, [&]() -> TarnMetadataRef {
        if (!identity) {
            setErrorFrom(error, TARN_ERROR_IN(operation, TarnErrorNotFound, nullptr,
                                           "No Container with user identity: %@", identity));
            return nullptr;
        }
        TarnMetadataRef metadata;
        {
            ScopedIdentifierLock lock(lockNameFor(identity), false);
            metadata = lookUp(identity);
        }
        if (!metadata)
            setErrorFrom(error, TARN_ERROR_IN(operation, TarnErrorNotFound, nullptr,
                                           "No Container with user identity: %@", identity));
        return metadata;
    });
}

std::optional<PlistValue> TarnClientConnection::infoValueForKey(
    const std::optional<std::string>& key,
    const TarnConcreteContainerIdentityRef& containerIdentity, bool useLocking, uint64_t* error) {
    const char* const operation = __func__;
    return catchingExceptions(operation, error, [&]() -> std::optional<PlistValue> {
        if (!key) {
            setErrorFrom(error, TARN_ERROR_IN(operation, TarnErrorBadInput, nullptr,
                                           "Can't get nil or non-string key: %@", key));
            return std::nullopt;
        }
        if (!containerIdentity) {
            setErrorFrom(error, TARN_ERROR_IN(operation, TarnErrorNotFound, nullptr,
                                           "No Container with identity: %@", containerIdentity));
            return std::nullopt;
        }
        ScopedIdentifierLock lock(lockNameFor(containerIdentity), false, useLocking);
        TarnMetadataRef metadata = lookUp(containerIdentity);
        if (!metadata) {
            setErrorFrom(error, TARN_ERROR_IN(operation, TarnErrorNotFound, nullptr,
                                           "No Container with identity: %@", containerIdentity));
            return std::nullopt;
        }
        const PlistValue* value = metadata->info() ? metadata->info()->find(*key) : nullptr;
        if (!value) {
            // An absent key is an ordinary answer (every first disk-usage
            // request of a bundle asks), so it stays out of the log.
            setErrorFrom(error, TARN_ERROR_SILENT_IN(operation, TarnErrorInfoValueNotFound, nullptr,
                                                  "Didn't find info value for key: %@", key));
            return std::nullopt;
        }
        return *value;
    });
}

void TarnClientConnection::setInfoValue(const std::optional<PlistValue>& value,
                                        const std::optional<std::string>& forKey,
                                        const TarnConcreteContainerIdentityRef& containerIdentity,
                                        bool useLocking, uint64_t* error) {
    const char* const operation = __func__;
    catchingExceptions(operation, error, [&] {
        if (!forKey) {
            setErrorFrom(error, TARN_ERROR_IN(operation, TarnErrorBadInput, nullptr,
                                           "Can't set nil or non-string key: %@", forKey));
            return;
        }
        if (!containerIdentity) {
            setErrorFrom(error, TARN_ERROR_IN(operation, TarnErrorNotFound, nullptr,
                                           "No Container with identity: %@", containerIdentity));
            return;
        }
        ScopedIdentifierLock lock(lockNameFor(containerIdentity), true, useLocking);
        TarnMetadataRef metadata = lookUp(containerIdentity);
        if (!metadata) {
            setErrorFrom(error, TARN_ERROR_IN(operation, TarnErrorNotFound, nullptr,
                                           "No Container with identity: %@", containerIdentity));
            return;
        }
        PlistValue info = metadata->info().value_or(PlistValue(PlistDict{}));
        // A file from an older build may hold something else under the key;
        // the new value replaces it rather than failing every later write.
        if (!info.isDict()) info = PlistValue(PlistDict{});
        // A Null value cannot be written to a property list: it removes, as nil does.
        if (value && !value->isNull())
            info.set(*forKey, *value);
        else
            info.erase(*forKey);

        TarnMutableMetadataRef changed = metadata->copy();
        changed->setInfo(std::move(info));
        if (const TarnStatus written = changed->writeMetadataToDiskWithError(); !written.ok()) {
            setErrorFrom(error, written.error(), TarnErrorWriteFailed);
            return;
        }
        if (const TarnStatus added = TarnContainerCache::sharedInstance().addContainerMetadata(
                changed, changed->url(), changed->transient(), /*updateSandbox=*/false);
            !added.ok()) {
            setErrorFrom(error, TARN_ERROR_IN(operation, TarnErrorCacheAddFailed, added.error(),
                                              "Failed to add to cache: %@, url: %@, transient: %d",
                                              changed, changed->url(), changed->transient()));
        }
    });
}

uint64_t TarnClientConnection::diskUsageWithContainerIdentity(
    const TarnConcreteContainerIdentityRef& identity, uint64_t* error) {
    const char* const operation = __func__;
    return catchingExceptions(operation, error, [&]() -> uint64_t {
        const bool fastSizing = HostConfiguration::shared().featureEnabled("fast_container_sizing");
        if (!identity) {
            setErrorFrom(error, TARN_ERROR_IN(operation, TarnErrorNotFound, nullptr,
                                           "No Container with identity: %@", identity));
            return 0;
        }
        const bool isBundle = TarnContainerClassIsBundle(identity->containerClass());
        TarnMetadataRef metadata;
        std::optional<uint64_t> remembered;
        {
            ScopedIdentifierLock lock(lockNameFor(identity), false);
            metadata = lookUp(identity);
            if (!metadata) {
                // A plain line and a code here, not an error value.
                TarnLog(kLogError, operation, "No Container with identity: %@", identity);
                TarnSetError(error, TarnErrorNotFound);
                return 0;
            }
            if (isBundle) {
                uint64_t infoError = TarnSuccess;
                auto value =
                    infoValueForKey(std::string(kStaticDiskUsageKey), identity, false, &infoError);
                if (value)
                    remembered = value->asUInt64();
                else if (infoError != TarnErrorInfoValueNotFound)
                    TarnLog(kLogError, operation,
                            "Error looking up info value for identity: %@: %llu", identity,
                            infoError);
            }
        }
        if (remembered) return *remembered;

        TarnTestLocks::sharedInstance().waitOnLock(kDiskUsageTestGate);
        const uint64_t bytes =
            TarnFileManager::defaultManager().fastDiskUsageForURL(metadata->url());

        // With fast sizing the file system keeps the figure current itself;
        // without it a bundle (which never changes in place) is walked once.
        // 0 is what a failed measurement answers; remembering it would make
        // the failure permanent.
        if (!fastSizing && isBundle && bytes != 0) {
            uint64_t setError = TarnSuccess;
            setInfoValue(PlistValue(bytes), std::string(kStaticDiskUsageKey), identity, true,
                         &setError);
            if (setError != TarnSuccess)
                TarnLog(kLogError, operation, "Error setting info value for identity: %@: %llu",
                        identity, setError);
        }
        return bytes;
    });
}

void TarnClientConnection::recreateDefaultStructureWithContainerIdentity(
    const TarnConcreteContainerIdentityRef& identity, uint64_t* error) {
    const char* const operation = __func__;
    catchingExceptions(operation, error, [&] {
        if (!identity) {
            setErrorFrom(error, TARN_ERROR_IN(operation, TarnErrorNotFound, nullptr,
                                           "No Container with identity: %@", identity));
            return;
        }
        ScopedIdentifierLock lock(lockNameFor(identity), true);
        TarnMetadataRef metadata = lookUp(identity);
        if (!metadata) {
            setErrorFrom(error, TARN_ERROR_IN(operation, TarnErrorNotFound, nullptr,
                                           "No Container with identity: %@", identity));
            return;
        }
        TarnErrorRef failure;
        if (!_createSubDirectories(metadata->url(), metadata, &failure)) {
            setErrorFrom(error, failure, TarnErrorCreateDirectoryFailed);
            return;
        }
        // New subdirectories of a system container need the system-users ACL
        // that the rest of the tree carries.
        if (TarnContainerClassIsSystem(metadata->containerClass())) {
            if (const TarnStatus standardized =
                    TarnFileManager::defaultManager().standardizeACLsForSystemContainerAtURL(
                        metadata->url());
                !standardized.ok())
                setErrorFrom(error, standardized.error(), TarnErrorACLFailed);
        }
    });
}

void TarnClientConnection::regenerateDirectoryUUIDWithContainerIdentity(
    const TarnConcreteContainerIdentityRef& identity, uint64_t* error) {
    const char* const operation = __func__;
    catchingExceptions(operation, error, [&] {
        TarnMetadataRef metadata = identity ? lookUp(identity) : nullptr;
        if (!metadata) {
            setErrorFrom(error, TARN_ERROR_IN(operation, TarnErrorNotFound, nullptr,
                                           "No Container with identity: %@", identity));
            return;
        }
        ScopedGlobalWriteLock lock;
        // Looked up again under the lock: a write that finished in between
        // must not be undone by putting the earlier record back.
        metadata = lookUp(identity);
        if (!metadata) {
            setErrorFrom(error, TARN_ERROR_IN(operation, TarnErrorNotFound, nullptr,
                                           "No Container with identity: %@", identity));
            return;
        }
        const FileURL oldURL = metadata->url();
        const std::string lastComponent = PathLastComponent(oldURL);
        // Well-known system containers keep their fixed name.
        if (!Uuid::parse(lastComponent)) {
            setErrorFrom(error, TARN_ERROR_IN(operation, TarnErrorInvalidArgument, nullptr,
                                           "Non-UUID last path component: %@ for %@", lastComponent,
                                           identity));
            return;
        }
        const FileURL newURL = PathJoin(PathParent(oldURL), Uuid::generate().string());
        if (const TarnStatus moved =
                TarnFileManager::defaultManager().moveItemAtURL(oldURL, newURL);
            !moved.ok()) {
            setErrorFrom(
                error, TARN_ERROR_IN(operation, TarnErrorUUIDMoveFailed, moved.error(),
                                     "Failed to move dir: %@ to new UUID dir: %@", oldURL, newURL));
            return;
        }
        if (const TarnStatus added = TarnContainerCache::sharedInstance().addContainerMetadata(
                metadata, newURL, metadata->transient(), /*updateSandbox=*/true);
            !added.ok()) {
            setErrorFrom(error, TARN_ERROR_IN(operation, TarnErrorCacheAddFailed, added.error(),
                                              "Failed to add to cache: %@, url: %@, transient: %d",
                                              metadata, newURL, metadata->transient()));
        }
    });
}

}  // namespace tarn
