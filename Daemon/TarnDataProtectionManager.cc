#include "Daemon/TarnDataProtectionManager.h"

#include "Daemon/TarnApplicationTerminationAssertion.h"
#include "Daemon/TarnClientConnection.h"
#include "Daemon/TarnCodeSigningMapping.h"
#include "Daemon/TarnContainerCache.h"
#include "Daemon/TarnExceptionFence.h"
#include "Daemon/TarnFileManager.h"
#include "Daemon/TarnGlobalConfiguration.h"
#include "Daemon/TarnLog.h"

namespace tarn {

namespace {

constexpr const char* kSetTag = "setDataProtectionOnDataContainerForContainerIdentity";
constexpr const char* kStartTag = "_startDataProtectionChangeOperation";
constexpr const char* kRestartTag = "restartPendingDataProtectionOperationsWithError";

// The code a client gets for a failure that carries none of ours (a file
// layer error that ended a pass).
constexpr uint64_t kCompletionFallback = TarnErrorInvalidArgument;

}  // namespace

TarnDataProtectionManager::TarnDataProtectionManager()
    : protectionOperationFileQueue_(
          DispatchQueue::createSerial("com.ostrea.TarnKeeper.ProtectionOperationFileQueue")) {}

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

std::optional<int32_t> TarnDataProtectionManager::recordedDataProtectionClassOfContainer(
    const TarnMetadata& metadata) {
    const std::optional<PlistValue>& info = metadata.info();
    const PlistValue* recorded = info ? info->find(kTarnInfoContentProtectionClassKey) : nullptr;
    if (!recorded || !recorded->isNumber()) return std::nullopt;
    if (auto i = recorded->asInt64()) return static_cast<int32_t>(*i);
    return std::nullopt;
}

uint32_t TarnDataProtectionManager::changeTypeForClassChange(int32_t currentClass,
                                                             int32_t requestedClass) {
    // Lower numbers are stronger; no class at all counts as weaker than 1 and 2.
    const bool stronger =
        requestedClass < currentClass || (requestedClass < kTarnDataProtectionClassC &&
                                          currentClass == kTarnDataProtectionClassNone);
    return stronger ? kTarnChangeEverything : kTarnChangeDirectories;
}

void TarnDataProtectionManager::setDataProtectionOnDataContainerForContainerIdentity(
    const TarnContainerIdentityRef& identity, int32_t dataProtectionClass,
    bool isSecondOrThirdPartyApp, bool retryIfLocked, std::function<void(uint64_t)> completion) {
    // The operation to start; null when nothing needs to change.
    auto prepare = [&]() -> TarnResult<TarnDataProtectionChangeOperationRef> {
        if (!identity || !TarnContainerClassIsPerUser(identity->containerClass()))
            return TARN_ERROR_IN(kSetTag, TarnErrorInvalidArgument, nullptr,
                                 "Can't act on an invalid object: identity: %@", identity);
        TarnResult<TarnMetadataRef> found =
            TarnContainerCache::sharedInstance().containerForContainerIdentity(
                identity, /*transient=*/false,
                /*updateSandbox=*/true);
        if (!found.ok())
            return TARN_ERROR_IN(kSetTag, TarnErrorNotFound, found.error(),
                                 "No Container with identity: %@", identity);
        const TarnMetadataRef& metadata = *found;
        const int32_t currentClass = recordedDataProtectionClassOfContainer(*metadata).value_or(
            kTarnDataProtectionClassNone);

        if (dataProtectionClass == currentClass) {
            // Nothing to change on disk, but an older change still pending
            // would undo this request at its next run.
            TarnStatus deleted;
            protectionOperationFileQueue_->sync([&] {
                deleted = TarnDataProtectionChangeOperation::deleteUpdateFileWithContainerIdentity(
                    *identity);
            });
            if (!deleted.ok()) {
                TarnLog(kLogError, kSetTag,
                        "Failed to delete existing data protection update file: %@",
                        deleted.error());
                return deleted.error();
            }
            return TarnDataProtectionChangeOperationRef();
        }
        if (dataProtectionClass == kTarnDataProtectionClassB)
            return TARN_ERROR_IN(kSetTag, TarnErrorBadInput, nullptr,
                                 "Data protection class %d is not allowed", dataProtectionClass);
        if (isSecondOrThirdPartyApp && dataProtectionClass != kTarnDataProtectionClassNone &&
            dataProtectionClass != kTarnDataProtectionClassA &&
            dataProtectionClass != kTarnDataProtectionClassC)
            return TARN_ERROR_IN(kSetTag, TarnErrorBadInput, nullptr,
                                 "Data protection class %d is invalid for 2nd and 3rd party apps",
                                 dataProtectionClass);

        auto operation =
            TarnDataProtectionChangeOperation::dataProtectionChangeOperationWithContainerMetadata(
                metadata, dataProtectionClass, retryIfLocked,
                changeTypeForClassChange(currentClass, dataProtectionClass),
                protectionOperationFileQueue_);
        // Persisted first: from here on a restart finishes the change.
        if (TarnStatus written = operation->writeToDiskWithError(); !written.ok()) {
            TarnLog(kLogError, kSetTag, "Failed to write data protection update file to disk: %@",
                    written.error());
            return written.error();
        }
        return operation;
    };

    TarnResult<TarnDataProtectionChangeOperationRef> prepared =
        TarnFenceExceptions(kSetTag, prepare);
    if (!prepared.ok() || !*prepared) {
        if (completion) completion(prepared.code(kCompletionFallback));
        return;
    }
    _startDataProtectionChangeOperation(*prepared, std::move(completion));
}

void TarnDataProtectionManager::_startDataProtectionChangeOperation(
    const TarnDataProtectionChangeOperationRef& operation,
    std::function<void(uint64_t)> completion) {
    // The retry-start and completion blocks run one after the other (both on
    // the lock-state queue once a retry has started), never at once.
    auto assertion = std::make_shared<std::unique_ptr<TarnApplicationTerminationAssertion>>();
    const TarnMetadataRef metadata = operation->dataContainerMetadata();
    operation->setRetryStartBlock([assertion, metadata] {
        *assertion = TarnApplicationTerminationAssertion::initWithBundleIdentifier(
            metadata->identifier(), TarnTerminationReasonInstallation);
    });
    const int32_t newClass = operation->newDataProtectionClass();
    const bool retryIfLocked = operation->retryIfLocked();
    operation->setCompletionBlock([assertion, metadata, newClass, retryIfLocked,
                                   completion = std::move(completion)](bool wasLocked,
                                                                       const TarnErrorRef& error) {
        uint64_t code = TarnSuccess;
        if (error) {
            code = TarnErrorCodeOf(error, kCompletionFallback);
            TarnLog(kLogError, kStartTag,
                    "Failed to set data protection on container with identifier %@ at %@ to %d: "
                    "%@",
                    metadata->identifier(), metadata->url(), newClass, error);
        }
        if (wasLocked && retryIfLocked)
            TarnLog(kLogError, kStartTag,
                    "Unexpectedly got completion block called with wasLocked");
        if (*assertion) {
            (*assertion)->invalidate();
            assertion->reset();
        }
        if (!error && !wasLocked) {
            TarnStatus recorded =
                TarnClientConnection::privilegedClientConnectionWithUserIdentity(
                    metadata->userIdentity())
                    ->setInfoValue(PlistValue(newClass),
                                   std::string(kTarnInfoContentProtectionClassKey),
                                   metadata->containerIdentity(), /*useLocking=*/true);
            if (!recorded.ok())
                TarnLog(kLogError, kStartTag,
                        "Failed to set protection class info for %@ at %@ to %d : %llu",
                        metadata->identifier(), metadata->url(), newClass,
                        recorded.code(kCompletionFallback));
        }
        if (completion) completion(code);
    });
    operation->performChangeOperation();
}

TarnStatus TarnDataProtectionManager::restartPendingDataProtectionOperationsWithError() {
    const FileURL directory = TarnGlobalConfiguration::sharedInstance().pendingUpdatesDirectory();
    TarnResult<std::vector<FileURL>> listed =
        TarnFileManager::defaultManager().urlsForItemsInDirectoryAtURL(directory);
    if (!listed.ok()) {
        if (listed.error() && listed.error()->posixCode() == ENOENT) return {};
        TarnLog(kLogError, kRestartTag, "Failed to get items at pendingUpdates URL %@ : %@",
                directory, listed.error());
        return listed.error();
    }
    for (const FileURL& url : *listed) {
        TarnLog(kLogNotice, kRestartTag, "Found pending data protection operation at %@", url);
        TarnResult<TarnDataProtectionChangeOperationRef> operation =
            TarnDataProtectionChangeOperation::dataProtectionChangeOperationAtURL(
                url, protectionOperationFileQueue_);
        if (!operation.ok()) {
            // Left where it is, for someone to look at.
            TarnLog(kLogError, kRestartTag,
                    "Failed to read data protection change operation at %@ : %@", url,
                    operation.error());
            continue;
        }
        const TarnMetadata& m = *(*operation)->dataContainerMetadata();
        TarnLog(kLogNotice, kRestartTag,
                "Starting pending data protection update to protection class %d for user: %@, ID: "
                "%@, containerClass: %llu",
                (*operation)->newDataProtectionClass(), m.userIdentity(), m.identifier(),
                m.containerClass());
        _startDataProtectionChangeOperation(*operation, nullptr);
    }
    return {};
}

}  // namespace tarn
