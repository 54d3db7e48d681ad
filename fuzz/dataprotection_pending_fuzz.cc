// Arbitrary bytes as a pending data-protection file, checked the way start-up
// reads one. The reader answers the change or an error value with a code,
// never crashes; and what it accepts, written back as the daemon writes a
// pending file, reads back the same.
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <string>

#include "Daemon/TarnDataProtectionChangeOperation.h"
#include "Daemon/TarnMetadata.h"
#include "Daemon/TarnUserIdentityCache.h"
#include "Platform/Dispatch.h"
#include "Platform/PlatformLog.h"
#include "fuzz/FuzzRoot.h"

using namespace tarn;

extern "C" int LLVMFuzzerInitialize(int*, char***) {
    PlatformLogSetQuiet(true);
    fuzz::MakeFuzzRoot("dataprotection_pending_fuzz");
    TarnUserIdentityCache::TEST_setPersonasAreSupported(false);
    return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    auto& cache = TarnUserIdentitySharedCache::sharedInstance();
    auto result = TarnDataProtectionChangeOperation::_validateDataProtectionUpdate(
        std::string(reinterpret_cast<const char*>(data), size), "/fuzz.plist", cache);
    if (!result.ok()) {
        const TarnErrorRef& error = result.error();
        if (!error || error->code() == TarnSuccess) std::abort();  // a refusal names its reason
        return 0;
    }
    const TarnDataProtectionUpdate& update = *result;
    if (!TarnContainerClassIsValid(update.containerClass)) std::abort();
    const bool needsUser =
        TarnUserIdentity::isUserIdentityRequiredForContainerClass(update.containerClass);
    if (needsUser != static_cast<bool>(update.userIdentity)) std::abort();

    // Written back through an operation on the same container, it reads back alike.
    TarnUserIdentityRef owner =
        update.userIdentity ? update.userIdentity : TarnUserIdentityCache::defaultUserIdentity();
    auto identity = TarnConcreteContainerIdentity::containerIdentityWithUUID(
        Uuid::generate(), owner, update.identifier, update.containerClass);
    if (!identity.ok()) return 0;
    auto metadata =
        TarnMetadata::initWithContainerIdentity(*identity, std::nullopt, "/fuzz", std::nullopt);
    static DispatchQueueRef queue = DispatchQueue::createSerial("fuzz.pending");
    auto operation = TarnDataProtectionChangeOperation::initWithContainerMetadata(
        metadata, update.protectionClass, update.retryIfLocked, update.changeType,
        update.internalChangeID, queue, cache);
    // Change type 0 is never written; a name too long for the file system fails.
    if (!operation->_onQueue_writeToDiskWithError().ok()) return 0;
    const FileURL url =
        TarnDataProtectionChangeOperation::urlForProtectionOperationWithContainerIdentity(
            **identity);
    auto again =
        TarnDataProtectionChangeOperation::_readAndValidateDataProtectionUpdateAtURL(url, cache);
    if (!again.ok() || again->identifier != update.identifier ||
        again->containerClass != update.containerClass ||
        again->protectionClass != update.protectionClass ||
        again->changeType != update.changeType || again->retryIfLocked != update.retryIfLocked ||
        again->internalChangeID != update.internalChangeID ||
        static_cast<bool>(again->userIdentity) != needsUser ||
        (needsUser && again->userIdentity->identifier() != update.userIdentity->identifier()))
        std::abort();
    if (!TarnDataProtectionChangeOperation::deleteUpdateFileWithContainerIdentity(**identity).ok())
        std::abort();
    return 0;
}
