// The code-signing mapping: per code-signing identifier, the code-signing
// information and entitlements the installer (or the client itself) gave the
// daemon, kept in TarnSQLiteDB, and the answers derived from them (group
// identifiers, system container, data-container class, parent and children).
//
// Concurrency: every store access runs on the mapping's one serial queue,
// "com.ostrea.TarnKeeper.EntitlementQueue". Public operations enter it
// synchronously, so they must not be called from it (that would deadlock;
// it is checked in every build, and stops the process). `_onQueue_`
// operations must run on it. Work on the queue runs strictly one item at a
// time in submission order, so a read never sees half of a write.
//
// Lifetime: the shared instance is made on first use and lives for the whole
// process. Entries handed out are immutable snapshots.
//
// Views: internal reads answer an entry's information whatever its flags;
// external reads (answers that leave the daemon) answer nothing for a
// placeholder, an advance copy or an invalidated entry.
//
// Errors: operations that can fail answer a TarnResult (Daemon/TarnResult.h)
// carrying the store's error values unchanged (TarnSQLiteDB.h lists them).
// Reads that answer a plain value treat a failure as "none" after logging it.
//
// Locks: processCallerRegisteredEntitlements() and
// invalidateCodeSigningInfoForAppsWithoutBundleContainer() take the global
// identifier write lock (gTarnLocks), so their callers must hold no global or
// identifier lock. The container cache is called only off the queue (its lock
// comes before the queue).
#pragma once

#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <string_view>
#include <unordered_map>
#include <vector>

#include "Daemon/TarnCodeSigningEntry.h"
#include "Daemon/TarnContainerClass.h"
#include "Daemon/TarnError.h"
#include "Daemon/TarnMetadata.h"
#include "Daemon/TarnRequestContext.h"
#include "Daemon/TarnResult.h"
#include "Daemon/TarnUserIdentity.h"
#include "Platform/Dispatch.h"
#include "Platform/Path.h"
#include "Platform/PropertyList.h"
#include "Platform/ThreadAnnotations.h"

namespace tarn {

class TarnSQLiteDB;
class TarnCommandQueue;
class TarnClientConnection;
class TarnUserIdentitySharedCache;

// Group type: which entitlement names the groups and which class their containers have.
enum TarnGroupType : uint64_t {
    TarnGroupTypeApplication = 0,  // class 7
    TarnGroupTypeSystem = 1,       // class 13
};

inline constexpr const char* kTarnApplicationGroupsEntitlement = "com.ostrea.security.application-groups";
inline constexpr const char* kTarnSystemGroupsEntitlement = "com.ostrea.security.system-groups";
inline constexpr const char* kTarnSystemGroupContainersEntitlement =
    "com.ostrea.security.system-group-containers";
inline constexpr const char* kTarnSystemContainerEntitlement = "com.ostrea.security.system-container";
inline constexpr const char* kTarnSystemGroupPrefix = "systemgroup.";

// A multiset of group identifiers: how many stored entries name each group.
class TarnCountedSet {
public:
    void addObject(const std::string& object) { ++counts_[object]; }
    // Decreases the count by one; a count of zero removes the object.
    void removeObject(std::string_view object);
    size_t countForObject(std::string_view object) const;
    // Number of distinct objects.
    size_t count() const { return counts_.size(); }
    const std::map<std::string, size_t, std::less<>>& counts() const { return counts_; }

private:
    std::map<std::string, size_t, std::less<>> counts_;
};

class TarnCodeSigningMapping {
public:
    // The one mapping; empty when its store could not be made (a later call
    // tries again).
    static TarnCodeSigningMapping* sharedInstance();
    // Tests: replaces the shared instance (empty: the next call makes a new one).
    // The one replaced stays alive for the rest of the process.
    static void TEST_setSharedInstance(std::unique_ptr<TarnCodeSigningMapping> mapping);

    // initWithUserIdentityCache:queue:mappingDB: imports the legacy mapping
    // file from the library directory into the store on `queue` before it
    // returns. `userIdentityCache` (not owned, may be null in tests that do no
    // group clean-up) must outlive the mapping.
    TarnCodeSigningMapping(TarnUserIdentitySharedCache* userIdentityCache, DispatchQueueRef queue,
                           std::unique_ptr<TarnSQLiteDB> mappingDB);
    ~TarnCodeSigningMapping();
    TarnCodeSigningMapping(const TarnCodeSigningMapping&) = delete;
    TarnCodeSigningMapping& operator=(const TarnCodeSigningMapping&) = delete;

    const DispatchQueueRef& queue() const { return queue_; }
    // Only to be used on queue(); a change made through it calls
    // _onQueue_storeWillChange() first.
    TarnSQLiteDB* codeSigningMappingDB() const { return codeSigningMappingDB_.get(); }
    TarnUserIdentitySharedCache* userIdentityCache() const { return userIdentityCache_; }

    // ---- reads ----

    // Entitlements for the daemon's own decisions (internal view); empty when
    // none. On a miss, code-signing info still cached in the metadata of the
    // identifier's application bundle container is stored (data-container
    // class 2) and answered.
    std::optional<PlistDict> entitlementsForIdentifier(const std::string& identifier);
    // The code-signing info as a client may see it (external view); empty when none.
    std::optional<PlistDict> getCodeSigningInfoForIdentifier(const std::string& identifier);
    // The stored entry (never empty), or TarnErrorDatabaseNotFound when there is none.
    TarnResult<TarnCodeSigningEntryRef> codeSigningEntryForIdentifier(const std::string& identifier);
    std::optional<std::vector<std::string>> appGroupIdentifiersForIdentifier(const std::string& identifier);
    // Only identifiers with the "systemgroup." prefix.
    std::optional<std::vector<std::string>> systemGroupIdentifiersForIdentifier(const std::string& identifier);
    bool identifierHasSystemContainer(const std::string& identifier);
    bool identifierHasCallerRegisteredEntitlements(const std::string& identifier);
    // 0 when unknown.
    uint64_t dataContainerTypeForIdentifier(const std::string& identifier);
    // Empty when the identifier is nobody's child.
    std::string parentIdentifierForChildIdentifier(const std::string& identifier);
    std::vector<std::string> childBundleIdentifiersForParentIdentifier(const std::string& identifier);
    TarnResult<std::set<std::string>> identifiersWithError();
    // How many stored entries (invalid, placeholder and advance copies included)
    // name each group of the type.
    TarnCountedSet copyReferenceCountSetOfType(TarnGroupType type);

    // ---- changes ----

    // Option keys of processCodeSigningInfo().
    static constexpr const char* kOptionDataContainerClass =
        "com.ostrea.TarnKeeper.DataContainerClass";
    static constexpr const char* kOptionParentBundleID = "com.ostrea.TarnKeeper.ParentBundleID";
    static constexpr const char* kOptionRegisteredByCaller = "RegByCaller";
    static constexpr const char* kOptionPlaceholder =
        "com.ostrea.TarnKeeper.PlaceholderEntitlements";
    static constexpr const char* kOptionAdvanceCopy = "com.ostrea.TarnKeeper.AdvanceCopy";
    // The key of the code-signing info that holds the entitlements.
    static constexpr const char* kEntitlementsKey = "com.ostrea.TarnKeeper.Entitlements";

    // Records the installer's (or a caller's) code-signing info for the
    // identifier; empty info removes the identifier's record. Group and
    // system containers the new entitlements no longer claim are staged for
    // deletion on `commandQueue` (null: none are staged), to run after the
    // mapping work. The old entitlements are read first, outside the queue.
    // Info equal to what is stored writes nothing and stages nothing. Fails
    // only for a missing identifier, an unreadable record (its error) or an
    // exception (TarnErrorException); a failed store write is logged only.
    TarnStatus processCodeSigningInfo(const std::optional<PlistDict>& codeSigningInfo,
                                      const std::string& forIdentifier,
                                      const PlistDict& withOptions, TarnCommandQueue* commandQueue);
    // Under the global write lock: invalidates, with its children, every
    // entry whose identifier has no bundle container (class 1, 3 or 5),
    // except caller-registered ones and plug-ins with a parent. Fails only
    // when the identifiers cannot be listed; a failed invalidation is logged
    // and the others are still checked.
    TarnStatus invalidateCodeSigningInfoForAppsWithoutBundleContainer();

    TarnStatus invalidateCodeSigningInfoForIdentifier(const std::string& identifier);
    TarnStatus invalidateCodeSigningInfoForIdentifierAndItsChildren(const std::string& identifier);
    TarnStatus removeAllAdvanceCopiesWithError();
    // Processes empty info for each of the identifier's children, then for the
    // identifier itself: their records go, and the group and system
    // containers they alone claimed are staged for deletion on `commandQueue`.
    // A failure is logged and the others are still removed.
    void removeCodeSigningDictionariesForIdentifierAndItsChildren(const std::string& identifier,
                                                                  TarnCommandQueue* commandQueue);
    // A connecting client's own entitlements, offered on every admitted
    // request. Registers them (under the global write lock) unless the
    // installer's info is stored for the identifier or the same entitlements
    // are already registered. Answered from a memo, with no store read and no
    // queue hop, while nothing in the store has changed since the identifier
    // was last found registered with these entitlements (or installer-owned).
    TarnStatus processCallerRegisteredEntitlements(const PlistDict& entitlements,
                                                   const std::string& forIdentifier,
                                                   TarnCommandQueue* commandQueue);

    // ---- helpers on entitlements (no store access) ----

    // The list under `groupKey`: an array of strings as it is, one string as a
    // one-element list, anything else (or an array holding a non-string) empty.
    static std::optional<std::vector<std::string>> _copyApplicationGroupEntitlementForIdentifier(
        const std::string& identifier, const PlistDict* entitlements, const char* groupKey);
    static std::optional<std::vector<std::string>> _appGroupIdentifiersForIdentifier(
        const std::string& identifier, const PlistDict* entitlements);
    static std::optional<std::vector<std::string>> _systemGroupIdentifiersForIdentifier(
        const std::string& identifier, const PlistDict* entitlements);
    static bool _entitlementsHasSystemContainer(const PlistDict* entitlements);
    static const PlistDict* _entitlementsFromCodeSigningEntry(const TarnCodeSigningEntryRef& entry);
    static const std::optional<PlistDict>& _codeSigningInfoForCodeSigningEntry(
        const TarnCodeSigningEntryRef& entry, bool externalRequest);

    // ---- on the queue ----

    // Steps of processCodeSigningInfo() after the old entitlements are read;
    // an exception inside is fenced here.
    TarnStatus _onQueue_processCodeSigningInfo(const std::optional<PlistDict>& codeSigningInfo,
                                               const std::string& forIdentifier,
                                               const PlistDict& withOptions,
                                               const std::optional<PlistDict>& oldEntitlements,
                                               TarnCommandQueue* commandQueue);

    // Step of processing: stages the deletion of the identifier's system
    // container (class 12), with locking, on `commandQueue`.
    void _onQueue_stageSystemContainerForDelete(const std::string& identifier,
                                                TarnCommandQueue* commandQueue);

    // ---- group containers (TarnCodeSigningMappingGroups.cc) ----

    // Called while new info is processed, before its entry is written: the
    // groups the old list names and the new one does not lose a reference.
    void _onQueue_handleChangeFromOldGroupContainerIds(
        const std::optional<std::vector<std::string>>& oldGroupContainerIds,
        const std::optional<std::vector<std::string>>& toNewGroupContainerIds, TarnGroupType ofType,
        TarnCommandQueue* commandQueue);
    void _onQueue_removeReferenceForGroupIdentifiers(
        const std::vector<std::string>& groupIdentifiers, TarnGroupType ofType,
        TarnCommandQueue* commandQueue);
    // Stages the deletion of each group whose only reference left is the
    // changing identifier's own (count 1), for one user; counts go down as
    // the list is walked.
    void _onQueue_removeGroupContainersIfNeededforUserIdentity(
        const TarnUserIdentityRef& userIdentity, TarnContainerClass groupContainerClass,
        const std::vector<std::string>& identifiers, TarnCountedSet& referenceCounts,
        TarnCommandQueue* commandQueue);

    // Logs a failure other than TarnErrorDatabaseNotFound before answering it.
    TarnResult<TarnCodeSigningEntryRef> _onQueue_codeSigningEntryForIdentifier(const std::string& identifier);
    std::optional<PlistDict> _onQueue_codeSigningInfoForIdentifier(const std::string& identifier,
                                                                   bool externalRequest);
    std::optional<PlistDict> _onQueue_entitlementsForIdentifier(const std::string& identifier);
    uint64_t _onQueue_dataContainerTypeForIdentifier(const std::string& identifier);
    bool _onQueue_identifierHasCallerRegisteredEntitlements(const std::string& identifier);
    std::string _onQueue_parentIdentifierForChildIdentifier(const std::string& identifier);
    std::vector<std::string> _onQueue_childBundleIdentifiersForParentIdentifier(const std::string& identifier);
    TarnResult<std::set<std::string>> _onQueue_identifiersWithError();
    TarnStatus _onQueue_invalidateCodeSigningInfoForIdentifier(const std::string& identifier);
    TarnStatus _onQueue_invalidateCodeSigningInfoForIdentifierAndItsChildren(const std::string& identifier);
    TarnStatus _onQueue_removeAllAdvanceCopiesWithError();
    TarnCountedSet _onQueue_copyReferenceCountSetOfType(TarnGroupType type);
    // Calls `block` with every stored identifier and the group value under
    // `key` (or `fallBackKey` when that gives nothing or an empty list).
    using GroupIdsBlock = std::function<void(const std::string& identifier, const PlistValue* groupIds)>;
    void _onQueue_iterateGroupIdsWithKey(const char* key, const char* fallBackKey,
                                         const GroupIdsBlock& forAllIdentifiersUsingBlock);
    // Writes each entry under its identifier, deleting where the entry has no
    // info; a read failure ends the batch, and a failed write is logged and
    // skipped (neither fails the batch). TarnErrorMismatchedInput when the counts differ.
    TarnStatus _onQueue_setCodeSigningDictionaryValues(const std::vector<TarnCodeSigningEntryRef>& values,
                                                       const std::vector<std::string>& forIdentifiers);
    // Imports "tarn_code_signing_info.plist" from the library directory.
    void _onQueue_migrateFromMappingFileToDBIfNecessary();
    // Every change of the store made through the mapping calls this first: it
    // retires what the registration memo has learnt.
    void _onQueue_storeWillChange();
    // The legacy mapping file: identifier -> serialised entry, or the error
    // when it cannot be read; a missing file is a POSIX ENOENT error.
    static TarnResult<PlistDict> _readCodeSigningMappingFromDiskAtURL(const FileURL& url);

    // ---- imports of older records and the boot reconciliation
    //      (TarnCodeSigningMappingImports.cc) ----
    //
    // Every import logs its failures and goes on with the next item; none
    // fails the pass. Legacy files are removed and container metadata values
    // cleared after their import, so each import runs to completion once.

    // Under the global write lock (the caller holds no global or identifier
    // lock): imports the app-group identifiers of data containers, the legacy
    // entitlements file and the code-signing info cached in bundle
    // containers, then stages the deletion of unreferenced app-group
    // containers on `commandQueue`. In multi-user mode the two app-group
    // steps are skipped.
    void performAllCodeSigningMigrationAndReconciliationWithCommandQueue(
        TarnCommandQueue* commandQueue);
    // "tarn_entitlements.plist" of the library directory, removed afterwards.
    void _onQueue_migrateDataFromLegacyEntitlementsFileToCodeSigningFile();
    // Once per device (recorded as "CodeSigningMigration"); off the queue,
    // with the global write lock held by the caller.
    void migrateCachedCodeSigningInfoFromBundleContainersToMapping();
    // Stores the cached info of those containers that need it; answers the
    // containers whose cached value is to be cleared (all that held one).
    std::vector<TarnMetadataRef>
    _onQueue_migrateCachedCodeSigningInfoFromBundleContainersToMappingWithContainers(
        const std::vector<TarnMetadataRef>& containers, TarnContainerClass containerClass);
    // Once per device (recorded as "GroupIdMigration"); like the previous.
    void migrateAppGroupIdsFromDataContainersToFile();
    std::vector<TarnMetadataRef> _onQueue_migrateAppGroupIdsFromDataContainersToFileUsingContainers(
        const std::vector<TarnMetadataRef>& containers);

    // One entry of the legacy entitlements file, decoded; `entry` is empty
    // when the identifier's value cannot be imported (`why` says so).
    struct LegacyEntitlementsEntry {
        std::string identifier;
        TarnCodeSigningEntryRef entry;
        std::string why;
    };
    // Decodes the legacy entitlements file's dictionary: every key but the
    // three per-identifier tables is an identifier whose value is its
    // entitlements. In key order. Never fails: bad values are reported per entry.
    static std::vector<LegacyEntitlementsEntry> _entriesFromLegacyEntitlements(
        const PlistDict& file);
    // The entry for code-signing info cached in a container's metadata: the
    // info with its "Entitlements" also under the entitlements key.
    static TarnCodeSigningEntryRef _entryFromCachedCodeSigningInfo(PlistDict cachedInfo,
                                                                   uint64_t dataContainerClass);

    // ---- test access ----

    // Called on the queue with what processing hands to
    // _onQueue_handleChangeFromOldGroupContainerIds(). Set only while no
    // processing runs.
    using GroupChangeHook = std::function<void(
        const std::optional<std::vector<std::string>>& oldIds,
        const std::optional<std::vector<std::string>>& newIds, TarnGroupType type)>;
    GroupChangeHook TEST_groupChangeHook;

private:
    // Runs `work` synchronously on the queue; must be called off it.
    void runOnQueue(const std::function<void()>& work);
    void assertOnQueue() const;
    // entitlementsForIdentifier() after a miss: the import from the
    // application bundle container's metadata. Off the queue.
    std::optional<PlistDict> importCachedCodeSigningInfo(const std::string& identifier);

    // The registration memo. The generation counts store changes; a memo
    // entry holds for as long as the generation it was learnt at is current.
    struct RegistrationMemo {
        std::shared_ptr<const PlistDict> entitlements;
        uint64_t generation = 0;
    };
    // True when `entitlements` are known to need no registration for `identifier`.
    bool registrationIsCurrent(const std::string& identifier, const PlistDict& entitlements)
        EXCLUDES(memoMutex_);
    void rememberRegistration(const std::string& identifier, const PlistDict& entitlements,
                              uint64_t generation) EXCLUDES(memoMutex_);
    uint64_t storeGeneration() EXCLUDES(memoMutex_);

    // Constant after construction.
    TarnUserIdentitySharedCache* const userIdentityCache_;
    const DispatchQueueRef queue_;
    // Used on queue_ only.
    const std::unique_ptr<TarnSQLiteDB> codeSigningMappingDB_;

    // Guarded by memoMutex_ (taken on and off the queue; never held while
    // waiting for anything else).
    Mutex memoMutex_;
    uint64_t storeGeneration_ GUARDED_BY(memoMutex_) = 0;
    std::unordered_map<std::string, RegistrationMemo> registrationMemo_ GUARDED_BY(memoMutex_);
};

// Command 19: answers "ReplyInfoDictionary" with the external view of the
// identifier's code-signing info, or fails with TarnErrorNotFound when there is none.
void TarnHandleGetCodeSigningInfoCommand(const TarnRequestContext& context,
                                         const PlistValue& request, PlistValue& reply,
                                         TarnClientConnection* connection, uint64_t* error);

}  // namespace tarn
