// TarnUserIdentityCache: turns the persona list into user identities and
// answers which identity a request runs under and which identities an
// application belongs to. TarnUserIdentitySharedCache is the process-wide one.
//
// Maps are built lazily: a flush marks them invalid and the next use rebuilds
// them from the roster under the cache lock (_lock_resync). While personas are
// declared supported but the roster gives no usable list, the rebuild retries
// once a second and ends the process after 61 attempts; a thread that
// triggers a rebuild blocks the cache's other users meanwhile.
//
// Observers are held weakly and are told, from the flushing thread with the
// cache lock held, about every enterprise identity a flush drops. They must
// not call back into the cache.
//
// Persona-list updates from the roster open a transaction and flush on the
// cache's own serial queue "com.ostrea.tarnkeeperd.TarnUserIdentityCache.flushQueue".
#pragma once

#include <atomic>
#include <chrono>
#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "Daemon/TarnUserIdentity.h"
#include "Platform/Dispatch.h"
#include "Platform/PersonaRoster.h"
#include "Platform/ThreadAnnotations.h"

namespace tarn {

class TarnUserIdentityCache;
struct HostConfiguration;

class TarnUserIdentityCacheObserver {
  public:
    virtual ~TarnUserIdentityCacheObserver() = default;
    virtual void userIdentityCache(TarnUserIdentityCache& cache,
                                   const TarnUserIdentityRef& didInvalidateUserIdentity) = 0;
};

class TarnUserIdentityCache {
  public:
    // Registers with `roster` for list updates; the roster must outlive the cache.
    explicit TarnUserIdentityCache(PersonaRoster& roster);
    virtual ~TarnUserIdentityCache();
    TarnUserIdentityCache(const TarnUserIdentityCache&) = delete;
    TarnUserIdentityCache& operator=(const TarnUserIdentityCache&) = delete;

    // "<TarnUserIdentityCache: 0x...>", for log lines that name the cache.
    std::string description() const;

    // Mobile ids of the global configuration, the mobile user's home, personal,
    // kernel persona id = the mobile uid. Made once per root prefix.
    static TarnUserIdentityRef defaultUserIdentity();
    // TarnUserIdentity::init() (user 501), made once per root prefix.
    static TarnUserIdentityRef userIdentityForLegacyMobileUser();

    // Decided once per process from the host configuration.
    static bool personasAreSupported();
    // The decision itself: multi-user mode, then the device question, then
    // ephemeral storage.
    static bool computePersonasAreSupported(const HostConfiguration& host);
    static void TEST_setPersonasAreSupported(std::optional<bool> supported);

    // The identity a request acts for: its persona (`personaUniqueString`,
    // the peer's; empty for none) on the mobile user, or on `uid` unless that
    // is a role account.
    TarnUserIdentityRef userIdentityForCurrentContext(
        const std::optional<std::string>& personaUniqueString);
    TarnUserIdentityRef userIdentityForCurrentContextWithUID(
        uint32_t uid, uint32_t GID, const std::optional<std::string>& personaUniqueString);
    TarnUserIdentityRef userIdentityForPersonalPersona();
    TarnUserIdentityRef userIdentityForPersonalPersonaWithUID(uint32_t uid, uint32_t GID);
    TarnUserIdentityRef unspecificUserIdentity();
    // nullopt string: the unspecific identity. nullptr when the string is unknown.
    TarnUserIdentityRef userIdentityForPersonaUniqueString(
        const std::optional<std::string>& personaUniqueString, uint32_t UID, uint32_t GID);
    TarnUserIdentityRef userIdentityForCurrentUserWithPersonaUniqueString(
        const std::optional<std::string>& personaUniqueString);
    TarnUserIdentityRef userIdentityWithPersonaID(uint32_t personaID);

    // The identities an application belongs to; the personal one when no
    // persona lists it.
    TarnUserIdentitySet userIdentitiesForBundleIdentifier(const std::string& bundleIdentifier);
    // What the sandbox registration rule asks of those identities, under one
    // lock and without copying them: how many there are, and whether each of
    // two given identities is among them.
    struct BundleOwners {
        size_t count = 0;
        bool includesFirst = false;
        bool includesSecond = false;
    };
    BundleOwners ownersOfBundleIdentifier(const std::string& bundleIdentifier,
                                          const TarnUserIdentityRef& first,
                                          const TarnUserIdentityRef& second);
    bool isBundleIdentifier(const std::string& bundleIdentifier,
                            const TarnUserIdentityRef& associatedWithUserIdentity);
    // Calls `block` once per known identity, outside the cache lock.
    void forEachAccessibleUserIdentitySynchronouslyExecuteBlock(
        const std::function<void(const TarnUserIdentityRef&)>& block);

    void flush();
    void flushAndRepopulateWithUserIdentities(const std::vector<TarnUserIdentityRef>& identities);

    void addObserver(const std::weak_ptr<TarnUserIdentityCacheObserver>& observer);
    void removeObserver(const TarnUserIdentityCacheObserver* observer);
    void unregister();
    bool registered() const;

    // Identities from persona attributes (nullptr attributes: the user id as
    // persona id and the user's home).
    static TarnUserIdentityRef userIdentityWithPersonaAttributes(
        const PersonaAttributes* attributes, bool forceUnspecific = false);
    static TarnUserIdentityRef userIdentityWithPersonaAttributes(
        const PersonaAttributes* attributes, uint32_t UID, uint32_t GID, bool forceUnspecific);
    static TarnUserIdentityRef _updateUserIdentity(const TarnUserIdentityRef& userIdentity,
                                                   uint32_t withUID, uint32_t GID);

    // Roster callback: flush on the flush queue inside a transaction.
    void personaListDidUpdate();

    // Pause between fetch attempts of a rebuild (1 s in production).
    void TEST_setRetryDelay(std::chrono::milliseconds delay) { retryDelay_ = delay; }
    // Waits until flushes queued so far have run.
    void TEST_drainFlushQueue();

  private:
    class RosterTrampoline;

    void _lock_resync() REQUIRES(lock_);
    bool _lock_resync_fromUserPersonaAttributes(const PersonaAttributesList& list) REQUIRES(lock_);
    void _lock_flush() REQUIRES(lock_);
    // Accessors that rebuild first when the maps are invalid.
    void _lock_ensureValid() REQUIRES(lock_);
    TarnUserIdentityRef lock_userIdentityForPersonalPersona() REQUIRES(lock_);
    TarnUserIdentityRef lock_userIdentityForUnspecificPersona() REQUIRES(lock_);
    [[noreturn]] static void crashForMissingPersonas();

    // Constant after construction.
    PersonaRoster& roster_;
    DispatchQueueRef flushQueue_;
    std::shared_ptr<RosterTrampoline> trampoline_;
    std::chrono::milliseconds retryDelay_{1000};

    // Self-synchronising.
    std::atomic<bool> registered_{false};

    mutable Mutex lock_;
    bool cacheInvalid_ GUARDED_BY(lock_) = true;
    std::map<std::string, TarnUserIdentitySet> lock_bundleToEnterpriseIdentitiesMap_
        GUARDED_BY(lock_);
    std::map<std::string, TarnUserIdentityRef> lock_personaUniqueStringToUserIdentityMap_
        GUARDED_BY(lock_);
    std::map<uint32_t, TarnUserIdentityRef> lock_personaIDToUserIdentityMap_ GUARDED_BY(lock_);
    TarnUserIdentityRef lock_userIdentityForPersonalPersona_ GUARDED_BY(lock_);
    TarnUserIdentityRef lock_userIdentityForUnspecificPersona_ GUARDED_BY(lock_);
    // The list the maps were last built from, for log lines.
    std::optional<PersonaAttributesList> lock_lastList_ GUARDED_BY(lock_);

    // Guarded by observersLock_ (taken after lock_ when both are held).
    Mutex observersLock_;
    std::vector<std::weak_ptr<TarnUserIdentityCacheObserver>> observers_ GUARDED_BY(observersLock_);
};

// The process-wide cache over PersonaRoster::sharedManager(). Made once per
// root prefix (tests change it); earlier instances stay alive.
class TarnUserIdentitySharedCache : public TarnUserIdentityCache {
  public:
    static TarnUserIdentitySharedCache& sharedInstance();
    explicit TarnUserIdentitySharedCache(PersonaRoster& roster) : TarnUserIdentityCache(roster) {}
};

}  // namespace tarn
