// Errors of the daemon's own domain, "TarnErrorDomain", and POSIX errors.
//
// A code travels alone in an error slot (uint64_t, TarnSuccess until something fails)
// or inside a TarnError value that also records where it was made. Only the
// code ever reaches a client. TarnErrorRef values are immutable and shared.
#pragma once

#include <cerrno>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>

#include "Daemon/TarnLog.h"
#include "Platform/Format.h"

namespace tarn {

enum TarnErrorCode : uint64_t {
    TarnSuccess = 1,
    TarnErrorMoveFailed = 4,
    TarnErrorRemoveTransientFailed = 5,
    TarnErrorCreateDirectoryFailed = 6,
    TarnErrorCreateStagingFailed = 7,
    TarnErrorMoveStagingFailed = 8,
    TarnErrorRemoveStagingFailed = 9,
    TarnErrorInvalidPath = 10,
    TarnErrorInvalidArgument = 11,
    TarnErrorReadFailed = 12,
    TarnErrorReplaceStagingFailed = 14,
    TarnErrorReplaceFailed = 15,
    TarnErrorDestroyFailed = 17,
    TarnErrorMissingIdentifier = 18,
    TarnErrorInvalidContainerClass = 20,
    TarnErrorNotFound = 21,
    TarnErrorReplaceSameContainer = 22,
    TarnErrorReplaceClassMismatch = 23,
    TarnErrorInfoValueNotFound = 24,
    TarnErrorAlreadyExists = 27,
    TarnErrorDeleteFailed = 28,
    TarnErrorInvalidMetadata = 29,
    TarnErrorInvalidReplaceInfo = 33,
    TarnErrorWriteFailed = 34,
    TarnErrorReplaceRecoveryFailed = 35,
    TarnErrorRemoveFileFailed = 36,
    TarnErrorBadInput = 38,
    TarnErrorException = 40,
    TarnErrorDeathRowMoveFailed = 41,
    TarnErrorCacheRebuildFailed = 43,
    TarnErrorCacheInconsistent = 44,
    TarnErrorCacheAddFailed = 45,
    TarnErrorCacheRemoveFailed = 46,
    TarnErrorCacheInvalidInput = 47,
    TarnErrorUUIDMoveFailed = 48,
    TarnErrorInvalidCommand = 49,
    TarnErrorNotEntitled = 55,
    TarnErrorMismatchedInput = 60,
    TarnErrorLockedNotRetried = 61,
    TarnErrorChangeOwnerFailed = 62,
    TarnErrorACLFailed = 63,
    TarnErrorStageMoveFailed = 64,
    TarnErrorDatabase = 66,
    TarnErrorDatabaseNotFound = 67,
    TarnErrorDatabaseUnexpectedChanges = 68,
    TarnErrorSuperseded = 69,
    TarnErrorUserManagedPathNotFound = 71,
    TarnErrorAllocationFailed = 73,
    TarnErrorInvalidUserIdentityData = 75,
    TarnErrorPersonaMismatch = 76,
    TarnErrorQueueEmpty = 77,
};

inline constexpr const char* kTarnErrorDomain = "TarnErrorDomain";
inline constexpr const char* kPosixErrorDomain = "PosixErrorDomain";

class TarnError;
using TarnErrorRef = std::shared_ptr<const TarnError>;

class TarnError {
public:
    TarnError(std::string domain, uint64_t code, std::optional<std::string> description,
              TarnErrorRef underlying, std::string functionName, int sourceLine)
        : domain_(std::move(domain)),
          code_(code),
          description_(std::move(description)),
          underlying_(std::move(underlying)),
          functionName_(std::move(functionName)),
          sourceLine_(sourceLine) {}

    const std::string& domain() const { return domain_; }
    uint64_t code() const { return code_; }
    bool isPosix() const { return domain_ == kPosixErrorDomain; }
    bool isTarn() const { return domain_ == kTarnErrorDomain; }
    // The system error number of a POSIX error, 0 otherwise.
    int posixCode() const { return isPosix() ? static_cast<int>(code_) : 0; }
    const std::optional<std::string>& localizedDescription() const { return description_; }
    const TarnErrorRef& underlyingError() const { return underlying_; }
    const std::string& functionName() const { return functionName_; }
    int sourceFileLine() const { return sourceLine_; }

    // "Error Domain=D Code=N "desc" UserInfo={FunctionName=..., SourceFileLine=...}"
    std::string description() const;

private:
    std::string domain_;
    uint64_t code_;
    std::optional<std::string> description_;
    TarnErrorRef underlying_;
    std::string functionName_;
    int sourceLine_;
};

// Makes a domain error. With a description and `log`, writes one level-3 line
// tagged with the function name: "%d: %@ (%@)" with an underlying error,
// "%d: %@" without. Without a description nothing is logged.
TarnErrorRef TarnErrorMake(const char* functionName, int line, uint64_t code,
                           TarnErrorRef underlying, bool log,
                           std::optional<std::string> description);
TarnErrorRef TarnPosixErrorMake(const char* functionName, int line, int err,
                                std::string description);

// The code a handler copies into its error slot after a failure: the domain
// code, or the fallback given for a foreign error or none at all (a failure
// must never read as success).
inline uint64_t TarnErrorCodeOf(const TarnErrorRef& e, uint64_t fallback) {
    return e && e->isTarn() ? e->code() : fallback;
}

// Writes `code` into an optional error slot (no-op for a null slot).
inline void TarnSetError(uint64_t* slot, uint64_t code) {
    if (slot) *slot = code;
}

}  // namespace tarn

// Domain error with a formatted description, logged at level 3.
#define TARN_ERROR(code, underlying, fmt, ...)                                               \
    ::tarn::TarnErrorMake(__func__, __LINE__, (code), (underlying), true,                     \
                          ::tarn::Format((fmt)__VA_OPT__(, ) __VA_ARGS__))
// Same, under an operation's name given explicitly: inside a lambda or a
// private helper __func__ names those, not the operation.
#define TARN_ERROR_IN(function, code, underlying, fmt, ...)                                  \
    ::tarn::TarnErrorMake((function), __LINE__, (code), (underlying), true,                   \
                          ::tarn::Format((fmt)__VA_OPT__(, ) __VA_ARGS__))
#define TARN_ERROR_SILENT_IN(function, code, underlying, fmt, ...)                           \
    ::tarn::TarnErrorMake((function), __LINE__, (code), (underlying), false,                  \
                          ::tarn::Format((fmt)__VA_OPT__(, ) __VA_ARGS__))
// Same, not logged.
#define TARN_ERROR_SILENT(code, underlying, fmt, ...)                                        \
    ::tarn::TarnErrorMake(__func__, __LINE__, (code), (underlying), false,                    \
                          ::tarn::Format((fmt)__VA_OPT__(, ) __VA_ARGS__))
// Domain error without description (never logged).
#define TARN_ERROR_CODE(code, underlying) \
    ::tarn::TarnErrorMake(__func__, __LINE__, (code), (underlying), false, std::nullopt)
#define TARN_ERROR_CODE_IN(function, code, underlying) \
    ::tarn::TarnErrorMake((function), __LINE__, (code), (underlying), false, std::nullopt)
// POSIX error value for `err` (an errno value).
#define TARN_POSIX_ERROR(err, fmt, ...) \
    ::tarn::TarnPosixErrorMake(__func__, __LINE__, (err), ::tarn::Format((fmt)__VA_OPT__(, ) __VA_ARGS__))
#define TARN_POSIX_ERROR_IN(function, err, fmt, ...) \
    ::tarn::TarnPosixErrorMake((function), __LINE__, (err), ::tarn::Format((fmt)__VA_OPT__(, ) __VA_ARGS__))
