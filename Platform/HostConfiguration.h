// Host facts read once at start-up from DIR/etc/tarnkeeper/host.plist and
// DIR/etc/os-release. A missing or malformed file yields the defaults below
// and one level-3 line (written by the caller through Problems()), never a crash.
//
//   host.plist keys: "MultiUserFlags" (integer; absent = flags unreadable),
//   "InternalBuild" (bool), "DeviceSupportsPersonas" (bool), "EphemeralStorage"
//   (bool), "FeatureFlags" (dictionary of bools).
//   os-release: BUILD_ID is the build version, VARIANT_ID the release type
//   (default "Release").
#pragma once

#include <cstdint>
#include <map>
#include <optional>
#include <string>
#include <vector>

#include "Platform/PropertyList.h"

namespace tarn {

struct HostConfiguration {
    std::optional<uint64_t> multiUserFlags;
    bool internalBuild = false;
    bool deviceSupportsPersonas = false;
    bool ephemeralStorage = false;
    std::map<std::string, bool, std::less<>> featureFlags;
    std::string buildVersion;          // BUILD_ID, may be empty
    std::string releaseType = "Release";  // VARIANT_ID
    // Human-readable problems met while loading (missing files are not problems).
    std::vector<std::string> problems;

    bool featureEnabled(std::string_view name) const;
    // The system version dictionary: {"ProductBuildVersion": ..., "ReleaseType": ...}.
    PlistValue systemVersionDictionary() const;

    // Loads from the current root prefix.
    static HostConfiguration load();
    // The configuration of this process: loaded on first use, then fixed.
    static const HostConfiguration& shared();
    // Tests replace the process-wide configuration.
    static void TEST_setShared(HostConfiguration config);
};

}  // namespace tarn
