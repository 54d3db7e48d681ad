#include "Daemon/TarnContainerCache.h"

#include <cstdlib>
#include <cstring>
#include <mutex>
#include <unordered_set>

#include "Daemon/TarnCodeSigningMapping.h"
#include "Daemon/TarnExceptionFence.h"
#include "Daemon/TarnFileManager.h"
#include "Daemon/TarnGlobalConfiguration.h"
#include "Daemon/TarnLog.h"
#include "Daemon/TarnTestLocks.h"
#include "Daemon/TarnWhitelist.h"
#include "Platform/ContainerLibrary.h"
#include "Platform/FileSystem.h"
#include "Platform/Notifications.h"
#include "Platform/PlatformLog.h"
#include "Platform/RootPrefix.h"
#include "Platform/SandboxUserState.h"

namespace tarn {

namespace {

// The cache's test gate (see TarnTestLocks.h).
constexpr uint64_t kCacheTestGate = 6;
// Identifiers from the sandbox state are compared over at most this many bytes.
constexpr size_t kSandboxIdentifierCompareLimit = 1024;

const char* transientMarker(bool transient) { return transient ? "(transient)" : ""; }

// The user a class's items are filed under: system containers belong to user 0.
uint32_t sandboxUserForClass(const TarnUserIdentityRef& userIdentity, TarnContainerClass c) {
    return TarnContainerClassIsSystem(c) ? 0 : userIdentity->posixUIDForContainerClass(c);
}

// PathJoin(container, the metadata file name) in a buffer of the calling
// thread: every lookup checks that file, and a lookup should not allocate.
// Valid until the thread's next call.
const FileURL& metadataFileURL(std::string_view container) {
    thread_local FileURL buffer;
    buffer.assign(container);
    while (buffer.size() > 1 && buffer.back() == '/') buffer.pop_back();
    if (buffer.empty() || buffer.back() != '/') buffer.push_back('/');
    buffer.append(kTarnMetadataFileName);
    return buffer;
}

// Whether a cached container's metadata file is gone, so that the entry is
// stale. Only a missing file (or a missing directory on its path) says so: a
// failure to look (EIO, say) keeps the entry, since dropping it would let
// the next creation build a second container for the identifier.
bool metadataFileIsGone(const FileURL& file) {
    const int err = FsLstat(file, nullptr);
    if (err == 0) return false;
    if (err == ENOENT || err == ENOTDIR) return true;
    TarnLog(kLogError, "itemExistsAtURL", "Failed to determine if %@ exists: %s", file,
            std::strerror(err));
    return false;
}

// The name the look-up's errors and lines carry: the work is done in a
// private helper, but the operation is the public one.
constexpr const char* kLookupOperation = "containerForContainerIdentity";

}  // namespace

TarnContainerCache& TarnContainerCache::sharedInstance() {
    static std::mutex lock;
    static std::string root;
    // Leaked on purpose: request threads may still use an instance at exit.
    static auto& made = *new std::vector<std::shared_ptr<TarnContainerCache>>();
    std::lock_guard<std::mutex> guard(lock);
    if (made.empty() || root != RootPrefix()) {
        made.push_back(initWithUserIdentityCache(TarnUserIdentitySharedCache::sharedInstance(),
                                                 TarnCodeSigningMapping::sharedInstance(),
                                                 SandboxUserState::sharedInstance()));
        root = RootPrefix();
    }
    return *made.back();
}

std::shared_ptr<TarnContainerCache> TarnContainerCache::initWithUserIdentityCache(
    TarnUserIdentityCache& userIdentityCache, TarnCodeSigningMapping* codeSigningMapping) {
    return initWithUserIdentityCache(userIdentityCache, codeSigningMapping,
                                     SandboxUserState::sharedInstance());
}

std::shared_ptr<TarnContainerCache> TarnContainerCache::initWithUserIdentityCache(
    TarnUserIdentityCache& userIdentityCache, TarnCodeSigningMapping* codeSigningMapping,
    SandboxUserState& sandboxUserState) {
    auto cache = std::make_shared<TarnContainerCache>(PrivateTag{}, userIdentityCache,
                                                      codeSigningMapping, sandboxUserState);
    userIdentityCache.addObserver(cache);
    return cache;
}

TarnContainerCache::TarnContainerCache(PrivateTag, TarnUserIdentityCache& userIdentityCache,
                                       TarnCodeSigningMapping* codeSigningMapping,
                                       SandboxUserState& sandboxUserState)
    : userIdentityCache_(userIdentityCache),
      codeSigningMapping_(codeSigningMapping),
      sandboxUserState_(sandboxUserState),
      invalidationQueue_(
          DispatchQueue::createSerial("com.ostrea.tarnkeeperd.TarnContainerCache.invalidation")) {}

TarnContainerCache::~TarnContainerCache() { userIdentityCache_.removeObserver(this); }

void TarnContainerCache::assertNotOnMappingQueue() const {
    if (codeSigningMapping_ && codeSigningMapping_->queue() &&
        codeSigningMapping_->queue()->isCurrent()) {
        PlatformLogWrite("cache", PlatformLogType::Fault,
                         "Container cache called on the code-signing mapping queue");
        std::abort();
    }
}

std::string TarnContainerCache::_cacheKeyForUserIdentity(const TarnUserIdentityRef& userIdentity,
                                                         TarnContainerClass containerClass) {
    const char* shortName = TarnContainerClassShortName(containerClass);
    std::string name = shortName ? shortName : "(null)";
    if (TarnUserIdentity::isUserIdentityRequiredForContainerClass(containerClass))
        return Format("[%@]-%@", userIdentity ? userIdentity->identifier() : "(null)", name);
    return name;
}

TarnContainerCache::CacheKeyParts TarnContainerCache::_cacheKeyPartsForUserIdentity(
    const TarnUserIdentityRef& userIdentity, TarnContainerClass containerClass) {
    const char* shortName = TarnContainerClassShortName(containerClass);
    CacheKeyParts parts;
    parts.shortName = shortName ? shortName : "(null)";
    parts.perUser = TarnUserIdentity::isUserIdentityRequiredForContainerClass(containerClass);
    if (parts.perUser)
        parts.userIdentifier = userIdentity ? std::string_view(userIdentity->identifier()) : "(null)";
    return parts;
}

namespace {

// FNV-1a, fed piece by piece so that the parts of a key hash like its text.
constexpr uint64_t kFnvOffset = 14695981039346656037ull;
constexpr uint64_t kFnvPrime = 1099511628211ull;
uint64_t fnv(uint64_t h, std::string_view bytes) {
    for (unsigned char c : bytes) h = (h ^ c) * kFnvPrime;
    return h;
}

}  // namespace

size_t TarnContainerCache::CacheKeyHash::operator()(std::string_view key) const {
    return static_cast<size_t>(fnv(kFnvOffset, key));
}

size_t TarnContainerCache::CacheKeyHash::operator()(const CacheKeyParts& key) const {
    if (!key.perUser) return static_cast<size_t>(fnv(kFnvOffset, key.shortName));
    uint64_t h = fnv(kFnvOffset, "[");
    h = fnv(h, key.userIdentifier);
    h = fnv(h, "]-");
    return static_cast<size_t>(fnv(h, key.shortName));
}

bool TarnContainerCache::CacheKeyEqual::operator()(const CacheKeyParts& a,
                                                   std::string_view b) const {
    if (!a.perUser) return b == a.shortName;
    const size_t user = a.userIdentifier.size();
    return b.size() == user + 3 + a.shortName.size() && b.front() == '[' &&
           b.substr(1, user) == a.userIdentifier && b.substr(1 + user, 2) == "]-" &&
           b.substr(3 + user) == a.shortName;
}

bool TarnContainerCache::containerURL(const FileURL& url,
                                      TarnContainerClass isValidForContainerClass) const {
    return containerName(PathLastComponentView(url), isValidForContainerClass);
}

bool TarnContainerCache::containerName(std::string_view name,
                                       TarnContainerClass isValidForContainerClass) {
    if (Uuid::parse(name)) return true;
    // Well-known containers live under their table's directory name.
    return TarnWhitelist::sharedWhitelist().isWellknownDirectoryName(name, isValidForContainerClass);
}

// ---- Building ----

TarnResult<TarnContainerClassCacheRef> TarnContainerCache::_lock_getCacheForUserIdentity(
    const TarnUserIdentityRef& userIdentity, TarnContainerClass contentClass, bool transient) {
    return _lock_getCacheForUserIdentity(userIdentity, contentClass, transient,
                                         /*populateSandboxCache=*/true, /*buildCache=*/true);
}

TarnResult<TarnContainerClassCacheRef> TarnContainerCache::_lock_getCacheForUserIdentity(
    const TarnUserIdentityRef& userIdentity, TarnContainerClass contentClass, bool transient,
    bool populateSandboxCache, bool buildCache) {
    auto& dictionaries = transient ? transientContainerCache_ : liveContainerCache_;
    if (auto it = dictionaries.find(_cacheKeyPartsForUserIdentity(userIdentity, contentClass));
        it != dictionaries.end())
        return it->second;
    if (!buildCache) return TarnContainerClassCacheRef();
    const std::string key = _cacheKeyForUserIdentity(userIdentity, contentClass);

    TarnLog(kLogNotice, __func__, "Rebuilding container class cache: %@%@", key,
            transientMarker(transient));
    SignpostInterval interval("cache", "RebuildingCache",
                              {{"class", std::to_string(contentClass)}});
    TarnTestLocks::sharedInstance().waitOnLock(kCacheTestGate);
    rebuildCount_.fetch_add(1);

    auto directory = TarnGlobalConfiguration::sharedInstance().containerDirectoryURLForUserIdentity(
        userIdentity, contentClass, transient);
    if (!directory) {
        return TARN_ERROR(TarnErrorCacheInvalidInput, nullptr, "Invalid Content Class: %ld",
                          static_cast<int64_t>(contentClass));
    }
    auto dictionary = std::make_shared<TarnContainerClassCache>();
    // One durable write of the sandbox state for the whole scan, not one per container.
    SandboxUserState::Batch batch(sandboxUserState_);
    auto& fileManager = TarnFileManager::defaultManager();
    FsFd classDirectory;
    auto take = [&](FileURL entry) {
        cacheLock_.assertHeld();  // called only from this function, lock held
        // Not a container of ours when unreadable: the error is of no use here.
        TarnResult<TarnMutableMetadataRef> read =
            classDirectory ? TarnMetadata::readAndValidateMetadataInClassDirectory(
                                 classDirectory, std::move(entry), userIdentity,
                                 /*checkClassPath=*/true, TarnMetadataUnreadable::kQuiet)
                           : TarnMetadata::readAndValidateMetadataAtUrl(
                                 entry, userIdentity,
                                 /*checkClassPath=*/true, TarnMetadataUnreadable::kQuiet);
        if (!read.ok()) return;
        TarnMetadataRef metadata = std::move(read).value();
        const std::string& identifier = metadata->identifier();
        if (populateSandboxCache && !transient &&
            _lock_shouldRegisterSandboxMappingWithUserIdentity(userIdentity, identifier,
                                                               contentClass) &&
            !_setSandboxContainerMapping(userIdentity, identifier, contentClass,
                                         metadata->url().c_str())) {
            TarnLog(kLogError, "_lock_getCacheForUserIdentity",
                    "Failed to set container mapping during create/lookup operation of %@, %llu",
                    identifier, contentClass);
        }
        (*dictionary)[identifier] = std::move(metadata);
    };
    // Each entry is read as it is listed, relative to the class directory held
    // open: the directory's own path is walked once, not once per container,
    // and no list of every entry is kept. Should it not open as a directory
    // here (a link, say), or the listing fail part way, the scan starts over
    // with full paths and reports what fails.
    if (fileManager.openDirectoryAtURL(*directory, &classDirectory) == 0) {
        dictionary->reserve(fileManager.subdirectoryCountHint(classDirectory));
        std::string prefix = PathJoin(*directory, "x");  // "<directory>/"
        prefix.pop_back();
        const int err =
            fileManager.forEachNameInDirectory(classDirectory, [&](std::string_view name) {
                if (!containerName(name, contentClass)) return;
                FileURL entry;
                entry.reserve(prefix.size() + name.size());
                take(std::move(entry.append(prefix).append(name)));
            });
        if (err != 0) {
            classDirectory = FsFd();
            dictionary->clear();
        }
    }
    if (!classDirectory) {
        std::vector<FileURL> listed =
            TARN_TRY(fileManager.urlsForItemsInDirectoryAtURL(*directory));
        for (FileURL& entry : listed)
            if (containerURL(entry, contentClass)) take(std::move(entry));
    }
    dictionaries[key] = dictionary;
    interval.end(
        {{"class", std::to_string(contentClass)}, {"count", std::to_string(dictionary->size())}});
    return dictionary;
}

void TarnContainerCache::_lock_forEachContainerInContainerCache(
    const TarnContainerClassCache& cache,
    const std::function<void(const TarnMetadataRef&)>& performBlock) {
    for (const auto& [identifier, metadata] : cache) performBlock(metadata);
}

// ---- The registration rule ----

bool TarnContainerCache::shouldRegisterSandboxMappingWithUserIdentity(
    const TarnUserIdentityRef& userIdentity, const std::string& identifier,
    TarnContainerClass containerClass) {
    assertNotOnMappingQueue();
    MutexLock lock(cacheLock_);
    return _lock_shouldRegisterSandboxMappingWithUserIdentity(userIdentity, identifier,
                                                              containerClass);
}

bool TarnContainerCache::_lock_shouldRegisterSandboxMappingWithUserIdentity(
    const TarnUserIdentityRef& userIdentity, const std::string& identifier,
    TarnContainerClass containerClass) {
    return _shouldRegister(userIdentity, identifier, containerClass);
}

bool TarnContainerCache::_shouldRegister(const TarnUserIdentityRef& userIdentity,
                                         const std::string& identifier,
                                         TarnContainerClass containerClass) {
    if (!userIdentity) return false;
    bool decision = false;
    bool isMulti = false;
    std::optional<std::string> parent;
    switch (containerClass) {
        case TarnContainerClassAppData:
        case TarnContainerClassPluginData:
        case TarnContainerClassVPNPluginData:
        case TarnContainerClassConduitServiceData:
        case TarnContainerClassDaemonData:
        case TarnContainerClassTempDir: {
            // A plug-in's data follows the personas of the application that
            // carries it. No copy of the identifier: a rebuild asks this of
            // every container.
            if ((containerClass == TarnContainerClassPluginData ||
                 containerClass == TarnContainerClassVPNPluginData) &&
                codeSigningMapping_) {
                std::string p = codeSigningMapping_->parentIdentifierForChildIdentifier(identifier);
                if (!p.empty()) parent = std::move(p);
            }
            // The personal persona matters only to a bundle of several
            // identities, which is rare: asked for then, and only then.
            const std::string& bundle = parent ? *parent : identifier;
            auto owners = userIdentityCache_.ownersOfBundleIdentifier(bundle, userIdentity, nullptr);
            TarnUserIdentityRef personal;
            if (owners.count >= 2 && (personal = userIdentityCache_.userIdentityForPersonalPersona()))
                owners = userIdentityCache_.ownersOfBundleIdentifier(bundle, userIdentity, personal);
            if (owners.count >= 2 && personal && owners.includesSecond) {
                isMulti = true;
                decision = !userIdentity->isEnterprise();
            } else {
                decision = owners.includesFirst;
            }
            break;
        }
        case TarnContainerClassAppGroup:
            decision = true;
            break;
        default:
            decision = !userIdentity->isEnterprise();
            break;
    }
    // Checked here: the identity's description is made before PlatformLog could look.
    if (PlatformLogVerbose())
        PlatformLog("sandbox", PlatformLogType::Info,
                    "Deciding to register userIdentity: %@, identifier: %@ (%@), containerClass: "
                    "%llu with sandbox: %d because isMulti: %d",
                    userIdentity->shortDescription(), identifier, parent, containerClass, decision,
                    isMulti);
    return decision;
}

// ---- Kernel sandbox mapping ----

bool TarnContainerCache::setSandboxContainerMappingForUserIdentity(
    const TarnUserIdentityRef& userIdentity, const std::string& identifier,
    TarnContainerClass containerClass, const std::optional<FileURL>& url) {
    return _setSandboxContainerMapping(userIdentity, identifier, containerClass,
                                       url ? url->c_str() : nullptr);
}

bool TarnContainerCache::_setSandboxContainerMapping(const TarnUserIdentityRef& userIdentity,
                                                     const std::string& identifier,
                                                     TarnContainerClass containerClass,
                                                     const char* url) {
    if (TarnContainerClassIsBundle(containerClass)) return true;
    if (!TarnContainerClassIsValid(containerClass) || !userIdentity) {
        PlatformLog("sandbox", PlatformLogType::Error,
                    "Unsupported class for setting sandbox container mapping: %llu",
                    containerClass);
        return false;
    }
    const uint32_t user = sandboxUserForClass(userIdentity, containerClass);
    const uint32_t persona = userIdentity->kernelPersonaID();
    const uint64_t itemType = TarnContainerClassSandboxItemType(containerClass);
    const char* path = url ? url : "(null)";

    // A push of what is recorded already (a rebuild after a restart) changes
    // nothing: skip the pair, but still log the push.
    if (!sandboxUserState_.userStateItemIsRecordedWithPersona(
            user, persona, itemType, identifier.c_str(), url)) {
        // Clearing first drops any earlier path of this identifier; one batch
        // makes the pair one durable change.
        SandboxUserState::Batch batch(sandboxUserState_);
        int result = sandboxUserState_.setUserStateItemWithPersona(user, persona, itemType,
                                                                   identifier.c_str(), nullptr);
        if (result != 0) {
            PlatformLog("sandbox", PlatformLogType::Error,
                        "Failed to remove mapping for user: %u, itemType: %llu, identifier: %s, "
                        "class: %llu, path: %s : %d",
                        user, itemType, identifier, containerClass, path, result);
            return false;
        }
        if (url) {
            result = sandboxUserState_.setUserStateItemWithPersona(
                user, persona, itemType, identifier.c_str(), url);
            // The pair is durable only once written: a failed write is a failed set.
            if (result == 0) result = batch.end();
            if (result != 0) {
                PlatformLog("sandbox", PlatformLogType::Error,
                            "Failed to set mapping for user: %u, itemType: %llu, identifier %s, "
                            "class: %llu, path: %s : %d",
                            user, itemType, identifier, containerClass, path, result);
                return false;
            }
        } else if ((result = batch.end()) != 0) {
            PlatformLog("sandbox", PlatformLogType::Error,
                        "Failed to remove mapping for user: %u, itemType: %llu, identifier: %s, "
                        "class: %llu, path: %s : %d",
                        user, itemType, identifier, containerClass, path, result);
            return false;
        }
    }
    PlatformLog(
        "sandbox", PlatformLogType::Default,
        "Pushed user: %u, itemType: %llu, identifier %s, class: %llu, persona id: %d, path: %s",
        user, itemType, identifier, containerClass, persona, path);
    return true;
}

TarnMetadataRef TarnContainerCache::_lock_metadataFromSandboxForContainerIdentity(
    const TarnContainerIdentityRef& identity) {
    const TarnContainerClass containerClass = identity->containerClass();
    if (!TarnContainerClassIsValid(containerClass) || TarnContainerClassIsBundle(containerClass))
        return nullptr;
    const TarnUserIdentityRef& userIdentity = identity->userIdentity();
    if (!userIdentity) return nullptr;
    const uint64_t wantedType = TarnContainerClassSandboxItemType(containerClass);
    const uint32_t user = sandboxUserForClass(userIdentity, containerClass);
    const std::string& wanted = identity->identifier();

    SignpostInterval interval("cache", "ReadFromSandbox");
    uint64_t count = 0;
    std::optional<std::string> foundPath;
    int result = sandboxUserState_.iterateUserStateItems(
        user, [&](uint64_t itemType, const SandboxUserStateItem* item) {
            ++count;
            if (!item) {
                PlatformLog(
                    "sandbox", PlatformLogType::Debug,
                    "Sandbox kernel: Got an item iteration with no item struct; itemType = %llu",
                    itemType);
                return;
            }
            if (itemType != wantedType) return;
            // Every item the state keeps has an identifier ("" is one).
            if (!item->path) {
                PlatformLog(
                    "sandbox", PlatformLogType::Debug,
                    "Sandbox kernel: Got an item with no identifier or path; itemType = %llu",
                    itemType);
                return;
            }
            if (containerClass == TarnContainerClassAppGroup &&
                item->personaID != userIdentity->kernelPersonaID())
                return;
            if (std::strncmp(item->identifier.c_str(), wanted.c_str(),
                             kSandboxIdentifierCompareLimit) == 0)
                foundPath = item->path;
        });
    auto endInterval = [&] { interval.end({{"count", "<private>"}, {"identifier", "<private>"}}); };
    if (result != 0) {
        PlatformLog("sandbox", PlatformLogType::Error,
                    "Failed to read back sandbox cache; result = %d", result);
        endInterval();
        return nullptr;
    }
    if (!foundPath) {
        endInterval();
        return nullptr;
    }
    TarnResult<TarnMutableMetadataRef> read = TarnMetadata::readAndValidateMetadataAtUrl(
        *foundPath, userIdentity, /*checkClassPath=*/true);
    TarnMetadataRef metadata = read.ok() ? std::move(read).value() : TarnMetadataRef();
    TarnMetadataRef answer;
    if (!metadata) {
        TarnLog(kLogError, __func__,
                "Could not validate container from Sandbox-provided path [%@]; error = %@",
                *foundPath, read.error());
    } else if (metadata->containerClass() != containerClass || metadata->identifier() != wanted) {
        TarnLog(
            kLogError, __func__,
            "Attempted to fetch container from Sandbox-provided path [%@] that was not what was "
            "expected; expected class: %llu, expected identifier: [%@], actual class: %llu, actual "
            "identifier: [%@]",
            *foundPath, containerClass, wanted, metadata->containerClass(), metadata->identifier());
    } else {
        TarnLog(kLogNotice, __func__, "Using container from sandbox kernel cache: %@", metadata);
        kernelHitCount_.fetch_add(1);
        answer = metadata;
    }
    endInterval();
    return answer;
}

// ---- Lookups ----

TarnResult<TarnMetadataRef> TarnContainerCache::containerForContainerIdentity(
    const TarnContainerIdentityRef& identity, bool transient, bool updateSandbox) {
    return containerForContainerIdentity(identity, transient, updateSandbox,
                                         /*allowKernelLookup=*/true);
}

TarnResult<TarnMetadataRef> TarnContainerCache::containerForContainerIdentity(
    const TarnContainerIdentityRef& identity, bool transient, bool updateSandbox,
    bool allowKernelLookup) {
    assertNotOnMappingQueue();
    // A boundary: its callers read an exception as TarnErrorException of the look-up.
    return TarnFenceExceptions(kLookupOperation, [&] {
        return _containerForContainerIdentity(identity, transient, updateSandbox,
                                              allowKernelLookup);
    });
}

TarnResult<TarnMetadataRef> TarnContainerCache::_containerForContainerIdentity(
    const TarnContainerIdentityRef& identity, bool transient, bool updateSandbox,
    bool allowKernelLookup) {
    if (!identity)
        return TARN_ERROR_IN(kLookupOperation, TarnErrorCacheInvalidInput, nullptr,
                             "Cache: nil identity");
    const TarnUserIdentityRef& userIdentity = identity->userIdentity();
    const TarnContainerClass containerClass = identity->containerClass();
    const std::string& identifier = identity->identifier();
    // Only errors and debug lines show the key: a hit builds no text.
    auto key = [&] { return _cacheKeyForUserIdentity(userIdentity, containerClass); };
    const char* marker = transientMarker(transient);

    TarnMetadataRef metadata;
    {
        MutexLock lock(cacheLock_);
        TarnContainerClassCacheRef dictionary;
        bool fromKernel = false;
        if (allowKernelLookup) {
            // Without building, a look-up of the dictionary cannot fail.
            TarnResult<TarnContainerClassCacheRef> built = _lock_getCacheForUserIdentity(
                userIdentity, containerClass, transient, updateSandbox, /*buildCache=*/false);
            if (built.ok()) dictionary = std::move(built).value();
            if (!dictionary && !transient) {
                metadata = _lock_metadataFromSandboxForContainerIdentity(identity);
                fromKernel = metadata != nullptr;
            }
        }
        if (!fromKernel) {
            if (!dictionary) {
                TarnResult<TarnContainerClassCacheRef> built = _lock_getCacheForUserIdentity(
                    userIdentity, containerClass, transient, updateSandbox, /*buildCache=*/true);
                if (!built.ok()) {
                    const char* relative = TarnContainerClassRelativeDirectory(containerClass);
                    return TARN_ERROR_IN(kLookupOperation, TarnErrorCacheRebuildFailed,
                                         built.error(), "Cache: [%@]-%@%@: Failed to rebuild",
                                         userIdentity ? userIdentity->identifier() : "(null)",
                                         relative ? relative : "(null)", marker);
                }
                dictionary = std::move(built).value();
            }
            auto it = dictionary->find(identifier);
            if (it == dictionary->end()) {
                return TARN_ERROR_IN(kLookupOperation, TarnErrorNotFound, nullptr,
                                     "Cache: %@%@: Container Not Found with ID: %@", key(), marker,
                                     identifier);
            }
            metadata = it->second;
        }
    }

    if (metadata->url().empty() || metadata->url()[0] != '/') {
        return TARN_ERROR_IN(kLookupOperation, TarnErrorCacheInvalidInput, nullptr,
                             "Cache: %@%@: Invalid URL path string: %@", key(), marker,
                             metadata->url());
    }
    if (metadataFileIsGone(metadataFileURL(metadata->url()))) {
        const FileURL metadataFile = PathJoin(metadata->url(), kTarnMetadataFileName);
        TarnErrorRef inconsistent =
            TARN_ERROR_IN(kLookupOperation, TarnErrorCacheInconsistent, nullptr,
                          "Cache: %@%@: INCONSISTENT-No Metadata at: %@ for id: %@, class: %llu",
                          key(), marker, metadataFile, identifier, containerClass);
        if (TarnStatus removed =
                removeContainerForUserIdentity(userIdentity, containerClass, identifier, transient);
            !removed.ok()) {
            TarnLog(kLogError, kLookupOperation,
                    "Failed to remove from cache user: %@, id: %@, class: %llu, transient: %d : %@",
                    userIdentity, identifier, containerClass, transient, removed.error());
        }
        return inconsistent;
    }
    if (TarnLogShouldWrite(kLogDebug))
        TarnLog(kLogDebug, kLookupOperation, "Cache: %@%@: Found Identifier: %@", key(), marker,
                identifier);
    return metadata;
}

TarnMetadataRef TarnContainerCache::containerForContainerIdentity(
    const TarnConcreteContainerIdentityRef& identity) {
    if (!identity) return nullptr;
    TarnContainerIdentityRef base = identity->baseIdentity();
    for (bool transient : {false, true}) {
        // A miss in one dictionary is not the caller's concern.
        TarnResult<TarnMetadataRef> found =
            containerForContainerIdentity(base, transient, /*updateSandbox=*/true);
        if (found.ok() && (*found)->uuid() == identity->uuid()) {
            if ((*found)->transient() == transient) return std::move(found).value();
            TarnMutableMetadataRef marked = (*found)->copy();
            marked->setTransient(transient);
            return marked;
        }
    }
    return nullptr;
}

TarnResult<std::vector<TarnMetadataRef>> TarnContainerCache::allContainersForUserIdentity(
    const TarnUserIdentityRef& userIdentity, TarnContainerClass contentClass, bool transient) {
    return allContainersForUserIdentity(userIdentity, contentClass, transient,
                                        /*populateSandboxCache=*/true);
}

TarnResult<std::vector<TarnMetadataRef>> TarnContainerCache::allContainersForUserIdentity(
    const TarnUserIdentityRef& userIdentity, TarnContainerClass contentClass, bool transient,
    bool populateSandboxCache) {
    assertNotOnMappingQueue();
    if (!TarnContainerClassIsValid(contentClass)) {
        return TARN_ERROR(TarnErrorCacheInvalidInput, nullptr, "Invalid Content Class: %ld",
                          static_cast<int64_t>(contentClass));
    }
    const char* marker = transientMarker(transient);
    const char* const operation = __func__;  // inside the fenced body __func__ is the lambda's
    // A boundary, as the look-up is: an exception while the dictionaries are
    // read or built is TarnErrorException of this operation.
    TarnResult<std::vector<TarnMetadataRef>> gathered =
        TarnFenceExceptions(operation, [&]() -> TarnResult<std::vector<TarnMetadataRef>> {
            std::vector<TarnMetadataRef> all;
            MutexLock lock(cacheLock_);
            std::vector<TarnUserIdentityRef> identities;
            if (userIdentity && userIdentity->isNoSpecificPersona()) {
                userIdentityCache_.forEachAccessibleUserIdentitySynchronouslyExecuteBlock(
                    [&](const TarnUserIdentityRef& u) { identities.push_back(u); });
            } else {
                identities.push_back(userIdentity);
            }
            std::unordered_set<const TarnContainerClassCache*> seen;
            for (const auto& identity : identities) {
                TarnResult<TarnContainerClassCacheRef> dictionary = _lock_getCacheForUserIdentity(
                    identity, contentClass, transient, populateSandboxCache, /*buildCache=*/true);
                if (!dictionary.ok()) {
                    const char* relative = TarnContainerClassRelativeDirectory(contentClass);
                    return TARN_ERROR_IN(operation, TarnErrorCacheRebuildFailed, dictionary.error(),
                                         "Cache: [%@]-%@%@: Failed to rebuild",
                                         identity ? identity->identifier() : "(null)", relative,
                                         marker);
                }
                // Global classes answer one dictionary for every identity.
                if (!seen.insert(dictionary->get()).second) continue;
                _lock_forEachContainerInContainerCache(
                    **dictionary, [&](const TarnMetadataRef& m) { all.push_back(m); });
            }
            return all;
        });
    if (!gathered.ok()) return gathered;

    std::vector<TarnMetadataRef> answer;
    answer.reserve(gathered->size());
    for (const auto& metadata : *gathered) {
        const std::string key = _cacheKeyForUserIdentity(metadata->userIdentity(), contentClass);
        if (metadata->url().empty()) {
            TarnLog(kLogError, __func__, "Cache: %@%@: nil URL from %@", key, marker, metadata);
            continue;
        }
        const FileURL metadataFile = PathJoin(metadata->url(), kTarnMetadataFileName);
        if (metadataFileIsGone(metadataFile)) {
            TarnLog(kLogError, __func__,
                    "Cache: %@%@: INCONSISTENT-No Metadata at: %@ for id: %@, class: %llu", key,
                    marker, metadataFile, metadata->identifier(), contentClass);
            if (TarnStatus removed = removeContainerForUserIdentity(
                    metadata->userIdentity(), contentClass, metadata->identifier(), transient);
                !removed.ok()) {
                TarnLog(
                    kLogError, __func__,
                    "Failed to remove from cache user: %@, id: %@, class: %llu, transient: %d : %@",
                    metadata->userIdentity(), metadata->identifier(), contentClass, transient,
                    removed.error());
            }
            continue;
        }
        TarnLog(kLogDebug, __func__, "Cache: %@%@: ALL Found Identifier: %@", key, marker,
                metadata->identifier());
        answer.push_back(metadata);
    }
    return answer;
}

// ---- Changes ----

TarnStatus TarnContainerCache::addContainerMetadata(const TarnMetadataRef& metadata,
                                                    const FileURL& url, bool transient,
                                                    bool updateSandbox) {
    assertNotOnMappingQueue();
    if (!metadata || !TarnContainerClassIsValid(metadata->containerClass())) {
        return TARN_ERROR(TarnErrorCacheInvalidInput, nullptr,
                          "Invalid Metadata Content Class: %lld",
                          metadata ? static_cast<int64_t>(metadata->containerClass()) : int64_t{0});
    }
    // The identifier is always a string here, and an empty one is valid.
    if (url.empty() || url[0] != '/')
        return TARN_ERROR(TarnErrorCacheInvalidInput, nullptr, "Invalid input: URL: %@", url);
    const TarnUserIdentityRef& userIdentity = metadata->userIdentity();
    const TarnContainerClass containerClass = metadata->containerClass();
    const std::string& identifier = metadata->identifier();
    bool shouldRegister = false;
    {
        MutexLock lock(cacheLock_);
        TarnResult<TarnContainerClassCacheRef> dictionary = _lock_getCacheForUserIdentity(
            userIdentity, containerClass, transient, updateSandbox, /*buildCache=*/updateSandbox);
        if (!dictionary.ok() || !*dictionary) {
            // Without a dictionary the container is on disk and the next build reads it.
            if (!updateSandbox) return {};
            return TARN_ERROR(TarnErrorCacheRebuildFailed, dictionary.error(),
                              "Cache: [%@]-%@%@: Failed to rebuild",
                              userIdentity ? userIdentity->identifier() : "(null)",
                              TarnContainerClassRelativeDirectory(containerClass),
                              transientMarker(transient));
        }
        TarnMutableMetadataRef stored = metadata->copy();
        stored->setUrl(url);
        (**dictionary)[identifier] = stored;
        if (updateSandbox)
            shouldRegister = _lock_shouldRegisterSandboxMappingWithUserIdentity(
                userIdentity, identifier, containerClass);
    }
    _finishChange(__func__, userIdentity, identifier, containerClass, transient,
                  /*pushMapping=*/updateSandbox && shouldRegister, url);
    return {};
}

TarnStatus TarnContainerCache::removeContainerForUserIdentity(
    const TarnUserIdentityRef& userIdentity, TarnContainerClass contentClass,
    const std::string& identifier, bool transient) {
    assertNotOnMappingQueue();
    if (!TarnContainerClassIsValid(contentClass)) {
        return TARN_ERROR(TarnErrorCacheInvalidInput, nullptr, "Invalid Content Class: %ld",
                          static_cast<int64_t>(contentClass));
    }
    // The identifier is always a string here, and an empty one is valid.
    bool shouldRegister = false;
    {
        MutexLock lock(cacheLock_);
        TarnResult<TarnContainerClassCacheRef> dictionary =
            _lock_getCacheForUserIdentity(userIdentity, contentClass, transient);
        if (!dictionary.ok()) {
            return TARN_ERROR(TarnErrorCacheRebuildFailed, dictionary.error(),
                              "Cache: [%@]-%@%@: Failed to rebuild",
                              userIdentity ? userIdentity->identifier() : "(null)",
                              TarnContainerClassRelativeDirectory(contentClass),
                              transientMarker(transient));
        }
        (*dictionary)->erase(identifier);
        shouldRegister = _lock_shouldRegisterSandboxMappingWithUserIdentity(
            userIdentity, identifier, contentClass);
    }
    _finishChange(__func__, userIdentity, identifier, contentClass, transient,
                  /*pushMapping=*/shouldRegister, /*url=*/std::nullopt);
    return {};
}

void TarnContainerCache::_finishChange(const char* function,
                                       const TarnUserIdentityRef& userIdentity,
                                       const std::string& identifier,
                                       TarnContainerClass containerClass, bool transient,
                                       bool pushMapping, const std::optional<FileURL>& url) {
    // Only permanent containers are mapped.
    if (pushMapping && !transient &&
        !setSandboxContainerMappingForUserIdentity(userIdentity, identifier, containerClass, url)) {
        TarnLog(kLogError, function,
                url ? "Failed to set container mapping of %@, %llu"
                    : "Failed to remove container mapping of %@, %llu",
                identifier, containerClass);
    }
    TarnLog(kLogDebug, function,
            url ? "Cache: %@%@: Added Identifier: %@" : "Cache: %@%@: Removed Identifier: %@",
            _cacheKeyForUserIdentity(userIdentity, containerClass), transientMarker(transient),
            identifier);
}

// ---- Invalidation ----

void TarnContainerCache::invalidateUserIdentity(const TarnUserIdentityRef& userIdentity) {
    assertNotOnMappingQueue();
    {
        MutexLock lock(cacheLock_);
        _lock_invalidateUserIdentity(userIdentity);
    }
    if (uint32_t status = NotifyPost(CONTAINER_NOTIFY_USER_INVALIDATED); status != 0)
        TarnLog(kLogError, __func__, "Could not post user-invalidated notification: %u", status);
}

void TarnContainerCache::_lock_invalidateUserIdentity(const TarnUserIdentityRef& userIdentity) {
    SandboxUserState::Batch batch(sandboxUserState_);
    for (TarnContainerClass c = 1; c <= 13; ++c) {
        const std::string key = _cacheKeyForUserIdentity(userIdentity, c);
        if (auto it = liveContainerCache_.find(key); it != liveContainerCache_.end()) {
            _lock_forEachContainerInContainerCache(*it->second, [&](const TarnMetadataRef& m) {
                if (!setSandboxContainerMappingForUserIdentity(userIdentity, m->identifier(), c,
                                                               std::nullopt))
                    TarnLog(kLogError, "invalidateUserIdentity",
                            "Failed to remove container mapping of [%@], class: %llu",
                            m->identifier(), c);
            });
        }
        liveContainerCache_.erase(key);
        transientContainerCache_.erase(key);
    }
}

void TarnContainerCache::userIdentityCache(TarnUserIdentityCache& cache,
                                           const TarnUserIdentityRef& didInvalidateUserIdentity) {
    std::weak_ptr<TarnContainerCache> weak = weak_from_this();
    TarnUserIdentityRef identity = didInvalidateUserIdentity;
    transactionAsync(invalidationQueue_, [weak, identity] {
        if (auto self = weak.lock()) self->invalidateUserIdentity(identity);
    });
}

void TarnContainerCache::TEST_drainInvalidations() {
    invalidationQueue_->sync([] {});
}

}  // namespace tarn
