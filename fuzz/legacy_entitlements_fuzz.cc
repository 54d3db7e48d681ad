// Arbitrary bytes as the legacy entitlements file, decoded the way the boot
// pass decodes it. Every identifier is answered either with an entry to
// store or with the reason it cannot be; an entry always holds exactly the
// identifier's entitlements dictionary, and only a true caller-registered
// value keeps it from being stored invalid.
#include <cstddef>
#include <cstdint>
#include <cstdlib>

#include "Daemon/TarnCodeSigningMapping.h"
#include "Platform/PlatformLog.h"
#include "fuzz/PlistSame.h"

using namespace tarn;

extern "C" int LLVMFuzzerInitialize(int*, char***) {
    PlatformLogSetQuiet(true);
    return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    std::optional<PlistValue> parsed = PlistValue::fromBytes(data, size, nullptr);
    if (!parsed || !parsed->isDict()) return 0;
    const PlistDict& file = *parsed->asDict();
    for (const auto& legacy : TarnCodeSigningMapping::_entriesFromLegacyEntitlements(file)) {
        auto it = file.find(legacy.identifier);
        if (it == file.end()) std::abort();  // only identifiers of the file
        if (!legacy.entry) {
            if (legacy.why.empty()) std::abort();  // a refusal says why
            continue;
        }
        const PlistDict* entitlements = legacy.entry->entitlements();
        // By bits: a NaN among the entitlements is still the same value.
        if (!entitlements ||
            !fuzz::SamePlist(PlistValue(*entitlements), it->second,
                             [](double x, double y) { return fuzz::SameBits(x, y); }))
            std::abort();
        if (legacy.entry->invalid() == legacy.entry->registeredByCaller()) std::abort();
        for (const std::string& child : legacy.entry->childBundleIdentifiers())
            if (child.empty()) std::abort();
    }
    return 0;
}
