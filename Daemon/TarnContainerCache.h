// TarnContainerCache: where every container is. Per user identity and class
// it keeps a dictionary identifier -> metadata, built by scanning the class's
// base directory once and kept current as containers are added and removed;
// one set of dictionaries for live containers and one for transient ones.
//
// It is also the bridge to the kernel sandbox's per-user state
// (Platform/SandboxUserState.h): when it learns where a container is it may
// push the mapping (user, item type, identifier -> path), and a lookup of a
// class that has not been scanned yet is first answered from that state, so
// the first lookup after a daemon restart needs no directory scan.
//
// Keys: "[<user identity identifier>]-<class short name>" for per-user
// classes, the short name alone for global ones; the personal and unspecific
// identity of one user share their entries.
//
// Concurrency: one mutex (cacheLock_) guards both maps. Every public operation
// takes it and lets it go before it checks a found container on disk. Pushes
// after an add or a remove happen outside it; pushes during a rebuild or an
// invalidation happen inside it (so a rebuild of one class holds up lookups of
// every class). Lock order: cacheLock_, then the user identity cache's lock,
// then the code-signing mapping's queue. No public operation may be called on
// the code-signing mapping's queue (the registration rule reads the mapping
// synchronously); it is a programming error and aborts.
//
// Invalidation notices from the user identity cache arrive with that cache's
// lock held; taking cacheLock_ there could deadlock against a rebuild that
// asks the identity cache, so the callback hands the work to the cache's own
// serial queue ("com.ostrea.tarnkeeperd.TarnContainerCache.invalidation")
// inside a process transaction.
//
// Lifetime: sharedInstance() is made once per root prefix and lives for the
// process. Metadata handed out is immutable; callers copy() to change it.
#pragma once

#include <atomic>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <unordered_map>
#include <vector>

#include "Daemon/TarnContainerClass.h"
#include "Daemon/TarnContainerIdentity.h"
#include "Daemon/TarnError.h"
#include "Daemon/TarnMetadata.h"
#include "Daemon/TarnResult.h"
#include "Daemon/TarnUserIdentityCache.h"
#include "Platform/Dispatch.h"
#include "Platform/Path.h"
#include "Platform/ThreadAnnotations.h"

namespace tarn {

class TarnCodeSigningMapping;
class SandboxUserState;

// identifier -> metadata of one (user identity, class), live or transient.
using TarnContainerClassCache = std::unordered_map<std::string, TarnMetadataRef>;
using TarnContainerClassCacheRef = std::shared_ptr<TarnContainerClassCache>;

class TarnContainerCache : public TarnUserIdentityCacheObserver,
                           public std::enable_shared_from_this<TarnContainerCache> {
    struct PrivateTag {};

  public:
    // Over TarnUserIdentitySharedCache, the shared code-signing mapping (which
    // may be absent: then no parent identifiers are used) and the shared
    // sandbox state. One per root prefix.
    static TarnContainerCache& sharedInstance();

    // initWithUserIdentityCache:codeSigningMapping: — empty maps; registers as
    // an observer of `userIdentityCache`. Everything passed must outlive the
    // cache; `codeSigningMapping` may be null.
    static std::shared_ptr<TarnContainerCache> initWithUserIdentityCache(
        TarnUserIdentityCache& userIdentityCache, TarnCodeSigningMapping* codeSigningMapping);
    static std::shared_ptr<TarnContainerCache> initWithUserIdentityCache(
        TarnUserIdentityCache& userIdentityCache, TarnCodeSigningMapping* codeSigningMapping,
        SandboxUserState& sandboxUserState);

    TarnContainerCache(PrivateTag, TarnUserIdentityCache& userIdentityCache,
                       TarnCodeSigningMapping* codeSigningMapping,
                       SandboxUserState& sandboxUserState);
    ~TarnContainerCache() override;
    TarnContainerCache(const TarnContainerCache&) = delete;
    TarnContainerCache& operator=(const TarnContainerCache&) = delete;

    TarnUserIdentityCache& userIdentityCache() const { return userIdentityCache_; }
    TarnCodeSigningMapping* codeSigningMapping() const { return codeSigningMapping_; }

    // ---- Lookups ----

    // The container's metadata (never null), or the error: TarnErrorNotFound,
    // TarnErrorCacheRebuildFailed, TarnErrorCacheInconsistent when found but its
    // metadata file is gone (the entry is dropped; the next lookup answers
    // TarnErrorNotFound), TarnErrorCacheInvalidInput for a bad URL,
    // TarnErrorException.
    // `updateSandbox`: a rebuild may push mappings; `allowKernelLookup`: an
    // unscanned class may be answered from the sandbox state (non-transient only).
    TarnResult<TarnMetadataRef> containerForContainerIdentity(
        const TarnContainerIdentityRef& identity, bool transient, bool updateSandbox,
        bool allowKernelLookup);
    TarnResult<TarnMetadataRef> containerForContainerIdentity(
        const TarnContainerIdentityRef& identity, bool transient, bool updateSandbox);
    // Live first, then transient; only a container with the identity's UUID
    // counts. The answer is marked transient or not accordingly. No errors.
    TarnMetadataRef containerForContainerIdentity(const TarnConcreteContainerIdentityRef& identity);

    // Every container of the class (of every accessible identity for the
    // unspecific one). Entries whose metadata file is gone are left out and
    // dropped. Order unspecified. Errors: TarnErrorCacheInvalidInput for a bad
    // class, TarnErrorCacheRebuildFailed, TarnErrorException.
    TarnResult<std::vector<TarnMetadataRef>> allContainersForUserIdentity(
        const TarnUserIdentityRef& userIdentity, TarnContainerClass contentClass, bool transient,
        bool populateSandboxCache);
    TarnResult<std::vector<TarnMetadataRef>> allContainersForUserIdentity(
        const TarnUserIdentityRef& userIdentity, TarnContainerClass contentClass, bool transient);

    // ---- Changes ----

    // Records `metadata` (with its url set to `url`). Before the class was
    // built and without `updateSandbox` it records nothing and succeeds.
    // Errors: TarnErrorCacheInvalidInput for bad input, TarnErrorCacheRebuildFailed.
    TarnStatus addContainerMetadata(const TarnMetadataRef& metadata, const FileURL& url,
                                    bool transient, bool updateSandbox);
    TarnStatus removeContainerForUserIdentity(const TarnUserIdentityRef& userIdentity,
                                              TarnContainerClass contentClass,
                                              const std::string& identifier, bool transient);

    // ---- Kernel sandbox mapping ----

    // The end of an add (`url`) or a remove (none) in the cache: the kernel
    // mapping follows when `pushMapping` (a failure is logged, never fatal:
    // the next rebuild pushes again), then the debug line. Called without
    // the cache lock, under the name of the operation it ends.
    void _finishChange(const char* function, const TarnUserIdentityRef& userIdentity,
                       const std::string& identifier, TarnContainerClass containerClass,
                       bool transient, bool pushMapping, const std::optional<FileURL>& url);
    // Pushes one mapping; no `url` removes it. Bundle classes: nothing, true.
    bool setSandboxContainerMappingForUserIdentity(const TarnUserIdentityRef& userIdentity,
                                                   const std::string& identifier,
                                                   TarnContainerClass containerClass,
                                                   const std::optional<FileURL>& url);
    // Whether a container of this identity is pushed at all.
    bool shouldRegisterSandboxMappingWithUserIdentity(const TarnUserIdentityRef& userIdentity,
                                                      const std::string& identifier,
                                                      TarnContainerClass containerClass);

    // Whether a directory entry can be a container of the class: a UUID name,
    // or a well-known name for the system classes.
    bool containerURL(const FileURL& url, TarnContainerClass isValidForContainerClass) const;
    // The same, of the entry's name alone.
    static bool containerName(std::string_view name, TarnContainerClass isValidForContainerClass);

    // ---- Invalidation ----

    // Drops the identity's dictionaries of every class (removing the live
    // containers' mappings) and posts CONTAINER_NOTIFY_USER_INVALIDATED.
    void invalidateUserIdentity(const TarnUserIdentityRef& userIdentity);
    // Observer callback: queues invalidateUserIdentity() (see above).
    void userIdentityCache(TarnUserIdentityCache& cache,
                           const TarnUserIdentityRef& didInvalidateUserIdentity) override;

    // "[501]-appData", "app".
    static std::string _cacheKeyForUserIdentity(const TarnUserIdentityRef& userIdentity,
                                                TarnContainerClass containerClass);

    // The same key as its parts, so that a lookup finds its dictionary
    // without building the text: it hashes and compares like the text
    // _cacheKeyForUserIdentity makes. Views into the identity; do not keep.
    struct CacheKeyParts {
        std::string_view userIdentifier;
        std::string_view shortName;
        bool perUser = false;
    };
    static CacheKeyParts _cacheKeyPartsForUserIdentity(const TarnUserIdentityRef& userIdentity,
                                                       TarnContainerClass containerClass);
    struct CacheKeyHash {
        using is_transparent = void;
        size_t operator()(std::string_view key) const;
        size_t operator()(const CacheKeyParts& key) const;
    };
    struct CacheKeyEqual {
        using is_transparent = void;
        bool operator()(std::string_view a, std::string_view b) const { return a == b; }
        bool operator()(const CacheKeyParts& a, std::string_view b) const;
        bool operator()(std::string_view a, const CacheKeyParts& b) const { return (*this)(b, a); }
    };

    // ---- Test access ----
    // Class directories scanned so far.
    uint64_t TEST_rebuildCount() const { return rebuildCount_.load(); }
    // Sandbox-state reads that answered a lookup.
    uint64_t TEST_kernelHitCount() const { return kernelHitCount_.load(); }
    // Waits for invalidations queued by observer callbacks.
    void TEST_drainInvalidations();

  private:
    // The dictionary of the key, built when missing. Without `buildCache` a
    // missing one is null (and no failure).
    TarnResult<TarnContainerClassCacheRef> _lock_getCacheForUserIdentity(
        const TarnUserIdentityRef& userIdentity, TarnContainerClass contentClass, bool transient,
        bool populateSandboxCache, bool buildCache) REQUIRES(cacheLock_);
    TarnResult<TarnContainerClassCacheRef> _lock_getCacheForUserIdentity(
        const TarnUserIdentityRef& userIdentity, TarnContainerClass contentClass, bool transient)
        REQUIRES(cacheLock_);
    TarnMetadataRef _lock_metadataFromSandboxForContainerIdentity(
        const TarnContainerIdentityRef& identity) REQUIRES(cacheLock_);
    void _lock_forEachContainerInContainerCache(
        const TarnContainerClassCache& cache,
        const std::function<void(const TarnMetadataRef&)>& performBlock) REQUIRES(cacheLock_);
    void _lock_invalidateUserIdentity(const TarnUserIdentityRef& userIdentity) REQUIRES(cacheLock_);
    bool _lock_shouldRegisterSandboxMappingWithUserIdentity(const TarnUserIdentityRef& userIdentity,
                                                            const std::string& identifier,
                                                            TarnContainerClass containerClass)
        REQUIRES(cacheLock_);

    bool _shouldRegister(const TarnUserIdentityRef& userIdentity, const std::string& identifier,
                         TarnContainerClass containerClass);
    // setSandboxContainerMappingForUserIdentity with the path as it is held
    // (nullptr: none), so that a rebuild copies no path to push it.
    bool _setSandboxContainerMapping(const TarnUserIdentityRef& userIdentity,
                                     const std::string& identifier,
                                     TarnContainerClass containerClass, const char* url);
    // containerForContainerIdentity without its exception fence.
    TarnResult<TarnMetadataRef> _containerForContainerIdentity(
        const TarnContainerIdentityRef& identity, bool transient, bool updateSandbox,
        bool allowKernelLookup);
    // Aborts when called on the code-signing mapping's queue.
    void assertNotOnMappingQueue() const;

    // Constant after construction.
    TarnUserIdentityCache& userIdentityCache_;
    TarnCodeSigningMapping* const codeSigningMapping_;
    SandboxUserState& sandboxUserState_;
    DispatchQueueRef invalidationQueue_;

    // Self-synchronising.
    std::atomic<uint64_t> rebuildCount_{0};
    std::atomic<uint64_t> kernelHitCount_{0};

    mutable Mutex cacheLock_;
    using ClassCacheMap =
        std::unordered_map<std::string, TarnContainerClassCacheRef, CacheKeyHash, CacheKeyEqual>;
    ClassCacheMap liveContainerCache_ GUARDED_BY(cacheLock_);
    ClassCacheMap transientContainerCache_ GUARDED_BY(cacheLock_);
};

}  // namespace tarn
