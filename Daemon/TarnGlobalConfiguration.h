// TarnGlobalConfiguration: every path the daemon works with (its own
// directories and the global container trees), the mobile user's ids, and a
// few fixed name lists. One per process (sharedInstance), living for the
// whole process.
//
// Directory getters compute their URL once and create the directory on every
// call (intermediate directories, mode 0755), so callers never check for
// existence first. A failure to create is logged and the URL is still
// answered; the caller's next file operation fails instead.
//
// All paths lie below the root prefix. The shared instance belongs to the root
// prefix it was made under: when the prefix changes (tests), the next
// sharedInstance() makes a fresh one. Earlier instances stay alive, so
// references handed out before remain valid.
//
// Thread-safe: the getters and the per-user table are serialised by the
// object's own (recursive) lock; per-user configurations lock themselves.
#pragma once

#include <cstdint>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "Daemon/TarnContainerClass.h"
#include "Daemon/TarnUserIdentity.h"
#include "Platform/Path.h"

namespace tarn {

class TarnPerUserConfiguration;

class TarnGlobalConfiguration {
public:
    static TarnGlobalConfiguration& sharedInstance();
    // A fresh configuration for the current root prefix (tests).
    TarnGlobalConfiguration();
    ~TarnGlobalConfiguration();
    TarnGlobalConfiguration(const TarnGlobalConfiguration&) = delete;
    TarnGlobalConfiguration& operator=(const TarnGlobalConfiguration&) = delete;

    // "/private/var/root/" (not created).
    FileURL homeDirectory() const { return homeDirectory_; }

    FileURL sharedContainersDirectory();
    FileURL bundleDirectory();
    FileURL transientBundleDirectory();
    // The old transient bundle place, only when something exists there.
    std::optional<FileURL> legacyTransientBundleDirectory();
    FileURL libraryDirectory();
    FileURL cachesDirectory();
    FileURL logDirectory();
    FileURL stagingDirectory();
    FileURL deathrowDirectory();
    FileURL replaceDirectory();
    FileURL pendingUpdatesDirectory();
    FileURL transientDirectory();

    // Base directory of a global class; nullopt for any other class. Creates nothing.
    std::optional<FileURL> globalContainerBaseURLWithContentClass(TarnContainerClass contentClass,
                                                                  bool transient);
    // Base directory of the class for the identity, created. nullopt only for
    // a number that is not a class.
    std::optional<FileURL> containerDirectoryURLForUserIdentity(
        const TarnUserIdentityRef& userIdentity, TarnContainerClass contentClass, bool transient);
    // The user's staging directory for per-user classes, the global one otherwise.
    FileURL stagingDirectoryURLForUserIdentity(const TarnUserIdentityRef& userIdentity,
                                               TarnContainerClass contentClass);
    // Made on first request and remembered; identities with the same
    // identifier share one.
    std::shared_ptr<TarnPerUserConfiguration> getPerUserConfigurationForUserIdentity(
        const TarnUserIdentityRef& userIdentity);

    uint32_t currentMobileUserId() const { return currentMobileUserId_; }
    uint32_t currentMobileGroupId() const { return currentMobileGroupId_; }
    // Whether the OS is an internal build; asked once, on first use.
    bool isInternalImage();
    void setIsInternalImage(bool isInternalImage);

    // "Documents", "Library", "tmp", "StoreKit".
    const std::vector<std::string>& appUserDataItemNames() const;
    // "SystemData".
    const std::vector<std::string>& excludedFromAppUserData() const;

    // Whether an item of that name exists directly in the library directory.
    bool migrationFileExistsWithName(const std::string& name);

    const std::string& rootPrefix() const { return rootPrefix_; }

private:
    // Computes `*slot` once with `path` and creates it on every call.
    // `tag`: the getter's name, for its failure line.
    FileURL directoryGetter(const char* tag, std::optional<FileURL>* slot, const char* absolutePath,
                            const char* failureFormat, uid_t owner, int32_t protectionClass);

    // Constant after construction.
    const std::string rootPrefix_;
    const FileURL homeDirectory_;
    uint32_t currentMobileUserId_ = 0;
    uint32_t currentMobileGroupId_ = 0;

    // Guarded by lock_ (recursive: getters call each other).
    std::recursive_mutex lock_;
    std::optional<FileURL> sharedContainersDirectory_;
    std::optional<FileURL> bundleDirectory_;
    std::optional<FileURL> transientBundleDirectory_;
    std::optional<FileURL> libraryDirectory_;
    std::optional<FileURL> cachesDirectory_;
    std::optional<FileURL> stagingDirectory_;
    std::optional<FileURL> deathrowDirectory_;
    std::optional<FileURL> replaceDirectory_;
    std::optional<FileURL> pendingUpdatesDirectory_;
    std::optional<FileURL> transientDirectory_;
    std::optional<bool> isInternalImage_;
    TarnUserIdentityMap<std::shared_ptr<TarnPerUserConfiguration>> perUserConfigurations_;
};

}  // namespace tarn
