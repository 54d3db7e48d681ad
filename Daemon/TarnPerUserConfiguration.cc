#include "Daemon/TarnPerUserConfiguration.h"

#include "Daemon/TarnFileManager.h"
#include "Daemon/TarnLog.h"
#include "Platform/PlatformLog.h"

namespace tarn {

namespace {
constexpr mode_t kDirectoryMode = 0755;
}  // namespace

TarnPerUserConfiguration::TarnPerUserConfiguration(TarnUserIdentityRef userIdentity)
    : userIdentity_(std::move(userIdentity)),
      userHomeDirectory_(userIdentity_ ? userIdentity_->homeDirectoryURL() : FileURL()) {
    if (userHomeDirectory_.empty()) {
        PlatformLog("default", PlatformLogType::Fault, "Home directory cannot be nil: %@",
                    userIdentity_);
    }
}

std::shared_ptr<TarnPerUserConfiguration> TarnPerUserConfiguration::initWithUserIdentity(
    TarnUserIdentityRef userIdentity) {
    return std::make_shared<TarnPerUserConfiguration>(std::move(userIdentity));
}

FileURL TarnPerUserConfiguration::directoryGetter(const char* tag, std::optional<FileURL>* slot, const FileURL& url,
                                                  const char* failureFormat) {
    // Without a home every per-user directory is nil: paths built on an empty
    // home would name directories at the file system's root.
    if (userHomeDirectory_.empty()) return FileURL();
    std::lock_guard<std::recursive_mutex> guard(lock_);
    if (!*slot) *slot = url;
    const uid_t owner = userIdentity_ ? userIdentity_->posixUID() : 0;
    if (const TarnStatus created = TarnFileManager::defaultManager().createDirectoryAtURL(
            **slot, /*withIntermediateDirectories=*/true, kDirectoryMode, owner);
        !created.ok()) {
        TarnLog(kLogError, tag, failureFormat, **slot, created.error());
    }
    return **slot;
}

FileURL TarnPerUserConfiguration::userBaseDirectory() {
    return directoryGetter(__func__, &userBaseDirectory_, PathJoin(userHomeDirectory_, "Containers"),
                           "Failed to create user base dir at \"%@\": %@");
}

FileURL TarnPerUserConfiguration::transientDirectory() {
    std::lock_guard<std::recursive_mutex> guard(lock_);
    return directoryGetter(__func__, &transientDirectory_, PathJoin(userBaseDirectory(), "Temp"),
                           "Failed to create transient dir at \"%@\": %@");
}

FileURL TarnPerUserConfiguration::stagingDirectory() {
    std::lock_guard<std::recursive_mutex> guard(lock_);
    return directoryGetter(__func__, &stagingDirectory_, PathJoin(userBaseDirectory(), "Staging"),
                           "Failed to create staging dir at \"%@\": %@");
}

FileURL TarnPerUserConfiguration::libraryDirectory() {
    return directoryGetter(__func__, &libraryDirectory_, PathJoin(userHomeDirectory_, "Library/TarnKeeper"),
                           "Failed to create user library dir at \"%@\": %@");
}

FileURL TarnPerUserConfiguration::systemContainerBackupBaseDirectory() const {
    if (userHomeDirectory_.empty()) return FileURL();
    return PathJoin(userHomeDirectory_, "Library/Backup/SystemContainers");
}

FileURL TarnPerUserConfiguration::systemContainerBackupDirectory() const {
    const FileURL base = systemContainerBackupBaseDirectory();
    return base.empty() ? FileURL() : PathJoin(base, "Data");
}

FileURL TarnPerUserConfiguration::systemGroupContainerBackupDirectory() const {
    const FileURL base = systemContainerBackupBaseDirectory();
    return base.empty() ? FileURL() : PathJoin(base, "Shared");
}

FileURL TarnPerUserConfiguration::oldLoggingPath() const {
    if (userHomeDirectory_.empty()) return FileURL();
    return PathJoin(userHomeDirectory_, "Library/Logs/TarnKeeper");
}

std::optional<FileURL> TarnPerUserConfiguration::containerDirectoryURLForContentClass(
    TarnContainerClass contentClass, bool transient) {
    const char* tag = "containerDirectoryURLForContentClass";
    if (!TarnContainerClassIsPerUser(contentClass)) {
        TarnLog(kLogError, tag, "Invalid class for a per user container directory: %llu",
                contentClass);
        return std::nullopt;
    }
    if (!userIdentity_ || userHomeDirectory_.empty()) return std::nullopt;
    std::lock_guard<std::recursive_mutex> guard(lock_);
    FileURL parent = transient ? transientDirectory() : userBaseDirectory();
    FileURL url = PathJoin(parent, TarnContainerClassRelativeDirectory(contentClass));
    if (const TarnStatus created = TarnFileManager::defaultManager().createDirectoryAtURL(
            url, /*withIntermediateDirectories=*/true, kDirectoryMode, userIdentity_->posixUID());
        !created.ok()) {
        TarnLog(kLogError, tag, "Failed to create container dir at \"%@\": %@", url,
                created.error());
    }
    return url;
}

bool TarnPerUserConfiguration::existsUserBaseDirectory() const {
    return TarnFileManager::defaultManager().itemExistsAtURL(userHomeDirectory_);
}

}  // namespace tarn
