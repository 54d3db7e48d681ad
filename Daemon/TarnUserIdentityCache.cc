#include "Daemon/TarnUserIdentityCache.h"

#include <atomic>
#include <cstdio>
#include <cstdlib>
#include <set>
#include <thread>

#include "Daemon/TarnFileManager.h"
#include "Daemon/TarnGlobalConfiguration.h"
#include "Daemon/TarnLog.h"
#include "Platform/HostConfiguration.h"
#include "Platform/PlatformLog.h"
#include "Platform/RootPrefix.h"

namespace tarn {

namespace {

constexpr const char* kCategory = "useridentity";
constexpr uint32_t kFirstNonRoleUID = 501;
constexpr unsigned long kMaxResyncTry = 60;

std::mutex gSupportLock;
std::optional<bool> gPersonasSupported;   // decided once per process
std::optional<bool> gPersonasSupportedOverride;

// A value made once per root prefix: the root is fixed in production; tests
// change it and must not see identities of an earlier scratch tree. Slots are
// never freed: a flush queued by the roster's watcher can still run while
// exit() destroys statics.
struct PerRootIdentity {
    std::mutex lock;
    std::string root;
    TarnUserIdentityRef identity;
};

template <class Make>
TarnUserIdentityRef perRoot(PerRootIdentity& slot, Make make) {
    std::lock_guard<std::mutex> guard(slot.lock);
    if (!slot.identity || slot.root != RootPrefix()) {
        slot.identity = make();
        slot.root = RootPrefix();
    }
    return slot.identity;
}

void mobileIds(uint32_t* uid, uint32_t* gid) {
    auto& config = TarnGlobalConfiguration::sharedInstance();
    *uid = config.currentMobileUserId();
    *gid = config.currentMobileGroupId();
}

}  // namespace

// Forwards roster notices to the cache while it lives. The roster holds it
// weakly; the cache detaches it before it goes away.
class TarnUserIdentityCache::RosterTrampoline : public PersonaListUpdateObserver {
public:
    explicit RosterTrampoline(TarnUserIdentityCache* cache) : cache_(cache) {}
    void personaListDidUpdate() override {
        std::lock_guard<std::mutex> guard(lock_);
        if (cache_) cache_->personaListDidUpdate();
    }
    void registrationFinished(const std::optional<std::string>& error) {
        std::lock_guard<std::mutex> guard(lock_);
        if (!cache_) return;
        if (error) {
            TarnLog(kLogError, "init",
                    "Failed to register for persona list updates: %@", *error);
            PlatformLog(kCategory, PlatformLogType::Fault,
                        "Failed to register for persona list updates: %@", *error);
            return;
        }
        cache_->registered_ = true;
        TarnLog(kLogNotice, "init", "Registered for persona list updates.");
    }
    void detach() {
        std::lock_guard<std::mutex> guard(lock_);
        cache_ = nullptr;
    }

private:
    std::mutex lock_;
    TarnUserIdentityCache* cache_;
};

std::string TarnUserIdentityCache::description() const {
    return Format("<%@: %p>", "TarnUserIdentityCache", static_cast<const void*>(this));
}

TarnUserIdentityCache::TarnUserIdentityCache(PersonaRoster& roster) : roster_(roster) {
    {
        MutexLock guard(lock_);
        _lock_flush();
    }
    flushQueue_ =
        DispatchQueue::createSerial("com.ostrea.tarnkeeperd.TarnUserIdentityCache.flushQueue");
    trampoline_ = std::make_shared<RosterTrampoline>(this);
    std::weak_ptr<RosterTrampoline> weak = trampoline_;
    roster_.registerPersonaListUpdateObserver(
        trampoline_, "com.ostrea.tarnkeeperd.personaobserver",
        [weak](const std::optional<std::string>& error) {
            if (auto t = weak.lock()) t->registrationFinished(error);
        });
}

TarnUserIdentityCache::~TarnUserIdentityCache() {
    unregister();
    trampoline_->detach();
    // A flush already queued refers to this object; let it finish first.
    flushQueue_->sync([] {});
}

// ---- Class-level answers ----

TarnUserIdentityRef TarnUserIdentityCache::defaultUserIdentity() {
    static auto& slot = *new PerRootIdentity;
    return perRoot(slot, [] {
        uint32_t uid = 0, gid = 0;
        mobileIds(&uid, &gid);
        auto identity =
            TarnUserIdentity::initWithUID(uid, gid, TarnFileManager::homeDirectoryURLForPOSIXUID(uid),
                                          std::nullopt, TarnPersonaTypePersonal, uid);
        // Without a usable mobile account the legacy mobile user keeps the
        // daemon working rather than handing out no identity at all.
        return identity ? identity : userIdentityForLegacyMobileUser();
    });
}

TarnUserIdentityRef TarnUserIdentityCache::userIdentityForLegacyMobileUser() {
    static auto& slot = *new PerRootIdentity;
    return perRoot(slot, [] { return TarnUserIdentity::init(); });
}

bool TarnUserIdentityCache::computePersonasAreSupported(const HostConfiguration& host) {
    // Multi-user mode is the top bit of the 32-bit flags word.
    if (host.multiUserFlags && (*host.multiUserFlags & 0x80000000u) != 0) return false;
    if (!host.deviceSupportsPersonas) return false;
    return !host.ephemeralStorage;
}

bool TarnUserIdentityCache::personasAreSupported() {
    std::lock_guard<std::mutex> guard(gSupportLock);
    if (gPersonasSupportedOverride) return *gPersonasSupportedOverride;
    if (!gPersonasSupported) {
        gPersonasSupported = computePersonasAreSupported(HostConfiguration::shared());
    }
    return *gPersonasSupported;
}

void TarnUserIdentityCache::TEST_setPersonasAreSupported(std::optional<bool> supported) {
    std::lock_guard<std::mutex> guard(gSupportLock);
    gPersonasSupportedOverride = supported;
}

TarnUserIdentityRef TarnUserIdentityCache::userIdentityWithPersonaAttributes(
    const PersonaAttributes* attributes, bool forceUnspecific) {
    uint32_t uid = 0, gid = 0;
    mobileIds(&uid, &gid);
    return userIdentityWithPersonaAttributes(attributes, uid, gid, forceUnspecific);
}

TarnUserIdentityRef TarnUserIdentityCache::userIdentityWithPersonaAttributes(
    const PersonaAttributes* attributes, uint32_t UID, uint32_t GID, bool forceUnspecific) {
    std::optional<std::string> unique = attributes ? attributes->userPersonaUniqueString()
                                                   : std::nullopt;
    uint32_t personaID = attributes ? attributes->userPersona_id() : UID;
    FileURL home;
    if (attributes && attributes->isEnterprisePersona() && attributes->personaLayoutPathURL()) {
        home = *attributes->personaLayoutPathURL();
    } else {
        home = TarnFileManager::homeDirectoryURLForPOSIXUID(UID);
    }
    uint32_t type = TarnPersonaTypeUnspecific;
    if (!forceUnspecific && attributes) {
        if (attributes->isPersonalPersona()) type = TarnPersonaTypePersonal;
        else if (attributes->isEnterprisePersona()) type = TarnPersonaTypeEnterprise;
    }
    return TarnUserIdentity::initWithUID(UID, GID, std::move(home), std::move(unique), type,
                                         personaID);
}

TarnUserIdentityRef TarnUserIdentityCache::_updateUserIdentity(
    const TarnUserIdentityRef& userIdentity, uint32_t withUID, uint32_t GID) {
    if (!userIdentity) return nullptr;
    // An enterprise home is the persona's own layout, not the user's.
    FileURL home = userIdentity->isEnterprise()
                       ? userIdentity->homeDirectoryURL()
                       : TarnFileManager::homeDirectoryURLForPOSIXUID(withUID);
    return TarnUserIdentity::initWithUID(withUID, GID, std::move(home),
                                         userIdentity->personaUniqueString(),
                                         userIdentity->personaType(),
                                         userIdentity->kernelPersonaID());
}

// ---- Rebuilding ----

void TarnUserIdentityCache::crashForMissingPersonas() {
    TarnLog(kLogError, "_lock_resync",
            "Could not obtain persona attributes after exhausting retries, crashing");
    PlatformLog(kCategory, PlatformLogType::Fault,
                "Could not obtain persona attributes after exhausting retries.");
    std::fprintf(stderr, "Could not obtain persona attributes after exhausting retries.\n");
    std::abort();
}

void TarnUserIdentityCache::_lock_resync() {
    if (!personasAreSupported()) {
        cacheInvalid_ = false;
        return;
    }
    for (unsigned long attempt = 0;; ++attempt) {
        std::optional<PersonaAttributesList> list = roster_.listAllPersonaWithAttributes();
        PlatformLog(kCategory, PlatformLogType::Default, "Got userPersonaAttributes: %@ on try: %lu",
                    PersonaListDescription(list), attempt);
        lock_lastList_ = list;
        const bool empty = !list || list->empty();
        if (!empty && _lock_resync_fromUserPersonaAttributes(*list)) break;
        if (empty && attempt == 0) {
            TarnLog(kLogError, "_lock_resync",
                    "Did not receive any persona attributes: %@", PersonaListDescription(list));
            PlatformLog(kCategory, PlatformLogType::Fault, "Did not receive any persona attributes.");
        } else if (attempt == kMaxResyncTry) {
            crashForMissingPersonas();
        }
        // Sleeping with the lock held is deliberate: nobody may use maps that
        // do not exist yet.
        std::this_thread::sleep_for(retryDelay_);
    }
    cacheInvalid_ = false;
}

bool TarnUserIdentityCache::_lock_resync_fromUserPersonaAttributes(const PersonaAttributesList& list) {
    const char* tag = "_lock_resync_fromUserPersonaAttributes";
    const std::string listText = PersonaListDescription(list);
    const PersonaAttributes* personal = nullptr;
    for (const auto& p : list) {
        if (p && p->isPersonalPersona()) {
            personal = p.get();
            break;
        }
    }
    if (!personal) {
        TarnLog(kLogError, tag, "Expected to find a personal persona in %@", listText);
        PlatformLog(kCategory, PlatformLogType::Fault, "Expected to find a personal persona in %@",
                    listText);
        return false;
    }
    if (!personal->userPersonaUniqueString()) {
        TarnLog(kLogError, tag, "Invalid persona unique string for personal %@", *personal);
        PlatformLog(kCategory, PlatformLogType::Fault, "Invalid persona unique string for personal %@",
                    *personal);
        return false;
    }

    std::map<std::string, TarnUserIdentitySet> bundleMap;
    std::map<std::string, TarnUserIdentityRef> stringMap;
    std::map<uint32_t, TarnUserIdentityRef> idMap;

    TarnUserIdentityRef P = userIdentityWithPersonaAttributes(personal, false);
    TarnUserIdentityRef U = userIdentityWithPersonaAttributes(personal, true);
    if (!P || !U) {
        TarnLog(kLogError, tag, "Expected to find a personal persona in %@", listText);
        PlatformLog(kCategory, PlatformLogType::Fault, "Expected to find a personal persona in %@",
                    listText);
        return false;
    }
    stringMap[*personal->userPersonaUniqueString()] = P;
    idMap[personal->userPersona_id()] = P;
    PlatformLog(kCategory, PlatformLogType::Default,
                "Found personal persona %@: created personal %@, unspecific %@", *personal, P, U);

    // Applications of universal and system personas, in first-seen order.
    std::vector<std::string> shared;
    std::set<std::string> sharedSeen;
    for (const auto& p : list) {
        if (!p || !(p->isUniversalPersona() || p->isSystemPersona())) continue;
        PlatformLog(kCategory, PlatformLogType::Debug,
                    "Looking at universal=%d system=%d attributes: %@", p->isUniversalPersona(),
                    p->isSystemPersona(), *p);
        PlatformLog(kCategory, PlatformLogType::Default,
                    "Fetched bundle ID list for universal/system %@: %@", p->userPersonaUniqueString(),
                    PlistValue(PlistArray(p->userPersonaBundleIDList().begin(),
                                          p->userPersonaBundleIDList().end())));
        for (const auto& b : p->userPersonaBundleIDList()) {
            if (sharedSeen.insert(b).second) shared.push_back(b);
        }
        if (p->userPersonaUniqueString()) stringMap[*p->userPersonaUniqueString()] = U;
        idMap[p->userPersona_id()] = U;
    }

    for (const auto& p : list) {
        if (!p || !p->isEnterprisePersona()) continue;
        if (!p->userPersonaUniqueString()) {
            TarnLog(kLogError, tag, "Invalid persona unique string for %@", *p);
            PlatformLog(kCategory, PlatformLogType::Fault, "Invalid persona unique string for %@", *p);
            continue;
        }
        TarnUserIdentityRef E = userIdentityWithPersonaAttributes(p.get(), false);
        PlatformLog(kCategory, PlatformLogType::Default, "Creating user identity for %@: %@", *p, E);
        if (!E) continue;
        stringMap[*p->userPersonaUniqueString()] = E;
        idMap[p->userPersona_id()] = E;
        PlatformLog(kCategory, PlatformLogType::Default, "Fetched bundle ID list for enterprise %@: %@",
                    p->userPersonaUniqueString(),
                    PlistValue(PlistArray(p->userPersonaBundleIDList().begin(),
                                          p->userPersonaBundleIDList().end())));
        for (const auto& b : p->userPersonaBundleIDList()) bundleMap[b].insert(E);
        for (const auto& b : shared) bundleMap[b].insert(E);
    }
    for (const auto& b : shared) bundleMap[b].insert(P);

    lock_bundleToEnterpriseIdentitiesMap_ = std::move(bundleMap);
    lock_personaUniqueStringToUserIdentityMap_ = std::move(stringMap);
    lock_personaIDToUserIdentityMap_ = std::move(idMap);
    lock_userIdentityForPersonalPersona_ = std::move(P);
    lock_userIdentityForUnspecificPersona_ = std::move(U);
    return true;
}

void TarnUserIdentityCache::_lock_flush() {
    TarnUserIdentitySet dropped;
    for (const auto& [_, identity] : lock_personaUniqueStringToUserIdentityMap_) {
        if (identity->isEnterprise()) dropped.insert(identity);
    }
    cacheInvalid_ = true;
    lock_bundleToEnterpriseIdentitiesMap_.clear();
    lock_personaUniqueStringToUserIdentityMap_.clear();
    lock_personaIDToUserIdentityMap_.clear();
    lock_userIdentityForPersonalPersona_ = defaultUserIdentity();
    lock_userIdentityForUnspecificPersona_ = defaultUserIdentity();
    if (dropped.empty()) return;

    std::vector<std::shared_ptr<TarnUserIdentityCacheObserver>> observers;
    {
        MutexLock guard(observersLock_);
        for (const auto& weak : observers_) {
            if (auto o = weak.lock()) observers.push_back(std::move(o));
        }
    }
    for (const auto& identity : dropped) {
        for (const auto& o : observers) o->userIdentityCache(*this, identity);
    }
}

void TarnUserIdentityCache::_lock_ensureValid() {
    if (cacheInvalid_) _lock_resync();
}

TarnUserIdentityRef TarnUserIdentityCache::lock_userIdentityForPersonalPersona() {
    _lock_ensureValid();
    return lock_userIdentityForPersonalPersona_;
}

TarnUserIdentityRef TarnUserIdentityCache::lock_userIdentityForUnspecificPersona() {
    _lock_ensureValid();
    return lock_userIdentityForUnspecificPersona_;
}

// ---- Public answers ----

TarnUserIdentityRef TarnUserIdentityCache::userIdentityForCurrentContext(
    const std::optional<std::string>& personaUniqueString) {
    uint32_t uid = 0, gid = 0;
    mobileIds(&uid, &gid);
    return userIdentityForCurrentContextWithUID(uid, gid, personaUniqueString);
}

TarnUserIdentityRef TarnUserIdentityCache::userIdentityForCurrentContextWithUID(
    uint32_t uid, uint32_t GID, const std::optional<std::string>& personaUniqueString) {
    if (uid < kFirstNonRoleUID) mobileIds(&uid, &GID);
    TarnUserIdentityRef result;
    if (!personasAreSupported()) {
        result = userIdentityForPersonalPersonaWithUID(uid, GID);
        PlatformLog(kCategory, PlatformLogType::Info, "(%d/%d) Personas not supported, using: %@",
                    uid, GID, result);
        return result;
    }
    PersonaAttributesRef persona = roster_.currentPersona(personaUniqueString);
    std::optional<std::string> unique = persona ? persona->userPersonaUniqueString() : std::nullopt;
    if (persona && persona->isPersonalPersona()) {
        result = userIdentityForPersonalPersonaWithUID(uid, GID);
        PlatformLog(kCategory, PlatformLogType::Info, "(%d/%d) Explicit personal persona, using: %@",
                    uid, GID, result);
    } else if (persona && persona->isEnterprisePersona() && unique) {
        result = userIdentityForPersonaUniqueString(unique, uid, GID);
        PlatformLog(kCategory, PlatformLogType::Info, "(%d/%d) Looked up user identity for [%@]: %@",
                    uid, GID, unique, result);
    } else {
        result = userIdentityForPersonaUniqueString(std::nullopt, uid, GID);
        PlatformLog(kCategory, PlatformLogType::Info,
                    "(%d/%d) No persona (<%p>) or no unique string [%@], using: %@", uid, GID,
                    static_cast<const void*>(persona.get()), unique, result);
    }
    return result;
}

TarnUserIdentityRef TarnUserIdentityCache::userIdentityForPersonalPersona() {
    uint32_t uid = 0, gid = 0;
    mobileIds(&uid, &gid);
    return userIdentityForPersonalPersonaWithUID(uid, gid);
}

TarnUserIdentityRef TarnUserIdentityCache::userIdentityForPersonalPersonaWithUID(uint32_t uid,
                                                                                 uint32_t GID) {
    if (uid < kFirstNonRoleUID) mobileIds(&uid, &GID);
    TarnUserIdentityRef personal;
    {
        MutexLock guard(lock_);
        personal = lock_userIdentityForPersonalPersona();
    }
    if (!personal) return nullptr;
    if (personal->posixUID() == uid && personal->posixGID() == GID) return personal;
    return _updateUserIdentity(personal, uid, GID);
}

TarnUserIdentityRef TarnUserIdentityCache::unspecificUserIdentity() {
    MutexLock guard(lock_);
    return lock_userIdentityForUnspecificPersona();
}

TarnUserIdentityRef TarnUserIdentityCache::userIdentityForPersonaUniqueString(
    const std::optional<std::string>& personaUniqueString, uint32_t UID, uint32_t GID) {
    if (UID < kFirstNonRoleUID) mobileIds(&UID, &GID);
    if (!personasAreSupported()) return userIdentityForPersonalPersonaWithUID(UID, GID);
    TarnUserIdentityRef found;
    {
        MutexLock guard(lock_);
        _lock_ensureValid();
        if (personaUniqueString) {
            auto it = lock_personaUniqueStringToUserIdentityMap_.find(*personaUniqueString);
            if (it == lock_personaUniqueStringToUserIdentityMap_.end()) return nullptr;
            found = it->second;
            PlatformLog(kCategory, PlatformLogType::Info, "Found %@ for %@", found,
                        *personaUniqueString);
        } else {
            found = lock_userIdentityForUnspecificPersona_;
        }
    }
    if (!found) return nullptr;
    if (found->posixUID() == UID && found->posixGID() == GID) return found;
    return _updateUserIdentity(found, UID, GID);
}

TarnUserIdentityRef TarnUserIdentityCache::userIdentityForCurrentUserWithPersonaUniqueString(
    const std::optional<std::string>& personaUniqueString) {
    if (!personasAreSupported()) return userIdentityForPersonalPersona();
    if (!personaUniqueString) return unspecificUserIdentity();
    MutexLock guard(lock_);
    _lock_ensureValid();
    auto it = lock_personaUniqueStringToUserIdentityMap_.find(*personaUniqueString);
    return it == lock_personaUniqueStringToUserIdentityMap_.end() ? nullptr : it->second;
}

TarnUserIdentityRef TarnUserIdentityCache::userIdentityWithPersonaID(uint32_t personaID) {
    MutexLock guard(lock_);
    _lock_ensureValid();
    auto it = lock_personaIDToUserIdentityMap_.find(personaID);
    return it == lock_personaIDToUserIdentityMap_.end() ? nullptr : it->second;
}

TarnUserIdentitySet TarnUserIdentityCache::userIdentitiesForBundleIdentifier(
    const std::string& bundleIdentifier) {
    MutexLock guard(lock_);
    _lock_ensureValid();
    auto it = lock_bundleToEnterpriseIdentitiesMap_.find(bundleIdentifier);
    if (it != lock_bundleToEnterpriseIdentitiesMap_.end()) return it->second;
    return TarnUserIdentitySet{lock_userIdentityForPersonalPersona_};
}

TarnUserIdentityCache::BundleOwners TarnUserIdentityCache::ownersOfBundleIdentifier(
    const std::string& bundleIdentifier, const TarnUserIdentityRef& first,
    const TarnUserIdentityRef& second) {
    const TarnRefEqual<TarnUserIdentity> same;
    MutexLock guard(lock_);
    _lock_ensureValid();
    auto it = lock_bundleToEnterpriseIdentitiesMap_.find(bundleIdentifier);
    if (it == lock_bundleToEnterpriseIdentitiesMap_.end()) {
        const TarnUserIdentityRef& personal = lock_userIdentityForPersonalPersona_;
        return {1, same(personal, first), same(personal, second)};
    }
    const TarnUserIdentitySet& owners = it->second;
    return {owners.size(), owners.count(first) > 0, owners.count(second) > 0};
}

bool TarnUserIdentityCache::isBundleIdentifier(const std::string& bundleIdentifier,
                                               const TarnUserIdentityRef& associatedWithUserIdentity) {
    if (!personasAreSupported()) return true;
    return ownersOfBundleIdentifier(bundleIdentifier, associatedWithUserIdentity, nullptr)
        .includesFirst;
}

void TarnUserIdentityCache::forEachAccessibleUserIdentitySynchronouslyExecuteBlock(
    const std::function<void(const TarnUserIdentityRef&)>& block) {
    if (!personasAreSupported()) {
        block(defaultUserIdentity());
        return;
    }
    TarnUserIdentitySet identities;
    std::string listText;
    {
        MutexLock guard(lock_);
        _lock_ensureValid();
        for (const auto& [_, identity] : lock_personaUniqueStringToUserIdentityMap_) {
            identities.insert(identity);
        }
        if (identities.empty()) listText = PersonaListDescription(lock_lastList_);
    }
    if (identities.empty()) {
        TarnLog(kLogError,
                "forEachAccessibleUserIdentitySynchronouslyExecuteBlock",
                "Expected to find at least one persona; self = %@, personaAttributeList = %@",
                *this, listText);
        block(defaultUserIdentity());
        return;
    }
    for (const auto& identity : identities) block(identity);
}

void TarnUserIdentityCache::flush() {
    MutexLock guard(lock_);
    _lock_flush();
}

void TarnUserIdentityCache::flushAndRepopulateWithUserIdentities(
    const std::vector<TarnUserIdentityRef>& identities) {
    TarnUserIdentityRef personal, unspecific;
    std::map<std::string, TarnUserIdentityRef> stringMap;
    std::map<uint32_t, TarnUserIdentityRef> idMap;
    for (const auto& identity : identities) {
        if (!identity) continue;
        if (identity->isNoSpecificPersona()) {
            unspecific = identity;
        } else if (!identity->isEnterprise()) {
            personal = identity;
        }
        if (identity->personaUniqueString()) stringMap[*identity->personaUniqueString()] = identity;
        idMap[identity->kernelPersonaID()] = identity;
    }
    if (!personal) personal = defaultUserIdentity();
    if (!unspecific) {
        unspecific = TarnUserIdentity::initWithUID(
            personal->posixUID(), personal->posixGID(), personal->homeDirectoryURL(),
            personal->personaUniqueString(), TarnPersonaTypeUnspecific, personal->kernelPersonaID());
    }
    MutexLock guard(lock_);
    lock_bundleToEnterpriseIdentitiesMap_.clear();
    lock_personaUniqueStringToUserIdentityMap_ = std::move(stringMap);
    lock_personaIDToUserIdentityMap_ = std::move(idMap);
    lock_userIdentityForPersonalPersona_ = std::move(personal);
    lock_userIdentityForUnspecificPersona_ = std::move(unspecific);
    cacheInvalid_ = false;
}

void TarnUserIdentityCache::addObserver(const std::weak_ptr<TarnUserIdentityCacheObserver>& observer) {
    MutexLock guard(observersLock_);
    observers_.push_back(observer);
}

void TarnUserIdentityCache::removeObserver(const TarnUserIdentityCacheObserver* observer) {
    MutexLock guard(observersLock_);
    std::erase_if(observers_, [observer](const std::weak_ptr<TarnUserIdentityCacheObserver>& w) {
        auto o = w.lock();
        return !o || o.get() == observer;
    });
}

void TarnUserIdentityCache::unregister() { registered_ = false; }

bool TarnUserIdentityCache::registered() const { return registered_; }

void TarnUserIdentityCache::personaListDidUpdate() {
    TarnLog(kLogNotice, "personaListDidUpdate",
            "Got persona list update from PR.");
    Transaction::begin();
    flushQueue_->async([this] {
        TarnLog(kLogNotice, "personaListDidUpdate",
                "Flushing cache from PR persona list update.");
        flush();
        Transaction::end();
    });
}

void TarnUserIdentityCache::TEST_drainFlushQueue() { flushQueue_->sync([] {}); }

// ---- Shared instance ----

TarnUserIdentitySharedCache& TarnUserIdentitySharedCache::sharedInstance() {
    // The instance for the root prefix in use, with that prefix: read without
    // the lock, since every request asks for it twice.
    struct Current {
        TarnUserIdentitySharedCache* cache;
        std::string root;
    };
    static std::atomic<const Current*> current{nullptr};
    if (const Current* c = current.load(std::memory_order_acquire); c && c->root == RootPrefix())
        return *c->cache;
    static std::mutex lock;
    // Never freed: references handed out under an earlier root stay valid, and
    // nothing is torn down at exit while other threads may still use it.
    static auto& made = *new std::vector<std::unique_ptr<TarnUserIdentitySharedCache>>();
    static auto& currents = *new std::vector<std::unique_ptr<Current>>();
    std::lock_guard<std::mutex> guard(lock);
    if (currents.empty() || currents.back()->root != RootPrefix()) {
        made.push_back(std::make_unique<TarnUserIdentitySharedCache>(PersonaRoster::sharedManager()));
        currents.push_back(std::make_unique<Current>(Current{made.back().get(), RootPrefix()}));
        current.store(currents.back().get(), std::memory_order_release);
    }
    return *made.back();
}

}  // namespace tarn
