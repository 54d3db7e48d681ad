#include "Daemon/TarnDataProtectionManager.h"

#include "Daemon/TarnCodeSigningMapping.h"
#include "Daemon/TarnLog.h"

namespace tarn {

TarnDataProtectionManager& TarnDataProtectionManager::defaultManager() {
    // Leaked on purpose: request threads may still use it at exit.
    static auto* manager = new TarnDataProtectionManager();
    return *manager;
}

int32_t TarnDataProtectionManager::dataProtectionClassForEntitlementValue(
    const std::string& value) {
    static const struct {
        const char* level;
        int32_t dataProtectionClass;
    } kLevels[] = {
        {kTarnFileProtectionComplete, 1},
        {kTarnFileProtectionCompleteUnlessOpen, 2},
        {kTarnFileProtectionCompleteUntilFirstUserAuthentication, 3},
        {kTarnFileProtectionNone, 4},
        {kTarnFileProtectionWriteOnly, 2},
        {kTarnFileProtectionCompleteUntilUserAuthentication, 3},
    };
    for (const auto& level : kLevels)
        if (value == level.level) return level.dataProtectionClass;
    const int32_t fallback = 0;
    TarnLog(kLogError, "intendedDataProtectionClassBasedOnEntitlementsForIdentifier",
            "Unknown value for DataProtectionClass entitlement: %@; defaulting to class %d", value,
            fallback);
    return fallback;
}

int32_t TarnDataProtectionManager::dataProtectionClassForEntitlements(
    const PlistDict& entitlements) {
    for (const char* key :
         {kTarnDefaultDataProtectionEntitlement, kTarnDataProtectionClassEntitlement,
          kTarnDataProtectionClassLegacyEntitlement}) {
        auto it = entitlements.find(key);
        if (it == entitlements.end()) continue;
        if (const std::string* level = it->second.asString())
            return dataProtectionClassForEntitlementValue(*level);
    }
    return 0;
}

int32_t TarnDataProtectionManager::intendedDataProtectionClassBasedOnEntitlementsForIdentifier(
    const std::string& identifier) {
    TarnCodeSigningMapping* mapping = TarnCodeSigningMapping::sharedInstance();
    if (!mapping) return 0;
    std::optional<PlistDict> entitlements = mapping->entitlementsForIdentifier(identifier);
    return entitlements ? dataProtectionClassForEntitlements(*entitlements) : 0;
}

}  // namespace tarn

namespace tarn {

void TarnDataProtectionManager::setDataProtectionOnDataContainerForContainerIdentity(
    const TarnContainerIdentityRef& identity, int32_t dataProtectionClass,
    bool isSecondOrThirdPartyApp, bool retryIfLocked, std::function<void(uint64_t)> completion) {
    if (completion) completion(TarnErrorInvalidCommand);
}

TarnStatus TarnDataProtectionManager::restartPendingDataProtectionOperationsWithError() {
    return {};
}

}  // namespace tarn
