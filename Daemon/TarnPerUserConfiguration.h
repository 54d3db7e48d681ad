// TarnPerUserConfiguration: the container directories below one user's home
// directory (the enterprise persona's layout path for an enterprise identity).
// Made and kept by TarnGlobalConfiguration, one per user identity identifier.
//
// Like the global getters, directory getters compute once and create on every
// call (mode 0755, owner the identity's posixUID); failures are logged and the
// URL is still answered. The backup directories and oldLoggingPath are never
// created. Thread-safe: each object serialises itself with its own lock.
#pragma once

#include <memory>
#include <mutex>
#include <optional>

#include "Daemon/TarnContainerClass.h"
#include "Daemon/TarnUserIdentity.h"
#include "Platform/Path.h"

namespace tarn {

class TarnPerUserConfiguration {
public:
    explicit TarnPerUserConfiguration(TarnUserIdentityRef userIdentity);
    static std::shared_ptr<TarnPerUserConfiguration> initWithUserIdentity(
        TarnUserIdentityRef userIdentity);

    const TarnUserIdentityRef& userIdentity() const { return userIdentity_; }
    const FileURL& userHomeDirectory() const { return userHomeDirectory_; }

    FileURL userBaseDirectory();    // home + "Containers"
    FileURL transientDirectory();   // base + "Temp"
    FileURL stagingDirectory();     // base + "Staging"
    FileURL libraryDirectory();     // home + "Library/TarnKeeper"
    FileURL systemContainerBackupBaseDirectory() const;
    FileURL systemContainerBackupDirectory() const;
    FileURL systemGroupContainerBackupDirectory() const;
    FileURL oldLoggingPath() const;

    // Base directory of a per-user class, created; nullopt (logged) for any
    // other class.
    std::optional<FileURL> containerDirectoryURLForContentClass(TarnContainerClass contentClass,
                                                                bool transient);
    // Whether the home directory itself exists; creates nothing.
    bool existsUserBaseDirectory() const;

private:
    // `tag`: the getter's name, for its failure line.
    FileURL directoryGetter(const char* tag, std::optional<FileURL>* slot, const FileURL& url,
                            const char* failureFormat);

    // Constant after construction.
    const TarnUserIdentityRef userIdentity_;
    const FileURL userHomeDirectory_;

    // Guarded by lock_.
    std::recursive_mutex lock_;
    std::optional<FileURL> userBaseDirectory_;
    std::optional<FileURL> transientDirectory_;
    std::optional<FileURL> stagingDirectory_;
    std::optional<FileURL> libraryDirectory_;
};

}  // namespace tarn
