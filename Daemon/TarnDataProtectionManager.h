// TarnDataProtectionManager: decides which data-protection class a data
// container should get, accepts requests to change it, refuses classes that
// are not allowed, persists each accepted change as a pending operation
// (TarnDataProtectionChangeOperation) before running it, and restarts pending
// operations after a restart.
//
// One per process (defaultManager, also reachable as sharedInstance), living
// for the whole process. Every operation may run on any thread, but off the
// code-signing mapping's queue (it reads the mapping synchronously) and
// without identifier locks held (a change takes them). Pending-operation files
// are touched only on `protectionOperationFileQueue`.
#pragma once

#include <cstdint>
#include <functional>
#include <optional>
#include <string>

#include "Daemon/TarnContainerIdentity.h"
#include "Daemon/TarnDataProtectionChangeOperation.h"
#include "Daemon/TarnMetadata.h"
#include "Daemon/TarnResult.h"
#include "Platform/Dispatch.h"
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
    // The class a container's info records ("com.ostrea.Pallet.ContentProtectionClass"
    // holding a number); none when it records none.
    static std::optional<int32_t> recordedDataProtectionClassOfContainer(
        const TarnMetadata& metadata);

    // Changes the class of a data container's user data. Every outcome,
    // including a refusal, reaches `completion` (when given) exactly once as
    // a code (TarnSuccess on success): on the calling thread when the change
    // ends at once, later on the lock-state queue when it waited for an unlock.
    void setDataProtectionOnDataContainerForContainerIdentity(
        const TarnContainerIdentityRef& identity, int32_t dataProtectionClass,
        bool isSecondOrThirdPartyApp, bool retryIfLocked, std::function<void(uint64_t)> completion);

    // Restarts the changes a previous run left pending. Called once, by the
    // every-launch set-up.
    TarnStatus restartPendingDataProtectionOperationsWithError();

    // Runs one change. Before its first retry after an unlock the application
    // is kept from running (a termination assertion, held until the end);
    // after success the new class is recorded in the container's info.
    void _startDataProtectionChangeOperation(const TarnDataProtectionChangeOperationRef& operation,
                                             std::function<void(uint64_t)> completion);

    // The change type for going from `currentClass` to `requestedClass`:
    // directories and files (files only towards stronger classes) when the
    // class gets stronger, directories only otherwise.
    static uint32_t changeTypeForClassChange(int32_t currentClass, int32_t requestedClass);

    const DispatchQueueRef& protectionOperationFileQueue() const {
        return protectionOperationFileQueue_;
    }

  private:
    TarnDataProtectionManager();

    // Constant after construction.
    const DispatchQueueRef protectionOperationFileQueue_;
};

}  // namespace tarn
