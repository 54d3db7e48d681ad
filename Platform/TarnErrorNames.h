// The daemon's error codes by name and meaning, one row per code of
// "TarnErrorDomain". Header-only so that tarnctl (which links only the
// platform library) and the daemon read the same table; the enumeration in
// Daemon/TarnError.h is checked against it at compile time.
//
// `label` is the short name an operator reads ("not entitled"), `meaning` one
// line on what went wrong.
#pragma once

#include <cstdint>
#include <string>
#include <string_view>

namespace tarn {

struct TarnErrorName {
    uint64_t code;
    std::string_view name;
    std::string_view label;
    std::string_view meaning;
};

inline constexpr TarnErrorName kTarnErrorNames[] = {
    {1, "TarnSuccess", "success", "no error"},
    {4, "TarnErrorMoveFailed", "move failed", "an item could not be moved aside before removal"},
    {5, "TarnErrorRemoveTransientFailed", "remove transient failed",
     "an existing transient container could not be removed"},
    {6, "TarnErrorCreateDirectoryFailed", "create directory failed",
     "a container subdirectory or the assets directory could not be made, or its owner or mode "
     "set"},
    {7, "TarnErrorCreateStagingFailed", "create staging failed",
     "the staging directory of a new container could not be created"},
    {8, "TarnErrorMoveStagingFailed", "move staging failed",
     "a staged container could not be moved to its live place"},
    {9, "TarnErrorRemoveStagingFailed", "remove staging failed",
     "a staging directory could not be removed after creation failed"},
    {10, "TarnErrorInvalidPath", "invalid path",
     "a path is outside what is allowed (not below the container, a link or \"..\", no real path)"},
    {11, "TarnErrorInvalidArgument", "invalid argument",
     "an object or input cannot be acted on (class, identity, UUID or value of the wrong kind)"},
    {12, "TarnErrorReadFailed", "read failed",
     "a metadata file or a data-protection update file could not be read"},
    {14, "TarnErrorReplaceStagingFailed", "replace staging failed",
     "the old container could not be moved to staging during a replace"},
    {15, "TarnErrorReplaceFailed", "replace failed", "the replace move itself failed"},
    {17, "TarnErrorDestroyFailed", "destroy failed", "an item on death row could not be destroyed"},
    {18, "TarnErrorMissingIdentifier", "missing identifier", "the request names no identifier"},
    {20, "TarnErrorInvalidContainerClass", "invalid container class",
     "a container class outside 1 to 13, or one the operation does not accept"},
    {21, "TarnErrorNotFound", "not found",
     "no container, parent, system group container or code-signing information for it"},
    {22, "TarnErrorReplaceSameContainer", "replace same container",
     "a container cannot replace itself"},
    {23, "TarnErrorReplaceClassMismatch", "replace class mismatch",
     "containers of different classes cannot replace each other"},
    {24, "TarnErrorInfoValueNotFound", "info value not found",
     "no metadata info value under the key"},
    {27, "TarnErrorAlreadyExists", "already exists", "the container to create already exists"},
    {28, "TarnErrorDeleteFailed", "delete failed",
     "a container could not be deleted, or the items for deletion could not be listed"},
    {29, "TarnErrorInvalidMetadata", "invalid metadata",
     "a field of a metadata or data-protection update file is missing or wrong"},
    {33, "TarnErrorInvalidReplaceInfo", "invalid replace info",
     "a replace record cannot be written because a path is missing"},
    {34, "TarnErrorWriteFailed", "write failed",
     "a metadata, replace or data-protection update file could not be written or moved into place"},
    {35, "TarnErrorReplaceRecoveryFailed", "replace recovery failed",
     "a replace record is unreadable or invalid, or a replace could not be rolled back"},
    {36, "TarnErrorRemoveFileFailed", "remove file failed",
     "a replace record, pending data-protection file or staging directory could not be removed"},
    {38, "TarnErrorBadInput", "bad input",
     "an argument is missing or not allowed (nil key, \"..\", mismatched counts, out of range)"},
    {40, "TarnErrorException", "exception", "an exception was caught while serving the request"},
    {41, "TarnErrorDeathRowMoveFailed", "death row move failed",
     "an item could not be moved to death row, or an asset could not be removed"},
    {43, "TarnErrorCacheRebuildFailed", "cache rebuild failed",
     "the container cache could not be rebuilt"},
    {44, "TarnErrorCacheInconsistent", "cache inconsistent",
     "the cache found a container directory without metadata"},
    {45, "TarnErrorCacheAddFailed", "cache add failed",
     "a container could not be added to the cache"},
    {46, "TarnErrorCacheRemoveFailed", "cache remove failed",
     "a container could not be removed from the cache"},
    {47, "TarnErrorCacheInvalidInput", "cache invalid input",
     "the cache was given an invalid URL, identifier or content class"},
    {48, "TarnErrorUUIDMoveFailed", "UUID move failed",
     "a container directory could not be moved to its new UUID directory"},
    {49, "TarnErrorInvalidCommand", "invalid command", "unknown or unsupported command"},
    {55, "TarnErrorNotEntitled", "not entitled",
     "the client is not entitled for the command or the container"},
    {60, "TarnErrorMismatchedInput", "mismatched input",
     "code-signing values and identifiers differ in count"},
    {61, "TarnErrorLockedNotRetried", "locked, not retried",
     "a data-protection change met a locked device and was not to be retried"},
    {62, "TarnErrorChangeOwnerFailed", "change owner failed",
     "the owner of a bundle container could not be changed during migration"},
    {63, "TarnErrorACLFailed", "ACL failed", "an access-control list could not be built or set"},
    {64, "TarnErrorStageMoveFailed", "stage move failed",
     "shared content could not be moved into place"},
    {66, "TarnErrorDatabase", "database", "a database statement failed"},
    {67, "TarnErrorDatabaseNotFound", "database not found",
     "the database has no row for the identifier, parent or children"},
    {68, "TarnErrorDatabaseUnexpectedChanges", "database unexpected changes",
     "a statement changed a different number of rows than expected"},
    {69, "TarnErrorSuperseded", "superseded",
     "a data-protection change was cancelled by a newer change of the same container"},
    {71, "TarnErrorUserManagedPathNotFound", "user-managed path not found",
     "the user-managed assets path does not exist and was not to be created"},
    {73, "TarnErrorAllocationFailed", "allocation failed",
     "an object or string could not be allocated"},
    {75, "TarnErrorInvalidUserIdentityData", "invalid user identity data",
     "a stored user identity record has a field of the wrong type"},
    {76, "TarnErrorPersonaMismatch", "persona mismatch",
     "the persona is ambiguous, unknown, not valid for this client, or differs between containers"},
    {77, "TarnErrorQueueEmpty", "queue empty",
     "the request's command queue has no command left (internal, counts as success)"},
};

// The row of `code`, or null for a number the table skips.
constexpr const TarnErrorName* TarnErrorNameFor(uint64_t code) {
    for (const TarnErrorName& row : kTarnErrorNames)
        if (row.code == code) return &row;
    return nullptr;
}

// "55 not entitled: the client is not entitled ..."; an unassigned number
// reads "N unknown error: not a code of this daemon".
inline std::string TarnErrorSummary(uint64_t code) {
    const TarnErrorName* row = TarnErrorNameFor(code);
    std::string text = std::to_string(code);
    text += ' ';
    text += row ? row->label : std::string_view("unknown error");
    text += ": ";
    text += row ? row->meaning : std::string_view("not a code of this daemon");
    return text;
}

}  // namespace tarn
