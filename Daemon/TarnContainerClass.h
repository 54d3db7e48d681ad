// Container classes: what kind of directory a container is, where it lives,
// who owns it and how it is announced to the kernel sandbox. A class is a
// plain uint64_t; only 1 to 13 are classes. 0 ("Undefined") and 14 ("MAX")
// exist in the name tables as end markers and are never accepted.
// Everything here is constant and thread-safe.
#pragma once

#include <cstdint>

namespace tarn {

using TarnContainerClass = uint64_t;

enum : TarnContainerClass {
    TarnContainerClassUndefined = 0,
    TarnContainerClassAppBundle = 1,
    TarnContainerClassAppData = 2,
    TarnContainerClassPluginBundle = 3,
    TarnContainerClassPluginData = 4,
    TarnContainerClassVPNPluginBundle = 5,
    TarnContainerClassVPNPluginData = 6,
    TarnContainerClassAppGroup = 7,
    TarnContainerClassFrameworkBundle = 8,
    TarnContainerClassConduitServiceData = 9,
    TarnContainerClassDaemonData = 10,
    TarnContainerClassTempDir = 11,
    TarnContainerClassSystemData = 12,
    TarnContainerClassSystemGroup = 13,
    TarnContainerClassMax = 14,
};

inline constexpr bool TarnContainerClassIsValid(TarnContainerClass c) { return c >= 1 && c <= 13; }
inline constexpr bool TarnContainerClassIsBundle(TarnContainerClass c) {
    return c == 1 || c == 3 || c == 5 || c == 8;
}
inline constexpr bool TarnContainerClassIsSystem(TarnContainerClass c) { return c == 12 || c == 13; }
// Bundle and system classes: one container tree for all users, no user identity needed.
inline constexpr bool TarnContainerClassIsGlobal(TarnContainerClass c) {
    return TarnContainerClassIsBundle(c) || TarnContainerClassIsSystem(c);
}
// The data classes 2, 4, 6, 7, 9, 10, 11: below a user's home directory.
inline constexpr bool TarnContainerClassIsPerUser(TarnContainerClass c) {
    return TarnContainerClassIsValid(c) && !TarnContainerClassIsGlobal(c);
}
inline constexpr bool TarnContainerClassIsGroup(TarnContainerClass c) { return c == 7 || c == 13; }

// The class's directory below its base directory ("Data/Application"), or
// nullptr for a number that is not a class.
const char* TarnContainerClassRelativeDirectory(TarnContainerClass c);
// The class's key in cache keys and lookup entitlements ("appData"); 0 gives
// "Undefined", 14 "MAX", anything larger nullptr.
const char* TarnContainerClassShortName(TarnContainerClass c);
// The kind under which the class is pushed into the kernel sandbox's per-user
// state; 0 for classes that are not pushed (bundles) and for non-classes.
uint32_t TarnContainerClassSandboxItemType(TarnContainerClass c);

}  // namespace tarn
