#include "Daemon/TarnClientConnection.h"

#include <algorithm>
#include <mutex>

#include "Daemon/TarnCodeSigningMapping.h"
#include "Daemon/TarnCommandStageForDelete.h"
#include "Daemon/TarnContainerCache.h"
#include "Daemon/TarnDaemon.h"
#include "Daemon/TarnDataProtectionManager.h"
#include "Daemon/TarnError.h"
#include "Daemon/TarnExceptionFence.h"
#include "Daemon/TarnFileManager.h"
#include "Daemon/TarnGlobalConfiguration.h"
#include "Daemon/TarnLocks.h"
#include "Daemon/TarnLog.h"
#include "Daemon/TarnUserIdentityCache.h"
#include "Daemon/TarnWhitelist.h"
#include "Platform/ContainerLibrary.h"
#include "Platform/HostConfiguration.h"
#include "Platform/PlatformLog.h"
#include "Platform/RootPrefix.h"

namespace tarn {

TarnClientConnection::TarnClientConnection(TarnClientIdentityRef clientIdentity, bool entitled,
                                           bool allowOtherIdLookup, bool unrestricted,
                                           std::optional<PlistValue> lookup,
                                           std::optional<PlistValue> entitledWipeIdentifiers,
                                           std::shared_ptr<TarnCommandQueue> commandQueue)
    : clientIdentity_(std::move(clientIdentity)),
      entitled_(entitled),
      allowOtherIdLookup_(allowOtherIdLookup),
      unrestricted_(unrestricted),
      lookup_(std::move(lookup)),
      entitledWipeIdentifiers_(std::move(entitledWipeIdentifiers)),
      commandQueue_(std::move(commandQueue)),
      backgroundQueue_(_sharedBackgroundQueue()),
      userIdentityCache_(TarnUserIdentitySharedCache::sharedInstance()) {}

TarnClientConnection::TarnClientConnection()
    : TarnClientConnection(TarnClientIdentity::anonymousPrivilegedClientIdentity(),
                           /*entitled=*/true, /*allowOtherIdLookup=*/false, /*unrestricted=*/true,
                           /*lookup=*/std::nullopt, /*entitledWipeIdentifiers=*/std::nullopt,
                           std::make_shared<TarnCommandQueue>()) {}

std::shared_ptr<TarnClientConnection> TarnClientConnection::initWithClientIdentity(
    TarnClientIdentityRef clientIdentity, bool entitled, bool allowOtherIdLookup, bool unrestricted,
    std::optional<PlistValue> lookup, std::optional<PlistValue> entitledWipeIdentifiers,
    std::shared_ptr<TarnCommandQueue> commandQueue) {
    return std::make_shared<TarnClientConnection>(
        std::move(clientIdentity), entitled, allowOtherIdLookup, unrestricted, std::move(lookup),
        std::move(entitledWipeIdentifiers), std::move(commandQueue));
}

std::shared_ptr<TarnClientConnection>
TarnClientConnection::privilegedClientConnectionWithUserIdentity(
    std::shared_ptr<const TarnUserIdentity> userIdentity, bool kernel) {
    return std::make_shared<TarnClientConnection>(
        TarnClientIdentity::privilegedClientIdentityWithUserIdentity(std::move(userIdentity),
                                                                     kernel),
        /*entitled=*/true, /*allowOtherIdLookup=*/true, /*unrestricted=*/true,
        /*lookup=*/std::nullopt, /*entitledWipeIdentifiers=*/std::nullopt,
        std::make_shared<TarnCommandQueue>());
}

// ---- Lookup rules ----

namespace {

// Keys of the lookup entitlement, by class number.
const char* lookupKeyForContainerClass(TarnContainerClass containerClass) {
    static const char* const kKeys[] = {
        nullptr,  "app",     "appData",    "plugin",     "pluginData",
        "vpn",    "vpnData", "appGroup",   "framework",  "conduitService",
        "daemon", "tempDir", "systemData", "systemGroup"};
    return containerClass < std::size(kKeys) ? kKeys[containerClass] : nullptr;
}

}  // namespace

std::set<std::string> TarnClientConnection::_setOfStringsFromArray(const PlistArray& array) {
    std::set<std::string> strings;
    for (const PlistValue& v : array)
        if (const std::string* s = v.asString()) strings.insert(*s);
    return strings;
}

const PlistValue* TarnClientConnection::lookupValueForKey(const std::string& key) const {
    return lookup_ ? lookup_->find(key) : nullptr;
}

TarnLookupSet TarnClientConnection::_lookupForContainerClass(TarnContainerClass containerClass) {
    const char* key = lookupKeyForContainerClass(containerClass);
    if (!key) return nullptr;
    {
        MutexLock lock(lock_);
        if (!lookup_) return nullptr;
        sanitizedLookupCreated_ = true;
    }
    MutexLock lock(sanitizedLookupLock_);
    auto it = sanitizedLookup_.find(key);
    if (it != sanitizedLookup_.end()) return it->second;
    const PlistValue* value = lookupValueForKey(key);
    const PlistArray* array = value ? value->asArray() : nullptr;
    auto granted = std::make_shared<const std::set<std::string>>(
        array ? _setOfStringsFromArray(*array) : std::set<std::string>());
    sanitizedLookup_.emplace(key, granted);
    return granted;
}

bool TarnClientConnection::isEntitledForLookupWithClass(TarnContainerClass containerClass,
                                                        const std::string& identifier) {
    TarnLookupSet granted = _lookupForContainerClass(containerClass);
    return granted && granted->count(identifier) > 0;
}

bool TarnClientConnection::_lookupRuleCommon(TarnContainerClass containerClass,
                                             const std::string& identifier, bool withGroupRule) {
    const std::string bundleIdentifier = clientBundleIdentifier();
    // A caller without a bundle identifier has no container of its own, not
    // one named "".
    if (!bundleIdentifier.empty() && identifier == bundleIdentifier) return true;
    if (allowOtherIdLookup_) return true;
    if (withGroupRule && TarnContainerClassIsGroup(containerClass) && allowGroupIdLookup_)
        return true;
    if (unrestricted_) return true;
    if (isEntitledForLookupWithClass(containerClass, identifier)) return true;
    return TarnWhitelist::sharedWhitelist().isLookupWhitelistedFromCodeSignIdentifier(
        bundleIdentifier, containerClass, identifier);
}

TarnStatus TarnClientConnection::_passesLookupRuleForContainerClass(
    TarnContainerClass containerClass, const std::string& identifier) {
    if (_lookupRuleCommon(containerClass, identifier, /*withGroupRule=*/true)) return {};
    return TARN_ERROR(TarnErrorNotEntitled, nullptr,
                      "%@ not entitled to retrieve container class %ld with identifier %@",
                      clientBundleIdentifier(), static_cast<int64_t>(containerClass), identifier);
}

TarnStatus TarnClientConnection::_passesSystemDataGateForContainerClass(
    TarnContainerClass containerClass, const std::string& identifier) {
    if (allowOtherIdLookup_ || containerClass != TarnContainerClassSystemData || unrestricted_ ||
        isEntitledForLookupWithClass(TarnContainerClassSystemData, identifier))
        return {};
    const std::string bundleIdentifier = clientBundleIdentifier();
    if (TarnWhitelist::sharedWhitelist().isLookupWhitelistedFromCodeSignIdentifier(
            bundleIdentifier, TarnContainerClassSystemData, identifier))
        return {};
    // Only a client whose signature asks for a system container gets its own.
    TarnCodeSigningMapping* mapping = TarnCodeSigningMapping::sharedInstance();
    if (mapping && identifier == bundleIdentifier &&
        mapping->identifierHasSystemContainer(identifier))
        return {};
    return TARN_ERROR(TarnErrorNotEntitled, nullptr,
                      "%@ not entitled for system container with identifier %@", bundleIdentifier,
                      identifier);
}

TarnStatus TarnClientConnection::_passesGroupOwnerRuleForContainerClass(
    TarnContainerClass groupContainerClass, const std::string& ownerIdentifier) {
    if (_lookupRuleCommon(groupContainerClass, ownerIdentifier, /*withGroupRule=*/false)) return {};
    return TARN_ERROR(TarnErrorNotEntitled, nullptr,
                      "%@ not entitled to retrieve group container class %ld with identifier %@",
                      clientBundleIdentifier(), static_cast<int64_t>(groupContainerClass),
                      ownerIdentifier);
}

// ---- Death row ----

TarnStatus TarnClientConnection::_moveItemAtURLToDeathRow(const FileURL& url, bool isDir,
                                                          bool startDeletionThread) {
    auto& fm = TarnFileManager::defaultManager();
    const bool moved = TARN_TRY(_moveIntoDeathRowSlot(
        url,
        [&](const FileURL& slot) {
            return fm.moveItemAtURL(url, PathJoin(slot, PathLastComponent(url)));
        },
        [&] { return fm.itemDoesNotExistAtURL(url); }));
    // Something already gone leaves nothing for a pass to do.
    if (moved && startDeletionThread) deleteContainersOnDeathRowWithCompletion(nullptr);
    return {};
}

TarnResult<bool> TarnClientConnection::_moveIntoDeathRowSlot(
    const FileURL& url, const std::function<TarnStatus(const FileURL&)>& moveInto,
    const std::function<bool()>& gone) {
    auto& fm = TarnFileManager::defaultManager();
    // A deletion pass running meanwhile may remove the still empty slot before
    // the rename lands; the item is then still here and needs a new slot.
    constexpr int kAttempts = 3;
    for (int attempt = 1;; ++attempt) {
        // A directory of its own keeps two items of the same name from colliding.
        auto unique = fm.createTemporaryDirectoryInDirectoryURL(
            TarnGlobalConfiguration::sharedInstance().deathrowDirectory());
        if (!unique.ok()) {
            return TARN_ERROR(TarnErrorDeathRowMoveFailed, unique.error(),
                              "Failed to create unique directory at: %@", url);
        }
        const TarnStatus moved = moveInto(*unique);
        if (moved.ok()) return true;
        if (moved.error() && moved.error()->posixCode() == ENOENT) {
            // Already gone; the empty slot goes with the next pass.
            if (gone()) return false;
            if (attempt < kAttempts) continue;
        }
        return TARN_ERROR(TarnErrorDeathRowMoveFailed, moved.error(),
                          "Failed to move item at: %@ to: %@", url,
                          PathJoin(*unique, PathLastComponent(url)));
    }
}

void TarnClientConnection::deleteContainersOnDeathRowWithCompletion(
    std::function<void(uint64_t)> completion) {
    // The pass owns nothing of the connection, which may be gone when it runs.
    transactionAsync(TarnDeathRowQueue(), [completion = std::move(completion)] {
        static constexpr const char* kOperation = "deleteContainersOnDeathRowWithCompletion";
        // A queue item: nothing it throws may end the daemon.
        const TarnStatus pass = TarnFenceExceptions(kOperation, [&]() -> TarnStatus {
            const FileURL deathRow = TarnGlobalConfiguration::sharedInstance().deathrowDirectory();
            auto items = TarnFileManager::defaultManager().urlsForItemsInDirectoryAtURL(deathRow);
            if (!items.ok()) {
                const TarnErrorRef listError = items.error();
                if (listError && listError->posixCode() == ENOENT) return {};
                return TARN_ERROR_IN(kOperation, TarnErrorDeleteFailed, listError,
                                     "Failed to get items for deletion: %@ : %@", deathRow,
                                     listError);
            }
            // Every item is tried; the pass answers its last failure.
            TarnStatus last;
            for (const FileURL& item : *items) {
                if (const TarnStatus removed = _removeItemOrMoveToTempAtURL(item); !removed.ok())
                    last = TARN_ERROR_IN(kOperation, TarnErrorDestroyFailed, removed.error(),
                                         "Failed to destroy item at: %@", item);
            }
            return last;
        });
        if (completion) completion(pass.code(TarnErrorDeleteFailed));
    });
}

TarnStatus TarnClientConnection::_removeItemOrMoveToTempAtURL(const FileURL& url) {
    auto& fm = TarnFileManager::defaultManager();
    const TarnStatus removed = fm.removeItemAtURL(url);
    if (removed.ok() || (removed.error() && removed.error()->posixCode() == ENOENT)) return {};
    TarnLog(kLogDebug, __func__, "Couldn't remove, so moving item to /tmp: %@ : %@", url,
            removed.error());

    const FileURL tmp = RootPath("/tmp");
    // The move reports any failure.
    if (fm.itemDoesNotExistAtURL(tmp))
        (void)fm.createDirectoryAtURL(tmp, /*withIntermediateDirectories=*/true, 01777);
    FileURL destination = PathJoin(tmp, PathLastComponent(url));
    // Never replace something already in /tmp: a taken name goes into a fresh directory.
    if (!fm.itemDoesNotExistAtURL(destination)) {
        auto unique = fm.createTemporaryDirectoryInDirectoryURL(tmp, "tarnkeeperd.");
        if (unique.ok()) destination = PathJoin(*unique, PathLastComponent(url));
    }
    // A rename only: where /tmp is another volume a copy would fail to remove
    // its source for the same reason, and every pass would leave one more copy.
    if (const TarnStatus renamed = fm.renameItemAtURL(url, destination); !renamed.ok()) {
        const TarnErrorRef& moveError = renamed.error();
        // Gone meanwhile is done; a missing /tmp is not.
        if (moveError && moveError->posixCode() == ENOENT && fm.itemDoesNotExistAtURL(url))
            return {};
        return TARN_ERROR(TarnErrorMoveFailed, moveError, "Failed to move dir: %@ to: %@", url,
                          "/tmp");
    }
    return {};
}

TarnClientConnection& TarnClientConnection::sharedClientConnection() {
    static auto* shared = new TarnClientConnection();
    return *shared;
}

std::string TarnClientConnection::clientBundleIdentifier() const {
    return clientIdentity_ ? clientIdentity_->bundleIdentifier() : std::string();
}

// ---- Create or look up: directories ----

namespace {

// Owner and mode of a new container's subdirectories. System containers'
// contents belong to the system user and are reached through the ACL alone.
uint32_t subdirectoryOwnerForMetadata(const TarnMetadata& metadata) {
    const TarnContainerClass c = metadata.containerClass();
    if (TarnContainerClassIsBundle(c)) return CONTAINER_INSTALLATION_UID;
    if (TarnContainerClassIsSystem(c)) return CONTAINER_SYSTEM_UID;
    return metadata.userIdentity() ? metadata.userIdentity()->posixUIDForContainerClass(c) : 0;
}

mode_t subdirectoryModeForClass(TarnContainerClass c) {
    return TarnContainerClassIsSystem(c) ? 0 : 0755;
}

}  // namespace

TarnStatus TarnClientConnection::_createTopLevelContainerDirectory(
    const FileURL& url, TarnContainerClass containerClass, uint32_t owner) {
    // System containers keep the daemon as owner (0 leaves it alone); bundles
    // always go to the installer.
    uint32_t topLevelOwner = owner;
    if (TarnContainerClassIsBundle(containerClass)) topLevelOwner = CONTAINER_INSTALLATION_UID;
    if (TarnContainerClassIsSystem(containerClass)) topLevelOwner = 0;
    return TarnFileManager::defaultManager().createDirectoryAtURL(
        url, /*withIntermediateDirectories=*/true, 0755, topLevelOwner,
        kTarnDataProtectionClassNone);
}

TarnStatus TarnClientConnection::_createSubDirectories(const FileURL& url,
                                                       const TarnMetadataRef& containerMetadata) {
    const TarnContainerClass containerClass = containerMetadata->containerClass();
    std::vector<std::string> names;
    uint64_t libraryCode = kContainerLibraryErrorNoSubdirectories;
    if (!ContainerLibrarySubdirectoriesForClass(containerClass, &names, &libraryCode)) {
        return TARN_ERROR(libraryCode, nullptr, "Failed to get subdirectory names for %llu : %llu",
                          containerClass, libraryCode);
    }

    const int32_t protectionClass = _dataProtectionClassForContainerMetadata(containerMetadata);
    TarnLog(kLogDebug, __func__, "Creating subdirectories for [%llu:%@] at [%@]", containerClass,
            containerMetadata->identifier(), url);

    const std::vector<std::string>& excluded =
        TarnGlobalConfiguration::sharedInstance().excludedFromAppUserData();
    const uint32_t owner = subdirectoryOwnerForMetadata(*containerMetadata);
    const mode_t mode = subdirectoryModeForClass(containerClass);
    auto& fm = TarnFileManager::defaultManager();
    for (const std::string& name : names) {
        const FileURL subdirectory = PathJoin(url, name);
        int32_t subdirectoryClass = protectionClass;
        if (TarnContainerClassIsPerUser(containerClass) &&
            std::find(excluded.begin(), excluded.end(), name) != excluded.end())
            subdirectoryClass = kTarnDataProtectionClassNone;
        if (const TarnStatus created = fm.createDirectoryAtURL(
                subdirectory, /*withIntermediateDirectories=*/true, mode, owner,
                static_cast<TarnDataProtectionClass>(subdirectoryClass));
            !created.ok()) {
            return TARN_ERROR(TarnErrorCreateDirectoryFailed, created.error(),
                              "Failed to create sub-dir for %@ at %@ (protClass: %d)",
                              containerMetadata->identifier(), subdirectory, subdirectoryClass);
        }
    }
    return {};
}

int TarnClientConnection::_dataProtectionClassForContainerMetadata(
    const TarnMetadataRef& containerMetadata) {
    if (!containerMetadata || !TarnContainerClassIsPerUser(containerMetadata->containerClass()))
        return kTarnDataProtectionClassNone;
    // A class recorded by an earlier change wins over what the entitlements ask for.
    auto& manager = TarnDataProtectionManager::defaultManager();
    if (auto recorded = manager.recordedDataProtectionClassOfContainer(*containerMetadata))
        return *recorded;
    return manager.intendedDataProtectionClassBasedOnEntitlementsForIdentifier(
        containerMetadata->identifier());
}

// ---- Create or look up ----

namespace {

bool isNotFound(const TarnErrorRef& e) {
    return e && e->isTarn() && e->code() == TarnErrorNotFound;
}

// The live directory name of a new container: system containers on the
// well-known list keep a fixed name, everything else is named by a UUID.
std::string liveDirectoryName(const std::string& identifier, TarnContainerClass containerClass,
                              const std::string& uuidName) {
    std::optional<std::string> wellKnown;
    if (containerClass == TarnContainerClassSystemGroup)
        wellKnown = TarnWhitelist::sharedWhitelist().wellknownSystemGroupContainerForId(identifier);
    else if (containerClass == TarnContainerClassSystemData)
        wellKnown = TarnWhitelist::sharedWhitelist().wellknownSystemContainerForId(identifier);
    return wellKnown ? *wellKnown : uuidName;
}

// Builds a new container in the staging directory and renames it into place.
// The caller holds the global write lock (or has taken it over).
// The operation these helpers do the work of: their errors and lines carry its name.
constexpr const char* kCreateOrLookup = "createOrLookupContainerWithContainerIdentity";

TarnResult<TarnMetadataRef> createContainer(TarnClientConnection& connection,
                                            const TarnContainerIdentityRef& identity,
                                            bool transient) {
    const std::string& identifier = identity->identifier();
    const TarnContainerClass containerClass = identity->containerClass();
    const TarnUserIdentityRef& userIdentity = identity->userIdentity();
    auto& configuration = TarnGlobalConfiguration::sharedInstance();
    auto& fm = TarnFileManager::defaultManager();

    const std::string directoryName = Uuid::generate().string();
    if (PlatformLogVerbose())
        SignpostEvent("unspecified", "CreatingContainer",
                      {{"uuid", "<private>"},
                       {"identifier", "<private>"},
                       {"class", std::to_string(containerClass)}});

    const FileURL stagingParent =
        configuration.stagingDirectoryURLForUserIdentity(userIdentity, containerClass);
    // An identity without a home has no staging directory: nothing is built.
    const FileURL stagingURL = stagingParent.empty() ? FileURL() : PathJoin(stagingParent, directoryName);
    // No staging directory fails with no underlying error.
    const TarnStatus staged = stagingURL.empty()
                                  ? TarnStatus(TarnErrorRef())
                                  : connection._createTopLevelContainerDirectory(
                                        stagingURL, containerClass,
                                        userIdentity->posixUIDForContainerClass(containerClass));
    if (!staged.ok()) {
        return TARN_ERROR_IN(kCreateOrLookup, TarnErrorCreateStagingFailed, staged.error(),
                             "Failed to create staging dir at %@ : %@", stagingURL, staged.error());
    }

    // From here on a failure leaves a staging directory that must go to death row.
    TarnMutableMetadataRef metadata;
    FileURL liveURL;
    const TarnStatus built = [&]() -> TarnStatus {
        // The metadata's UUID is independent of the directory's name, so that
        // neither can be derived from the other.
        TarnResult<TarnConcreteContainerIdentityRef> made =
            TarnConcreteContainerIdentity::containerIdentityWithUUID(Uuid::generate(), userIdentity,
                                                                     identifier, containerClass);
        if (!made.ok())
            return TARN_ERROR_CODE_IN(kCreateOrLookup, made.code(TarnErrorInvalidArgument),
                                      nullptr);
        TarnConcreteContainerIdentityRef concrete = std::move(*made);
        metadata = TarnMetadata::initWithContainerIdentity(concrete, std::nullopt, stagingURL,
                                                           std::nullopt);
        metadata->setTransient(transient);
        // While the directory is empty, so that everything made in it joins.
        metadata->setProjectID(fm.assignProjectToNewContainer(stagingURL, concrete->uuid()));
        TARN_TRY(metadata->writeMetadataToDiskWithError());
        if (TarnContainerClassIsSystem(containerClass))
            TARN_TRY(fm.setTopLevelSystemContainerACLAtURL(stagingURL));
        TARN_TRY(connection._createSubDirectories(stagingURL, metadata));

        std::optional<FileURL> liveParent = configuration.containerDirectoryURLForUserIdentity(
            userIdentity, containerClass, transient);
        liveURL = PathJoin(liveParent.value_or(FileURL()),
                           liveDirectoryName(identifier, containerClass, directoryName));
        // No live directory fails the move with no underlying error.
        const TarnStatus moved =
            liveParent ? fm.moveItemAtURL(stagingURL, liveURL) : TarnStatus(TarnErrorRef());
        if (!moved.ok())
            return TARN_ERROR_IN(kCreateOrLookup, TarnErrorMoveStagingFailed, moved.error(),
                                 "Failed to move staging dir: %@ to live dir: %@", stagingURL,
                                 liveURL);
        return {};
    }();

    if (!built.ok()) {
        const TarnStatus cleaned = connection._moveItemAtURLToDeathRow(
            stagingURL, /*isDir=*/true, /*startDeletionThread=*/true);
        if (!cleaned.ok())
            return TARN_ERROR_IN(kCreateOrLookup, TarnErrorRemoveStagingFailed, cleaned.error(),
                                 "Failed to remove staging dir: %@", stagingURL);
        return built.error();
    }

    if (HostConfiguration::shared().featureEnabled("fast_container_sizing"))
        (void)fm.fastDiskUsageForURL(liveURL);  // warms the size cache only

    metadata->setUrl(liveURL);
    metadata->setExisted(false);
    if (const TarnStatus added = TarnContainerCache::sharedInstance().addContainerMetadata(
            metadata, liveURL, transient, /*updateSandbox=*/true);
        !added.ok()) {
        return TARN_ERROR_IN(kCreateOrLookup, TarnErrorCacheAddFailed, added.error(),
                             "Failed to add to cache : %@, url: %@, transient: %d",
                             metadata->description(), liveURL, transient);
    }
    return TarnMetadataRef(std::move(metadata));
}

// Copies a cached record and marks it as found.
TarnMetadataRef foundContainer(const TarnMetadataRef& cached) {
    TarnMutableMetadataRef found = cached->copy();
    found->setExisted(true);
    return found;
}

TarnResult<TarnMetadataRef> createOrLookup(TarnClientConnection& connection,
                                           const TarnContainerIdentityRef& identity,
                                           bool createIfNecessary, bool transient, bool useLocking,
                                           TarnGlobalLockHolder& globalLock) {
    PlatformLog("unspecified", PlatformLogType::Debug,
                "createOrLookup; identity: %@, createIfNecessary: %d, transient: %d, "
                "allowOtherIdLookup: %d, unrestricted: %d, clientBundleIdentifier: %@",
                identity, createIfNecessary, transient, connection.allowOtherIdLookup(),
                connection.unrestricted(), connection.clientBundleIdentifier());
    if (!identity) {
        return TARN_ERROR_IN(kCreateOrLookup, TarnErrorBadInput, nullptr,
                             "Cannot lookup a nil container identity.");
    }
    const std::string& identifier = identity->identifier();
    const TarnContainerClass containerClass = identity->containerClass();
    TARN_TRY(connection._passesLookupRuleForContainerClass(containerClass, identifier));
    TARN_TRY(connection._passesSystemDataGateForContainerClass(containerClass, identifier));

    auto& cache = TarnContainerCache::sharedInstance();
    const bool allowKernelLookup =
        !(connection.clientIdentity() && connection.clientIdentity()->isKernel());
    if (!transient) {
        if (useLocking) globalLock.readLock();
        const TarnResult<TarnMetadataRef> cached = cache.containerForContainerIdentity(
            identity, /*transient=*/false, /*updateSandbox=*/true, allowKernelLookup);
        globalLock.release();
        if (cached.ok()) return foundContainer(*cached);
        if (!isNotFound(cached.error())) return cached.error();
    }

    if (!createIfNecessary) {
        return TARN_ERROR_SILENT_IN(kCreateOrLookup, TarnErrorNotFound, nullptr,
                                    "Container with identifier: \"%@\" Not Found", identifier);
    }

    // Look again under the write lock: another request may have created it
    // since the read lock was let go.
    if (useLocking) globalLock.writeLock();
    const TarnResult<TarnMetadataRef> cached = cache.containerForContainerIdentity(
        identity, transient, /*updateSandbox=*/true, allowKernelLookup);
    if (cached.ok() && !transient) return foundContainer(*cached);
    if (cached.ok()) {
        // A transient container is made anew on every request.
        const FileURL& cachedURL = (*cached)->url();
        if (const TarnStatus moved = connection._moveItemAtURLToDeathRow(
                cachedURL, /*isDir=*/true, /*startDeletionThread=*/true);
            !moved.ok()) {
            return TARN_ERROR_IN(kCreateOrLookup, TarnErrorRemoveTransientFailed, moved.error(),
                                 "Failed to remove transient container at %@", cachedURL);
        }
    } else if (!isNotFound(cached.error())) {
        return cached.error();
    }
    return createContainer(connection, identity, transient);
}

}  // namespace

TarnResult<TarnMetadataRef> TarnClientConnection::createOrLookupContainerWithContainerIdentity(
    const TarnContainerIdentityRef& identity, bool createIfNecessary, bool transient,
    bool useLocking) {
    // Whatever leaves, the holder lets the global lock go.
    TarnGlobalLockHolder globalLock;
    return createOrLookup(*this, identity, createIfNecessary, transient, useLocking, globalLock);
}

TarnResult<std::vector<TarnMetadataRef>> TarnClientConnection::containersWithClass(
    TarnContainerClass containerClass, bool transient) {
    if (!TarnContainerClassIsValid(containerClass)) {
        return TARN_ERROR(TarnErrorInvalidArgument, nullptr,
                          "Can't act on an invalid container class: %ld",
                          static_cast<int64_t>(containerClass));
    }
    TarnUserIdentityRef userIdentity = clientIdentity_ ? clientIdentity_->userIdentity() : nullptr;
    if (!userIdentity) userIdentity = TarnUserIdentityCache::defaultUserIdentity();
    TarnGlobalLockHolder globalLock;
    globalLock.readLock();
    return TarnContainerCache::sharedInstance().allContainersForUserIdentity(
        userIdentity, containerClass, transient);
}

// ---- Deletion ----

TarnStatus TarnClientConnection::deleteContainerWithContainerIdentity(
    const TarnContainerIdentityRef& identity, bool transient) {
    TarnResult<TarnMetadataRef> found = createOrLookupContainerWithContainerIdentity(
        identity, /*createIfNecessary=*/false, transient, /*useLocking=*/true);
    TarnConcreteContainerIdentityRef concrete =
        found.ok() ? (*found)->containerIdentity() : nullptr;
    if (!concrete) {
        TarnLog(kLogError, __func__,
                "Failed to lookup existing container to delete-identity: %@, transient: %d",
                identity, transient);
        // A record without an identity of its own answers as a bad argument.
        if (found.ok()) return TARN_ERROR_CODE(TarnErrorInvalidArgument, nullptr);
        return found.error();
    }
    commandQueue_->insertCommand(
        TarnCommandStageForDelete::commandForStageForDeleteWithContainerIdentities(
            {concrete}, /*useLocking=*/true, nullptr));
    return {};
}

bool TarnClientConnection::completeWithError(uint64_t* error) {
    return TarnReport(commandQueue_->executeAllUntilExhaustedOrError(), error,
                      TarnErrorInvalidArgument);
}

DispatchQueueRef TarnClientConnection::_sharedBackgroundQueue() {
    static DispatchQueueRef q = DispatchQueue::createSerial("com.ostrea.tarnkeeperd.background",
                                                            DispatchQueue::global(QoS::Background));
    return q;
}

}  // namespace tarn
