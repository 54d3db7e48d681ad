// TarnDataProtectionManager: decides which data-protection class a data
// container should get. One per process (defaultManager, also reachable as
// sharedInstance), living for the whole process; stateless so far, so every
// operation may run on any thread (off the code-signing mapping's queue,
// because it reads the mapping synchronously).
//
// For now only the policy side is here: the class an application asks for in
// its entitlements. The operations that change a container's class and the
// pending-operation files behind them come later.
#pragma once

#include <cstdint>
#include <functional>
#include <string>

#include "Daemon/TarnContainerIdentity.h"
#include "Daemon/TarnResult.h"
#include "Platform/PropertyList.h"

namespace tarn {

// Entitlements naming a data-protection level, in order of precedence.
inline constexpr const char* kTarnDefaultDataProtectionEntitlement =
    "com.ostrea.developer.default-data-protection";
inline constexpr const char* kTarnDataProtectionClassEntitlement = "data-protection-class";
inline constexpr const char* kTarnDataProtectionClassLegacyEntitlement = "DataProtectionClass";

// The platform's file-protection levels as they appear in those entitlements.
inline constexpr const char* kTarnFileProtectionComplete = "com.ostrea.file-protection.complete";
inline constexpr const char* kTarnFileProtectionCompleteUnlessOpen =
    "com.ostrea.file-protection.complete-unless-open";
inline constexpr const char* kTarnFileProtectionCompleteUntilFirstUserAuthentication =
    "com.ostrea.file-protection.complete-until-first-user-authentication";
inline constexpr const char* kTarnFileProtectionNone = "com.ostrea.file-protection.none";
inline constexpr const char* kTarnFileProtectionWriteOnly = "com.ostrea.file-protection.write-only";
inline constexpr const char* kTarnFileProtectionCompleteUntilUserAuthentication =
    "com.ostrea.file-protection.complete-until-user-authentication";

class TarnDataProtectionManager {
  public:
    static TarnDataProtectionManager& defaultManager();
    static TarnDataProtectionManager& sharedInstance() { return defaultManager(); }

    // The class the identifier's entitlements ask for: 1 to 4, or 0 when it
    // has no entitlements, none of the three names a string, or the string
    // is not a known level (logged).
    int32_t intendedDataProtectionClassBasedOnEntitlementsForIdentifier(
        const std::string& identifier);

    // The class for one level string (0 and a level-3 line when unknown).
    static int32_t dataProtectionClassForEntitlementValue(const std::string& value);
    // The first of the three entitlements that holds a string, mapped.
    static int32_t dataProtectionClassForEntitlements(const PlistDict& entitlements);

    // Changes the class of a data container's user data. Every outcome,
    // including a refusal, reaches `completion` (when given) exactly once as
    // a code (TarnSuccess on success); it may run later, on another queue.
    void setDataProtectionOnDataContainerForContainerIdentity(
        const TarnContainerIdentityRef& identity, int32_t dataProtectionClass,
        bool isSecondOrThirdPartyApp, bool retryIfLocked, std::function<void(uint64_t)> completion);

    // Restarts the changes a previous run left pending. Called once, by the
    // every-launch set-up.
    TarnStatus restartPendingDataProtectionOperationsWithError();

  private:
    TarnDataProtectionManager() = default;
};

}  // namespace tarn
