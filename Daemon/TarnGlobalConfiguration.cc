#include "Daemon/TarnGlobalConfiguration.h"

#include "Daemon/TarnFileManager.h"
#include "Daemon/TarnLog.h"
#include "Daemon/TarnPerUserConfiguration.h"
#include "Platform/Accounts.h"
#include "Platform/ContainerLibrary.h"
#include "Platform/HostConfiguration.h"
#include "Platform/RootPrefix.h"

namespace tarn {

namespace {

constexpr const char* kHome = "/private/var/root/";
constexpr const char* kSharedContainers = "/private/var/containers";
constexpr const char* kLegacyTransientBundle =
    "/private/var/installd/Library/Caches/com.ostrea.tarnkeeperd";
constexpr mode_t kDirectoryMode = 0755;
constexpr uid_t kNoOwnerChange = 0;
constexpr int32_t kNoClassChange = kTarnDataProtectionClassUnchanged;

FileURL homeChild(const char* relative) { return PathJoin(RootPath(kHome), relative); }

}  // namespace

TarnGlobalConfiguration& TarnGlobalConfiguration::sharedInstance() {
    static std::mutex lock;
    // Never freed: references handed out under an earlier root stay valid, and
    // nothing is torn down at exit while other threads may still use it.
    static auto& made = *new std::vector<std::unique_ptr<TarnGlobalConfiguration>>();
    std::lock_guard<std::mutex> guard(lock);
    if (made.empty() || made.back()->rootPrefix() != RootPrefix()) {
        made.push_back(std::make_unique<TarnGlobalConfiguration>());
    }
    return *made.back();
}

TarnGlobalConfiguration::TarnGlobalConfiguration()
    : rootPrefix_(RootPrefix()), homeDirectory_(RootPath(kHome)) {
    const char* tag = "init";
    if (auto mobile = AccountUserByName("mobile")) {
        currentMobileUserId_ = mobile->uid;
        currentMobileGroupId_ = mobile->gid;
        TarnLog(kLogError, tag, "Current mobile user ID is %u, group ID is %u", currentMobileUserId_,
                currentMobileGroupId_);
    } else {
        TarnLog(kLogError, tag, "Failed to get mobile uid. This is bad");
    }
}

TarnGlobalConfiguration::~TarnGlobalConfiguration() = default;

FileURL TarnGlobalConfiguration::directoryGetter(const char* tag, std::optional<FileURL>* slot,
                                                 const char* absolutePath,
                                                 const char* failureFormat, uid_t owner,
                                                 int32_t protectionClass) {
    std::lock_guard<std::recursive_mutex> guard(lock_);
    if (!*slot) *slot = RootPath(absolutePath);
    if (const TarnStatus created = TarnFileManager::defaultManager().createDirectoryAtURL(
            **slot, /*withIntermediateDirectories=*/true, kDirectoryMode, owner,
            static_cast<TarnDataProtectionClass>(protectionClass));
        !created.ok()) {
        TarnLog(kLogError, tag, failureFormat, **slot, created.error());
    }
    return **slot;
}

FileURL TarnGlobalConfiguration::sharedContainersDirectory() {
    return directoryGetter(__func__, &sharedContainersDirectory_, kSharedContainers,
                           "Failed to create shared container dir at \"%@\": %@", kNoOwnerChange,
                           kNoClassChange);
}

FileURL TarnGlobalConfiguration::bundleDirectory() {
    return directoryGetter(__func__, &bundleDirectory_, "/private/var/containers/Bundle",
                           "Failed to create bundle dir at \"%@\": %@", kNoOwnerChange,
                           kNoClassChange);
}

FileURL TarnGlobalConfiguration::transientBundleDirectory() {
    return directoryGetter(__func__, &transientBundleDirectory_, "/private/var/containers/Temp",
                           "Failed to create transient bundle dir at \"%@\": %@",
                           CONTAINER_INSTALLATION_UID, kNoClassChange);
}

std::optional<FileURL> TarnGlobalConfiguration::legacyTransientBundleDirectory() {
    FileURL url = RootPath(kLegacyTransientBundle);
    if (!TarnFileManager::defaultManager().itemExistsAtURL(url)) return std::nullopt;
    return url;
}

FileURL TarnGlobalConfiguration::libraryDirectory() {
    return directoryGetter(__func__, &libraryDirectory_, "/private/var/root/Library/TarnKeeper",
                           "Failed to create library dir at \"%@\": %@", kNoOwnerChange,
                           kTarnDataProtectionClassD);
}

FileURL TarnGlobalConfiguration::cachesDirectory() {
    return directoryGetter(__func__, &cachesDirectory_,
                           "/private/var/root/Library/Caches/com.ostrea.tarnkeeperd",
                           "Failed to create cache dir at \"%@\": %@", kNoOwnerChange,
                           kTarnDataProtectionClassD);
}

FileURL TarnGlobalConfiguration::logDirectory() {
    // Computed anew and without the lock: logging must never wait on the
    // configuration.
    FileURL url = homeChild("Library/Logs/TarnKeeper");
    if (const TarnStatus created = TarnFileManager::defaultManager().createDirectoryAtURL(
            url, /*withIntermediateDirectories=*/true, kDirectoryMode, kTarnDataProtectionClassD);
        !created.ok()) {
        TarnLog(kLogError, "logDirectory", "Failed to create log directory at \"%@\": %@", url,
                created.error());
    }
    return url;
}

FileURL TarnGlobalConfiguration::stagingDirectory() {
    return directoryGetter(__func__, &stagingDirectory_,
                           "/private/var/root/Library/Caches/com.ostrea.tarnkeeperd/Staging",
                           "Failed to create staging dir at \"%@\": %@", kNoOwnerChange,
                           kNoClassChange);
}

FileURL TarnGlobalConfiguration::deathrowDirectory() {
    return directoryGetter(__func__, &deathrowDirectory_,
                           "/private/var/root/Library/Caches/com.ostrea.tarnkeeperd/Dead",
                           "Failed to create deathrow dir at \"%@\": %@", kNoOwnerChange,
                           kNoClassChange);
}

FileURL TarnGlobalConfiguration::replaceDirectory() {
    return directoryGetter(__func__, &replaceDirectory_, "/private/var/root/Library/TarnKeeper/Replace",
                           "Failed to create replace dir at \"%@\": %@", kNoOwnerChange,
                           kNoClassChange);
}

FileURL TarnGlobalConfiguration::pendingUpdatesDirectory() {
    return directoryGetter(__func__, &pendingUpdatesDirectory_,
                           "/private/var/root/Library/TarnKeeper/PendingUpdates",
                           "Failed to create updates dir at \"%@\": %@", kNoOwnerChange,
                           kNoClassChange);
}

FileURL TarnGlobalConfiguration::transientDirectory() {
    return directoryGetter(__func__, &transientDirectory_,
                           "/private/var/root/Library/Caches/com.ostrea.tarnkeeperd/Temp",
                           "Failed to create transient dir at \"%@\": %@", kNoOwnerChange,
                           kNoClassChange);
}

std::optional<FileURL> TarnGlobalConfiguration::globalContainerBaseURLWithContentClass(
    TarnContainerClass contentClass, bool transient) {
    const char* relative = TarnContainerClassRelativeDirectory(contentClass);
    if (TarnContainerClassIsBundle(contentClass)) {
        return PathJoin(transient ? transientBundleDirectory() : sharedContainersDirectory(),
                        relative);
    }
    if (TarnContainerClassIsSystem(contentClass)) {
        return PathJoin(transient ? transientDirectory() : sharedContainersDirectory(), relative);
    }
    return std::nullopt;
}

std::optional<FileURL> TarnGlobalConfiguration::containerDirectoryURLForUserIdentity(
    const TarnUserIdentityRef& userIdentity, TarnContainerClass contentClass, bool transient) {
    if (TarnContainerClassIsGlobal(contentClass)) {
        std::lock_guard<std::recursive_mutex> guard(lock_);
        FileURL url = *globalContainerBaseURLWithContentClass(contentClass, transient);
        uid_t owner = TarnContainerClassIsBundle(contentClass) ? CONTAINER_INSTALLATION_UID
                                                                : kNoOwnerChange;
        if (const TarnStatus created = TarnFileManager::defaultManager().createDirectoryAtURL(
                url, /*withIntermediateDirectories=*/true, kDirectoryMode, owner);
            !created.ok()) {
            TarnLog(kLogError, "containerDirectoryURLForUserIdentity",
                    "Failed to create container dir at \"%@\": %@", url, created.error());
        }
        return url;
    }
    if (!userIdentity) return std::nullopt;
    return getPerUserConfigurationForUserIdentity(userIdentity)
        ->containerDirectoryURLForContentClass(contentClass, transient);
}

FileURL TarnGlobalConfiguration::stagingDirectoryURLForUserIdentity(
    const TarnUserIdentityRef& userIdentity, TarnContainerClass contentClass) {
    if (TarnContainerClassIsPerUser(contentClass) && userIdentity) {
        return getPerUserConfigurationForUserIdentity(userIdentity)->stagingDirectory();
    }
    return stagingDirectory();
}

std::shared_ptr<TarnPerUserConfiguration> TarnGlobalConfiguration::getPerUserConfigurationForUserIdentity(
    const TarnUserIdentityRef& userIdentity) {
    std::lock_guard<std::recursive_mutex> guard(lock_);
    auto it = perUserConfigurations_.find(userIdentity);
    if (it != perUserConfigurations_.end()) return it->second;
    auto config = TarnPerUserConfiguration::initWithUserIdentity(userIdentity);
    perUserConfigurations_.emplace(userIdentity, config);
    return config;
}

bool TarnGlobalConfiguration::isInternalImage() {
    std::lock_guard<std::recursive_mutex> guard(lock_);
    if (!isInternalImage_) isInternalImage_ = HostConfiguration::shared().internalBuild;
    return *isInternalImage_;
}

void TarnGlobalConfiguration::setIsInternalImage(bool isInternalImage) {
    std::lock_guard<std::recursive_mutex> guard(lock_);
    isInternalImage_ = isInternalImage;
}

const std::vector<std::string>& TarnGlobalConfiguration::appUserDataItemNames() const {
    static const std::vector<std::string> kNames = {"Documents", "Library", "tmp", "StoreKit"};
    return kNames;
}

const std::vector<std::string>& TarnGlobalConfiguration::excludedFromAppUserData() const {
    static const std::vector<std::string> kNames = {"SystemData"};
    return kNames;
}

bool TarnGlobalConfiguration::migrationFileExistsWithName(const std::string& name) {
    return TarnFileManager::defaultManager().itemExistsAtURL(PathJoin(libraryDirectory(), name));
}

}  // namespace tarn
