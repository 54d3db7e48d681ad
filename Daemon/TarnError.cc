#include "Daemon/TarnError.h"

#include <cstring>
#include <iterator>

#include "Platform/TarnErrorNames.h"

namespace tarn {

// The operator's name table (tarnctl, logs) and this enumeration are one list:
// every enumerator has its row under its own name, and no row is extra.
#define TARN_NAMED(e) static_assert(TarnErrorNameFor(e) && TarnErrorNameFor(e)->name == #e);
TARN_NAMED(TarnSuccess)
TARN_NAMED(TarnErrorMoveFailed)
TARN_NAMED(TarnErrorRemoveTransientFailed)
TARN_NAMED(TarnErrorCreateDirectoryFailed)
TARN_NAMED(TarnErrorCreateStagingFailed)
TARN_NAMED(TarnErrorMoveStagingFailed)
TARN_NAMED(TarnErrorRemoveStagingFailed)
TARN_NAMED(TarnErrorInvalidPath)
TARN_NAMED(TarnErrorInvalidArgument)
TARN_NAMED(TarnErrorReadFailed)
TARN_NAMED(TarnErrorReplaceStagingFailed)
TARN_NAMED(TarnErrorReplaceFailed)
TARN_NAMED(TarnErrorDestroyFailed)
TARN_NAMED(TarnErrorMissingIdentifier)
TARN_NAMED(TarnErrorInvalidContainerClass)
TARN_NAMED(TarnErrorNotFound)
TARN_NAMED(TarnErrorReplaceSameContainer)
TARN_NAMED(TarnErrorReplaceClassMismatch)
TARN_NAMED(TarnErrorInfoValueNotFound)
TARN_NAMED(TarnErrorAlreadyExists)
TARN_NAMED(TarnErrorDeleteFailed)
TARN_NAMED(TarnErrorInvalidMetadata)
TARN_NAMED(TarnErrorInvalidReplaceInfo)
TARN_NAMED(TarnErrorWriteFailed)
TARN_NAMED(TarnErrorReplaceRecoveryFailed)
TARN_NAMED(TarnErrorRemoveFileFailed)
TARN_NAMED(TarnErrorBadInput)
TARN_NAMED(TarnErrorException)
TARN_NAMED(TarnErrorDeathRowMoveFailed)
TARN_NAMED(TarnErrorCacheRebuildFailed)
TARN_NAMED(TarnErrorCacheInconsistent)
TARN_NAMED(TarnErrorCacheAddFailed)
TARN_NAMED(TarnErrorCacheRemoveFailed)
TARN_NAMED(TarnErrorCacheInvalidInput)
TARN_NAMED(TarnErrorUUIDMoveFailed)
TARN_NAMED(TarnErrorInvalidCommand)
TARN_NAMED(TarnErrorNotEntitled)
TARN_NAMED(TarnErrorMismatchedInput)
TARN_NAMED(TarnErrorLockedNotRetried)
TARN_NAMED(TarnErrorChangeOwnerFailed)
TARN_NAMED(TarnErrorACLFailed)
TARN_NAMED(TarnErrorStageMoveFailed)
TARN_NAMED(TarnErrorDatabase)
TARN_NAMED(TarnErrorDatabaseNotFound)
TARN_NAMED(TarnErrorDatabaseUnexpectedChanges)
TARN_NAMED(TarnErrorSuperseded)
TARN_NAMED(TarnErrorUserManagedPathNotFound)
TARN_NAMED(TarnErrorAllocationFailed)
TARN_NAMED(TarnErrorInvalidUserIdentityData)
TARN_NAMED(TarnErrorPersonaMismatch)
TARN_NAMED(TarnErrorQueueEmpty)
#undef TARN_NAMED
static_assert(std::size(kTarnErrorNames) == 51, "a row without an enumerator");

std::string TarnError::description() const {
    std::string out = Format("Error Domain=%@ Code=%llu", domain_, code_);
    if (description_) out += " \"" + *description_ + "\"";
    out += Format(" UserInfo={FunctionName=%@, SourceFileLine=%d", functionName_, sourceLine_);
    if (underlying_) out += ", UnderlyingError=" + underlying_->description();
    out += "}";
    return out;
}

TarnErrorRef TarnErrorMake(const char* functionName, int line, uint64_t code,
                           TarnErrorRef underlying, bool log,
                           std::optional<std::string> description) {
    const char* fn = functionName ? functionName : "";
    if (description && log) {
        if (underlying) {
            TarnLog(kLogError, fn, "%d: %@ (%@)", line, *description, underlying);
        } else {
            TarnLog(kLogError, fn, "%d: %@", line, *description);
        }
    }
    return std::make_shared<const TarnError>(kTarnErrorDomain, code, std::move(description),
                                             std::move(underlying), fn, line);
}

TarnErrorRef TarnPosixErrorMake(const char* functionName, int line, int err,
                                std::string description) {
    if (description.empty()) description = std::strerror(err);
    return std::make_shared<const TarnError>(kPosixErrorDomain, static_cast<uint64_t>(err),
                                             std::move(description), nullptr,
                                             functionName ? functionName : "", line);
}

}  // namespace tarn
