// TarnDataProtectionChangeOperation: one change of the data-protection class
// of a data container's user data, resumable across unlocks and restarts.
//
// Before it runs, the change is persisted as a pending-operation file in the
// global pending-updates directory, one per container identity, named
// "<identifier>-<class>-<user identity>.plist". A newer change of the same
// container overwrites that file and with it the internal change ID; that is
// how an older, still running operation learns it has been superseded
// (TarnErrorSuperseded, and it leaves the newer file alone). The file goes
// away when the operation ends, so a daemon that stops in between finds it at
// its next start-up and runs the change again.
//
// Threads: the pending file is written, read and deleted only on `queue` (the
// manager's serial file queue), synchronously from the operation's thread; the
// `_onQueue_` members must run there. performChangeOperation() runs on the
// caller's thread and, when it waits for an unlock, on the lock-state queue
// (TarnLockStateQueue(), suspended while the device is locked). A pass holds
// an identifier read lock on the container's UUID. Fields are set before the
// first performChangeOperation() and not changed afterwards, except `retried`,
// which only the lock-state queue touches.
//
// Lifetime: shared; a waiting retry keeps the operation alive.
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>

#include "Daemon/TarnContainerClass.h"
#include "Daemon/TarnContainerIdentity.h"
#include "Daemon/TarnMetadata.h"
#include "Daemon/TarnResult.h"
#include "Daemon/TarnUserIdentity.h"
#include "Platform/Dispatch.h"
#include "Platform/Path.h"
#include "Platform/PropertyList.h"

namespace tarn {

class TarnUserIdentityCache;

// Bits of a change type.
enum : uint32_t {
    kTarnChangeDirectories = 0x1,
    kTarnChangeFiles = 0x2,
    kTarnChangeFilesOnlyToStrongerClass = 0x4,
    kTarnChangeEverything =
        kTarnChangeDirectories | kTarnChangeFiles | kTarnChangeFilesOnlyToStrongerClass,
};

// Keys of the pending-operation file.
inline constexpr const char* kTarnDataOperationIdentifierKey = "TarnDataOperationIdentifier";
inline constexpr const char* kTarnDataOperationContainerClassKey =
    "TarnDataOperationContainerClass";
inline constexpr const char* kTarnDataOperationProtectionClassKey =
    "TarnDataOperationProtectionClass";
inline constexpr const char* kTarnDataOperationChangeTypeKey = "TarnDataOperationChangeType";
inline constexpr const char* kTarnDataOperationRetryIfLockedKey = "TarnDataOperationRetryIfLocked";
inline constexpr const char* kTarnDataOperationInternalIDKey = "TarnDataOperationInternalID";
inline constexpr const char* kTarnDataOperationUserIdentityKey = "TarnDataOperationUserIdentity";
// Files of the older format name the owner by user id only.
inline constexpr const char* kTarnDataOperationUserIdKey = "TarnDataOperationUserId";

// A pending-operation file, read and checked.
struct TarnDataProtectionUpdate {
    std::string identifier;
    TarnContainerClass containerClass = 0;
    // Resolved; null for classes that need no user identity.
    TarnUserIdentityRef userIdentity;
    // "TarnDataOperationUserId" of an older file, for messages.
    std::optional<uint64_t> legacyUserId;
    int32_t protectionClass = 0;
    uint32_t changeType = 0;
    bool retryIfLocked = false;
    Uuid internalChangeID;
};

class TarnDataProtectionChangeOperation;
using TarnDataProtectionChangeOperationRef = std::shared_ptr<TarnDataProtectionChangeOperation>;

class TarnDataProtectionChangeOperation
    : public std::enable_shared_from_this<TarnDataProtectionChangeOperation> {
    struct PrivateTag {};

  public:
    // Called once, when the operation ends: whether the device was locked,
    // and the error (null on success).
    using CompletionBlock = std::function<void(bool wasLocked, const TarnErrorRef& error)>;
    // Called before the first run after an unlock.
    using RetryStartBlock = std::function<void()>;

    // With the shared user identity cache and a new internal ID.
    static TarnDataProtectionChangeOperationRef dataProtectionChangeOperationWithContainerMetadata(
        TarnMetadataRef metadata, int32_t settingClass, bool retryingIfLocked, uint32_t changeType,
        DispatchQueueRef queue);
    // A null `internalChangeID` gets a new random one.
    static TarnDataProtectionChangeOperationRef initWithContainerMetadata(
        TarnMetadataRef metadata, int32_t newClass, bool retryingIfLocked, uint32_t changeType,
        std::optional<Uuid> internalChangeID, DispatchQueueRef queue,
        TarnUserIdentityCache& userIdentityCache);
    // Rebuilds the operation a pending file describes; the container must
    // still exist (TarnErrorNotFound otherwise).
    static TarnResult<TarnDataProtectionChangeOperationRef> dataProtectionChangeOperationAtURL(
        const FileURL& url, DispatchQueueRef queue);

    // The pending file of an identity. Characters that would leave the
    // directory ('/', and '%' that escapes them, and NUL) are percent-encoded.
    static FileURL urlForProtectionOperationWithContainerIdentity(
        const TarnContainerIdentity& identity);
    // Removes an identity's pending file (missing is fine). Call on the queue.
    static TarnStatus deleteUpdateFileWithContainerIdentity(const TarnContainerIdentity& identity);
    // Reads and checks a pending file: TarnErrorReadFailed when it cannot be
    // read as a dictionary, TarnErrorInvalidMetadata for a bad entry,
    // TarnErrorBadInput without URL.
    static TarnResult<TarnDataProtectionUpdate> _readAndValidateDataProtectionUpdateAtURL(
        const FileURL& url, TarnUserIdentityCache& userIdentityCache);
    // The checks alone, on a file's bytes (`path` names it in messages).
    static TarnResult<TarnDataProtectionUpdate> _validateDataProtectionUpdate(
        const std::string& bytes, const FileURL& path, TarnUserIdentityCache& userIdentityCache);

    // Each runs its _onQueue_ twin synchronously on `queue`.
    TarnStatus writeToDiskWithError();
    bool _stillMostCurrentUpdate();
    TarnStatus _deleteUpdateFileWithError();
    TarnStatus _onQueue_writeToDiskWithError();
    bool _onQueue_stillMostCurrentUpdate();
    TarnStatus _onQueue_deleteUpdateFileWithError();

    // Runs the change. Ends with the completion block, or, locked with
    // retryIfLocked, with a run queued for the next unlock.
    void performChangeOperation();
    // One pass over the container's user data; the value is whether the
    // device was locked (the pass then stopped at the item it could not set).
    TarnResult<bool> _runChangeOperationNeedToRetry();

    bool retryIfLocked() const { return retryIfLocked_; }
    bool retried() const { return retried_; }
    int32_t newDataProtectionClass() const { return newDataProtectionClass_; }
    uint32_t changeType() const { return changeType_; }
    const TarnMetadataRef& dataContainerMetadata() const { return dataContainerMetadata_; }
    const Uuid& internalChangeID() const { return internalChangeID_; }
    const DispatchQueueRef& queue() const { return queue_; }
    void setRetryStartBlock(RetryStartBlock block) { retryStartBlock_ = std::move(block); }
    void setCompletionBlock(CompletionBlock block) { completionBlock_ = std::move(block); }

    TarnDataProtectionChangeOperation(PrivateTag, TarnMetadataRef metadata, int32_t newClass,
                                      bool retryIfLocked, uint32_t changeType,
                                      Uuid internalChangeID, DispatchQueueRef queue,
                                      TarnUserIdentityCache& userIdentityCache);

  private:
    // "user: %@, id: %@, containerClass: %llu" of the log lines.
    std::string describeContainer() const;
    FileURL url() const;

    const bool retryIfLocked_;
    bool retried_ = false;  // lock-state queue only
    const int32_t newDataProtectionClass_;
    const uint32_t changeType_;
    const TarnMetadataRef dataContainerMetadata_;
    RetryStartBlock retryStartBlock_;
    CompletionBlock completionBlock_;
    const Uuid internalChangeID_;
    const DispatchQueueRef queue_;
    TarnUserIdentityCache& userIdentityCache_;
};

}  // namespace tarn
