// The platform's container library: the constants and per-class tables that
// the daemon shares with its clients. One place for notification names, the
// fixed owner ids and the standard subdirectories of a new container.
// Header only; everything here is constant.
#pragma once

#include <cstdint>
#include <string>
#include <vector>

namespace tarn {

// Posted when a user identity (persona) went away and its cached state was dropped.
inline constexpr const char* CONTAINER_NOTIFY_USER_INVALIDATED =
    "com.ostrea.tarnkeeper.user-invalidated";
// Posted when the every-launch clean-up has finished.
inline constexpr const char* CONTAINER_NOTIFY_CLEANUP_COMPLETE =
    "com.ostrea.tarnkeeper.cleanup-complete";
// Posted when the first-launch-since-boot clean-up has finished.
inline constexpr const char* CONTAINER_NOTIFY_REBOOT_CLEANUP_COMPLETE =
    "com.ostrea.tarnkeeper.reboot-cleanup-complete";

// Owner of bundle containers (the installer's account).
inline constexpr uint32_t CONTAINER_INSTALLATION_UID = 33;
// Owner of the contents of system and system-group containers (-2 as unsigned).
inline constexpr uint32_t CONTAINER_SYSTEM_UID = 4294967294u;

// Returned by ContainerLibrarySubdirectoriesForClass when a class has no list.
inline constexpr uint64_t kContainerLibraryErrorNoSubdirectories = 1;

// The standard subdirectories a new container of `containerClass` receives,
// parents before children. Returns false (with `*errorCode` set) for a number
// that is not a container class; an empty list is a valid answer.
inline bool ContainerLibrarySubdirectoriesForClass(uint64_t containerClass,
                                                   std::vector<std::string>* subdirectories,
                                                   uint64_t* errorCode) {
    static const std::vector<std::string> kData = {
        "Documents",         "Library",         "Library/Caches",
        "Library/Preferences", "SystemData",    "tmp",
    };
    static const std::vector<std::string> kGroup = {"Library", "Library/Caches",
                                                    "Library/Preferences"};
    static const std::vector<std::string> kSystem = {"Library", "Library/Caches",
                                                     "Library/Preferences", "tmp"};
    switch (containerClass) {
        case 1: case 3: case 5: case 8:  // bundles: the installer fills them
            subdirectories->clear();
            return true;
        case 2: case 4: case 6: case 9: case 10:
            *subdirectories = kData;
            return true;
        case 11:
            *subdirectories = {"tmp"};
            return true;
        case 7: case 13:
            *subdirectories = kGroup;
            return true;
        case 12:
            *subdirectories = kSystem;
            return true;
        default:
            if (errorCode) *errorCode = kContainerLibraryErrorNoSubdirectories;
            return false;
    }
}

}  // namespace tarn
