// The object through which every container operation is carried out, for one
// request (or, privileged, for the daemon's own work). It carries the caller's
// rights, its command queue and a per-connection cache of its lookup
// entitlement; it holds no container state of its own.
//
// Used from request threads; several connections run at once. One connection
// is used by one handler at a time, except the lookup-entitlement cache,
// which is safe across threads (two locks: lock_ first, then
// sanitizedLookupLock_, never both at once).
//
// Death row: whatever is to go is renamed into a unique directory inside the
// death-row directory (one rename, same volume) and destroyed later by a
// deletion pass on the serial death-row queue (TarnDeathRowQueue()). Passes
// run one after another, each listing death row afresh, under a process
// transaction. An item that cannot be removed is moved out of the way into
// the temporary directory under the root prefix. ENOENT counts as success
// wherever the aim is that an item be gone.
//
// Errors: every operation answers a TarnResult (Daemon/TarnResult.h) whose
// error carries the code the client gets; completeWithError() alone takes the
// request's error slot, where the request processor hands it over. No
// operation fences exceptions itself: the handler, the queued command and the
// death-row pass are the boundaries (Daemon/TarnExceptionFence.h).
#pragma once

#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <vector>

#include "Daemon/TarnClientIdentity.h"
#include "Daemon/TarnCommandQueue.h"
#include "Daemon/TarnContainerClass.h"
#include "Daemon/TarnContainerIdentity.h"
#include "Daemon/TarnError.h"
#include "Daemon/TarnMetadata.h"
#include "Daemon/TarnResult.h"
#include "Platform/Dispatch.h"
#include "Platform/Path.h"
#include "Platform/PropertyList.h"
#include "Platform/ThreadAnnotations.h"

namespace tarn {

class TarnUserIdentitySharedCache;

// What the lookup entitlement grants for one class.
using TarnLookupSet = std::shared_ptr<const std::set<std::string>>;

class TarnClientConnection {
  public:
    TarnClientConnection(TarnClientIdentityRef clientIdentity, bool entitled,
                         bool allowOtherIdLookup, bool unrestricted,
                         std::optional<PlistValue> lookup,
                         std::optional<PlistValue> entitledWipeIdentifiers,
                         std::shared_ptr<TarnCommandQueue> commandQueue);
    // The anonymous privileged connection.
    TarnClientConnection();

    static std::shared_ptr<TarnClientConnection> initWithClientIdentity(
        TarnClientIdentityRef clientIdentity, bool entitled, bool allowOtherIdLookup,
        bool unrestricted, std::optional<PlistValue> lookup,
        std::optional<PlistValue> entitledWipeIdentifiers,
        std::shared_ptr<TarnCommandQueue> commandQueue);
    // Privileged connections pass every lookup rule. `kernel`: made for the
    // kernel upcall service.
    static std::shared_ptr<TarnClientConnection> privilegedClientConnectionWithUserIdentity(
        std::shared_ptr<const TarnUserIdentity> userIdentity, bool kernel = false);
    // One process-wide anonymous privileged connection (boot work, data protection).
    static TarnClientConnection& sharedClientConnection();

    const TarnClientIdentityRef& clientIdentity() const { return clientIdentity_; }
    // Only the retry test acts as someone else (the anonymous privileged identity).
    void setClientIdentity(TarnClientIdentityRef clientIdentity) {
        clientIdentity_ = std::move(clientIdentity);
    }
    // The client identity's bundle identifier (not the stored field).
    std::string clientBundleIdentifier() const;
    void setClientBundleIdentifier(std::string clientBundleIdentifier) {
        clientBundleIdentifier_ = std::move(clientBundleIdentifier);
    }
    bool entitled() const { return entitled_; }
    bool allowOtherIdLookup() const { return allowOtherIdLookup_; }
    bool allowGroupIdLookup() const { return allowGroupIdLookup_; }
    bool unrestricted() const { return unrestricted_; }
    void setEntitled(bool value) { entitled_ = value; }
    void setAllowOtherIdLookup(bool value) { allowOtherIdLookup_ = value; }
    void setUnrestricted(bool value) { unrestricted_ = value; }
    // Only ever set to true (by the group lookup of an owner).
    void setAllowGroupIdLookup(bool value) { allowGroupIdLookup_ = value; }
    const std::shared_ptr<TarnCommandQueue>& commandQueue() const { return commandQueue_; }
    const std::optional<PlistValue>& lookup() const { return lookup_; }
    const std::optional<PlistValue>& entitledWipeIdentifiers() const {
        return entitledWipeIdentifiers_;
    }
    TarnUserIdentitySharedCache& userIdentityCache() const { return userIdentityCache_; }

    // ---- Lookup rules ----

    // The identifiers the lookup entitlement grants for the class; nullptr
    // when there is no entitlement or the class has no key (0, 14 and up).
    // A value that is not an array grants nothing (an empty set).
    TarnLookupSet _lookupForContainerClass(TarnContainerClass containerClass);
    bool isEntitledForLookupWithClass(TarnContainerClass containerClass,
                                      const std::string& identifier);
    // The string members of the array; others are dropped.
    static std::set<std::string> _setOfStringsFromArray(const PlistArray& array);

    // Whether the caller may look up (and create) a container of the class
    // with the identifier; a refusal is TarnErrorNotEntitled.
    TarnStatus _passesLookupRuleForContainerClass(TarnContainerClass containerClass,
                                                  const std::string& identifier);
    // The second gate of system data containers (class 12); other classes pass.
    TarnStatus _passesSystemDataGateForContainerClass(TarnContainerClass containerClass,
                                                      const std::string& identifier);
    // Whether the caller may list the groups of `ownerIdentifier`.
    TarnStatus _passesGroupOwnerRuleForContainerClass(TarnContainerClass groupContainerClass,
                                                      const std::string& ownerIdentifier);

    // ---- Death row ----

    // Renames the item into a new unique directory on death row; a missing
    // item succeeds without starting a pass. Fails with TarnErrorDeathRowMoveFailed.
    TarnStatus _moveItemAtURLToDeathRow(const FileURL& url, bool isDir, bool startDeletionThread);
    // The slot loop behind every move to death row: makes a unique directory
    // there and hands it to `moveInto`. ENOENT from it means the item left by
    // itself (`gone()`: success) or a pass removed the empty slot first
    // (another slot, up to three). Answers whether it moved the item (false:
    // it was gone). `url` names the item in the failure lines.
    static TarnResult<bool> _moveIntoDeathRowSlot(
        const FileURL& url, const std::function<TarnStatus(const FileURL&)>& moveInto,
        const std::function<bool()>& gone);
    // Queues a deletion pass and returns at once; `completion` (may be empty)
    // gets TarnSuccess, or the code of the pass's last failure
    // (TarnErrorDestroyFailed or TarnErrorDeleteFailed), on the death-row queue.
    void deleteContainersOnDeathRowWithCompletion(std::function<void(uint64_t)> completion);
    // Removes the item or, failing that, moves it into the temporary
    // directory under the root prefix (into a fresh unique directory there
    // when its name is taken). Fails with TarnErrorMoveFailed.
    static TarnStatus _removeItemOrMoveToTempAtURL(const FileURL& url);

    // ---- Create or look up ----

    // The container's metadata, created (staged, then renamed into place)
    // when missing and `createIfNecessary`. `existed()` of the result tells a
    // found container from a new one. With `useLocking` a lookup holds the
    // global read lock and a creation the global write lock; callers that
    // already hold the write lock pass false. Never answers a null record.
    TarnResult<TarnMetadataRef> createOrLookupContainerWithContainerIdentity(
        const TarnContainerIdentityRef& identity, bool createIfNecessary, bool transient,
        bool useLocking);
    // Every container of the class for the client's user identity.
    TarnResult<std::vector<TarnMetadataRef>> containersWithClass(TarnContainerClass containerClass,
                                                                 bool transient);
    TarnStatus _createTopLevelContainerDirectory(const FileURL& url,
                                                 TarnContainerClass containerClass, uint32_t owner);
    TarnStatus _createSubDirectories(const FileURL& url, const TarnMetadataRef& containerMetadata);
    static int _dataProtectionClassForContainerMetadata(const TarnMetadataRef& containerMetadata);

    // ---- Deletion ----

    // Looks the container up and queues its staged deletion on the command
    // queue; succeeds once it is queued.
    TarnStatus deleteContainerWithContainerIdentity(const TarnContainerIdentityRef& identity,
                                                    bool transient);

    // ---- Per-container operations (TarnClientConnectionOperations.cc) ----

    TarnResult<TarnMetadataRef> metadataWithContainerIdentity(
        const TarnConcreteContainerIdentityRef& identity);
    // `key` empty: the key was missing or not a string (TarnErrorBadInput).
    TarnResult<PlistValue> infoValueForKey(
        const std::optional<std::string>& key,
        const TarnConcreteContainerIdentityRef& containerIdentity, bool useLocking);
    // An empty `value` removes the key.
    TarnStatus setInfoValue(const std::optional<PlistValue>& value,
                            const std::optional<std::string>& forKey,
                            const TarnConcreteContainerIdentityRef& containerIdentity,
                            bool useLocking);
    TarnResult<uint64_t> diskUsageWithContainerIdentity(
        const TarnConcreteContainerIdentityRef& identity);
    TarnStatus recreateDefaultStructureWithContainerIdentity(
        const TarnConcreteContainerIdentityRef& identity);
    TarnStatus regenerateDirectoryUUIDWithContainerIdentity(
        const TarnConcreteContainerIdentityRef& identity);

    // ---- User-managed assets and shared content (TarnClientConnectionAssets.cc) ----

    struct AssetsPath {
        std::string path;      // absolute, or relative to the container ("Library/...")
        bool existed = false;  // the directory was there before this call
    };
    TarnResult<AssetsPath> userManagedAssetsPathWithContainerIdentity(
        const TarnContainerIdentityRef& identity, bool isRelative, bool createIfNecessary);
    // `relativePath` empty: the request's value was missing or not a string.
    TarnStatus deleteUserManagedAssetWithContainerIdentity(
        const TarnContainerIdentityRef& identity, const std::optional<std::string>& relativePath);
    // Answers where the content now is: the destination's absolute path.
    TarnResult<FileURL> stageSharedContentForIdentifier(
        const std::optional<std::string>& identifier,
        const std::optional<std::string>& sourceRelativePath,
        const std::optional<std::string>& destRelativePath);

    // ---- Group look-ups and the retry test (TarnClientConnectionGroups.cc) ----

    // Group identifier -> the group's container, created when missing; a group
    // whose container cannot be made is logged and left out. A caller that
    // fails the group-owner rule for `ownerIdentifier` gets
    // TarnErrorNotEntitled; one that passes may afterwards look up group
    // containers of any identifier (allowGroupIdLookup). Holds the global
    // write lock while it creates, so the caller must hold no identifier lock.
    TarnResult<std::map<std::string, TarnMetadataRef>> groupContainersForOwnerIdentifier(
        const std::string& ownerIdentifier, const TarnUserIdentityRef& userIdentity,
        TarnContainerClass groupContainerClass);
    // The retry-test container ("com.ostrea.retryTest", application data of
    // the personal persona) counts the crashes still to come in its info key
    // "CrashCounter". While one remains this ends the process (status 0,
    // after 2 s) and never returns; on the last request the container is
    // staged for deletion on the command queue. The connection acts as the
    // anonymous privileged one from here on. Internal builds only call it.
    TarnStatus retryTestWithNumCrashes(uint64_t numCrashes);

    // Runs the command queue until it is exhausted or a command fails; the
    // failing command's code goes into the request's error slot.
    bool completeWithError(uint64_t* error);

    // ---- Boot work run by start-up on the shared connection
    //      (TarnClientConnectionBoot.cc) ----
    // The set-ups run synchronously before the listener opens (the reboot
    // ones on the first start after boot only). The clean-ups return at once:
    // their work runs on the serial background queue, and each calls its
    // completion (may be empty) exactly once, after that work, failed or not,
    // inside a process transaction. None of them fails: failures are logged.
    void rebootKeeperSetup();
    void keeperSetup();
    void rebootKeeperCleanupWithCompletion(std::function<void()> completion);
    void keeperCleanupWithCompletion(std::function<void()> completion);
    // Gives every system (group) container of the connection's user a new
    // UUID directory, except the well-known ones (after a build upgrade).
    void _regenerateAllSystemContainerPaths();
    // Moves to death row every listed directory that is not a container of
    // the class with its metadata file. `directories` is a directory listing:
    // a failed one (ENOENT: silently) means nothing to do.
    void _cleanupOrphanedDataForDirectories(const TarnResult<std::vector<FileURL>>& directories,
                                            TarnContainerClass containerClass);
    void _cleanupOprhanedCodeSigningMappingData();
    // Queues _cleanupOrphanedDataForDirectories on the background queue; the
    // connection must outlive it (the shared one lives for the process).
    void _submitOrphanSweep(TarnResult<std::vector<FileURL>> directories,
                            TarnContainerClass containerClass);

    // ---- Replacement and its recovery (TarnClientConnectionReplace.cc) ----

    // The four places of one replacement, as its replace file records them:
    // where the old container lives (and must be back after a failure), where
    // the new one lives before, where the old one is parked meanwhile, and
    // where the new one ends up.
    struct ReplaceInfo {
        FileURL oldURL;
        FileURL newURL;
        FileURL stagingURL;
        FileURL destURL;
    };

    // Puts the container `newIdentity` in the place of `oldIdentity`; a null
    // `oldIdentity` promotes the new container into the permanent tree.
    // `preserveOldUUID`: the new container takes the old one's directory and
    // UUID. `startDeletionThread`: a death-row pass starts at the end.
    // Holds the global write lock throughout, so the caller holds no
    // identifier lock. Whatever moment the process dies at, the old container
    // is either back at its place or the new one has arrived at its own (the
    // replace file written first tells start-up recovery which).
    TarnStatus replaceContainerIdentity(const TarnConcreteContainerIdentityRef& oldIdentity,
                                        const TarnConcreteContainerIdentityRef& newIdentity,
                                        bool preserveOldUUID, bool startDeletionThread);
    // Writes the replace file atomically and durably (file and directory
    // synced). TarnErrorInvalidReplaceInfo for an empty URL, TarnErrorWriteFailed.
    static TarnStatus _writeToDiskReplaceAt(const FileURL& replaceURL, const FileURL& old,
                                            const FileURL& withNew, const FileURL& usingStaging,
                                            const FileURL& toDestination);
    // Reads one back: TarnErrorReplaceRecoveryFailed for a file that cannot be
    // read or does not hold the four absolute paths below the root prefix.
    static TarnResult<ReplaceInfo> _readAndValidateReplaceFileAtUrl(const FileURL& url);
    // The checks of the reader on a parsed file (`url` names it in messages).
    static TarnResult<ReplaceInfo> _validateReplaceDictionary(const PlistValue& root,
                                                              const FileURL& url);
    // Finishes or rolls back every replacement a previous run left behind.
    // Start-up only, before requests are served: it takes no lock.
    TarnStatus _recoverFromReplaceOperationsWithError();

    // ---- Wiping a data container (TarnClientConnectionWipe.cc) ----

    // Swaps a fresh container in for the data container `identity` (null: no
    // identifier), keeping its path and UUID; the old contents go to death
    // row and a deletion pass starts. A caller that is not unrestricted may
    // wipe only plug-in data containers named in its wipe entitlement.
    // Sets allowOtherIdLookup for the rest of the request.
    TarnStatus deleteDataContainerContentWithContainerIdentity(
        const TarnContainerIdentityRef& identity);

    static DispatchQueueRef _sharedBackgroundQueue();

  private:
    // The lookup entitlement's value for a class key, or nullptr.
    const PlistValue* lookupValueForKey(const std::string& key) const;
    bool _lookupRuleCommon(TarnContainerClass containerClass, const std::string& identifier,
                           bool withGroupRule);

    // Read-only after construction, except the rights a handler adjusts
    // (booleans, client bundle identifier, the retry test's client identity)
    // on the request's own thread.
    TarnClientIdentityRef clientIdentity_;
    bool entitled_;
    bool allowOtherIdLookup_;
    bool allowGroupIdLookup_ = false;
    bool unrestricted_;
    std::optional<PlistValue> lookup_;
    std::optional<PlistValue> entitledWipeIdentifiers_;
    std::shared_ptr<TarnCommandQueue> commandQueue_;
    DispatchQueueRef backgroundQueue_;
    TarnUserIdentitySharedCache& userIdentityCache_;
    std::string clientBundleIdentifier_;

    // The lookup-entitlement cache: created under lock_, filled under
    // sanitizedLookupLock_.
    Mutex lock_;
    Mutex sanitizedLookupLock_;
    bool sanitizedLookupCreated_ GUARDED_BY(lock_) = false;
    std::map<std::string, TarnLookupSet> sanitizedLookup_ GUARDED_BY(sanitizedLookupLock_);
};

}  // namespace tarn
