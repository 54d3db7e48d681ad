// Replacement of one container by another, and recovery of replacements a
// previous run left behind.
//
// The promise: a replacement never costs the old container, whatever moment
// the process dies at. Before anything moves, a replace file naming the four
// places (old, new, staging, destination) is made durable. One rule then
// decides every interrupted replacement, on the failure path and at start-up
// alike (the restore rule): when neither the old place nor the destination
// holds anything, the old container is parked in staging and the new one
// never arrived, so staging is renamed back to the old place; in every other
// case nothing moves, and whatever is left in staging is discarded by the
// boot clean-up.
//
// Order of the steps. The replace file comes first and goes last, and the
// old container reaches staging no later than the new one reaches the
// destination: that is what the restore rule reads, so that order is kept
// on every path. The cache steps (dropping the old record, invalidating the
// old bundle's code signing) come before the moves rather than between them:
// under the global write lock no request sees the difference, the cache is
// rebuilt from disk after a crash, and a failure there then has nothing to
// put back.
//
// A replacement that keeps the old directory (preserveOldUUID) swaps the two
// with renameat2(RENAME_EXCHANGE) where the file system can: the new
// container is first parked in staging, then the two trade places, so the
// old path always holds one whole container. The crash states stay those the
// restore rule knows: before the swap the old place is occupied (nothing
// moves; the parked new container, a fresh one made to replace, is
// discarded from staging), after it the destination is. Where the file
// system cannot exchange, the old is parked and the new renamed in, as
// without preservation.
#include <cstdlib>
#include <string>

#include "Daemon/TarnClientConnection.h"
#include "Daemon/TarnCodeSigningMapping.h"
#include "Daemon/TarnContainerCache.h"
#include "Daemon/TarnError.h"
#include "Daemon/TarnExceptionFence.h"
#include "Daemon/TarnFileManager.h"
#include "Daemon/TarnGlobalConfiguration.h"
#include "Daemon/TarnLocks.h"
#include "Daemon/TarnLog.h"
#include "Daemon/TarnPropertyListFile.h"
#include "Platform/Failpoints.h"
#include "Platform/FileSystem.h"
#include "Platform/RootPrefix.h"

namespace tarn {

namespace {

constexpr const char* kOldURLKey = "TarnReplaceOperationOldURL";
constexpr const char* kNewURLKey = "TarnReplaceOperationNewURL";
constexpr const char* kStagingURLKey = "TarnReplaceOperationStagingURL";
constexpr const char* kDestURLKey = "TarnReplaceOperationDestURL";

constexpr const char* kReplace = "replaceContainerIdentity";

using ReplaceInfo = TarnClientConnection::ReplaceInfo;

// A failpoint standing before a step: "kill" dies between two steps,
// "errno:N" makes the step fail.
TarnStatus stepFailpoint(const char* name) {
    if (auto fp = TARN_FAILPOINT(name)) return TARN_POSIX_ERROR(*fp, "failpoint %s", name);
    return {};
}

bool exists(const FileURL& url) {
    // An unexpected error reads as "there": the restore rule then moves nothing.
    return !TarnFileManager::defaultManager().itemDoesNotExistAtURL(url);
}

std::string describe(const ReplaceInfo& info) {
    return Format("{old: %@, new: %@, staging: %@, dest: %@}", info.oldURL, info.newURL,
                  info.stagingURL, info.destURL);
}

// The restore rule (see the top of the file). `line` is the debug line
// written before the move (staging, old). Answers whether it moved.
TarnResult<bool> restoreParkedOldContainer(const char* function, const ReplaceInfo& info,
                                           const char* line) {
    if (exists(info.oldURL) || exists(info.destURL)) return false;
    // Nothing parked either: the old container was gone before we came, and
    // there is nothing of ours to put back.
    if (!exists(info.stagingURL)) {
        TarnLog(kLogError, function, "Nothing to recover at %@ for %@", info.stagingURL,
                info.oldURL);
        return false;
    }
    TarnLog(kLogDebug, function, line, info.stagingURL, info.oldURL);
    TarnStatus moved = stepFailpoint("replace.recover.restore");
    if (moved.ok())
        moved = TarnFileManager::defaultManager().moveItemAtURL(info.stagingURL, info.oldURL);
    if (!moved.ok()) {
        return TARN_ERROR_IN(function, TarnErrorReplaceRecoveryFailed, moved.error(),
                             "Failed to recover replace move: %@ to %@", info.stagingURL,
                             info.oldURL);
    }
    // The old container is durably back before its replace file may go.
    (void)FsFsyncDirectoryOf(info.oldURL);  // a lost sync only repeats the recovery
    return true;
}

// One replacement, step by step, under the global write lock. Remembers what
// has moved so that the failure path and the clean-up know what to undo.
class Replacement {
  public:
    Replacement(TarnClientConnection& connection, TarnConcreteContainerIdentityRef oldIdentity,
                TarnConcreteContainerIdentityRef newIdentity, bool preserve)
        : connection_(connection),
          oldIdentity_(std::move(oldIdentity)),
          newIdentity_(std::move(newIdentity)),
          preserve_(preserve) {}

    TarnStatus perform();
    // After a failure: the restore rule. `threw`: the failure was an exception.
    TarnStatus restore(bool threw);
    TarnStatus cleanUp(bool startDeletionThread);

  private:
    TarnStatus findContainers();
    TarnStatus promoteWithoutOldContainer();
    TarnStatus moveNewIntoPlace();
    TarnStatus parkOldThenRenameNew();
    // Answers false when the file system cannot exchange and nothing moved.
    TarnResult<bool> exchangeNewWithOld();
    // `failpoint` stands before the removal.
    TarnStatus uncache(const TarnMetadataRef& metadata, const char* failpoint);
    TarnStatus recacheNewAtDestination();
    void recacheOldAfterFailure();
    TarnMutableMetadataRef newMetadataWithPreservedUUID(const FileURL& url) const;

    TarnClientConnection& connection_;
    const TarnConcreteContainerIdentityRef oldIdentity_;  // null: no old container
    const TarnConcreteContainerIdentityRef newIdentity_;
    const bool preserve_;

    TarnMetadataRef oldMetadata_;
    TarnMetadataRef newMetadata_;
    bool oldTransient_ = false;
    ReplaceInfo info_;
    FileURL replaceURL_;  // empty: no replace file
    bool newAtDestination_ = false;
    bool oldUncached_ = false;
};

TarnStatus Replacement::findContainers() {
    auto& cache = TarnContainerCache::sharedInstance();
    if (oldIdentity_) {
        oldMetadata_ = cache.containerForContainerIdentity(oldIdentity_);
        if (!oldMetadata_)
            return TARN_ERROR_IN(kReplace, TarnErrorNotFound, nullptr,
                                 "No Container with identity: %@", oldIdentity_);
        oldTransient_ = oldMetadata_->transient();
    }
    newMetadata_ = cache.containerForContainerIdentity(newIdentity_);
    if (!newMetadata_)
        return TARN_ERROR_IN(kReplace, TarnErrorNotFound, nullptr, "No Container with identity: %@",
                             newIdentity_);
    if (oldMetadata_ && oldMetadata_->url() == newMetadata_->url())
        return TARN_ERROR_IN(kReplace, TarnErrorReplaceSameContainer, nullptr,
                             "Can't replace the same container at %@", newMetadata_->url());
    info_.newURL = newMetadata_->url();
    const std::string newName = PathLastComponent(info_.newURL);
    if (!Uuid::parse(newName))
        return TARN_ERROR_IN(kReplace, TarnErrorInvalidPath, nullptr,
                             "Invalid URL (last path component not UUID): %@", info_.newURL);

    if (preserve_) {
        info_.destURL = oldMetadata_->url();
    } else {
        const std::optional<FileURL> parent =
            TarnGlobalConfiguration::sharedInstance().containerDirectoryURLForUserIdentity(
                newIdentity_->userIdentity(), newIdentity_->containerClass(), oldTransient_);
        if (!parent)
            return TARN_ERROR_IN(kReplace, TarnErrorInvalidArgument, nullptr,
                                 "Can't act on an invalid object: newUUID: %@, Class: %ld",
                                 newIdentity_->uuid().string(),
                                 static_cast<int64_t>(newIdentity_->containerClass()));
        info_.destURL = PathJoin(*parent, newName);
        if (exists(info_.destURL))
            return TARN_ERROR_IN(kReplace, TarnErrorAlreadyExists, nullptr,
                                 "Container already exists at %@", info_.destURL);
    }
    if (oldMetadata_) info_.oldURL = oldMetadata_->url();
    return {};
}

TarnStatus Replacement::perform() {
    TARN_TRY(findContainers());
    if (!oldMetadata_) return promoteWithoutOldContainer();

    const std::string token = Uuid::generate().string();
    auto& configuration = TarnGlobalConfiguration::sharedInstance();
    replaceURL_ = PathJoin(configuration.replaceDirectory(), token + ".plist");
    info_.stagingURL = PathJoin(configuration.stagingDirectoryURLForUserIdentity(
                                    newIdentity_->userIdentity(), newIdentity_->containerClass()),
                                token);
    const TarnStatus written = TarnClientConnection::_writeToDiskReplaceAt(
        replaceURL_, info_.oldURL, info_.newURL, info_.stagingURL, info_.destURL);
    if (!written.ok()) {
        TarnLog(kLogError, kReplace, "Failed to write replace file: %@", written.error());
        return written;
    }

    TARN_TRY(uncache(oldMetadata_, "replace.uncacheOld"));
    oldUncached_ = true;
    if (TarnContainerClassIsBundle(oldMetadata_->containerClass())) {
        TarnStatus invalidated = stepFailpoint("replace.invalidate");
        if (invalidated.ok())
            if (TarnCodeSigningMapping* mapping = TarnCodeSigningMapping::sharedInstance())
                invalidated = mapping->invalidateCodeSigningInfoForIdentifierAndItsChildren(
                    oldMetadata_->identifier());
        if (!invalidated.ok()) {
            TarnLog(kLogError, kReplace, "Failed to invalidate code signing info for %@",
                    oldMetadata_->identifier());
            return invalidated;
        }
    }

    TARN_TRY(moveNewIntoPlace());
    TARN_TRY(uncache(newMetadata_, "replace.uncacheNew"));
    return recacheNewAtDestination();
}

TarnStatus Replacement::promoteWithoutOldContainer() {
    // Nothing is parked and nothing can be lost: no replace file is needed.
    const TarnResult<TarnMetadataRef> existing =
        TarnContainerCache::sharedInstance().containerForContainerIdentity(
            newIdentity_->baseIdentity(), /*transient=*/false, /*updateSandbox=*/true);
    if (existing.ok()) {
        return TARN_ERROR_IN(kReplace, TarnErrorAlreadyExists, nullptr,
                             "Container with identifier: %@, class: %ld, transient: %d already "
                             "exists",
                             newIdentity_->identifier(),
                             static_cast<int64_t>(newIdentity_->containerClass()), 0);
    }
    const TarnErrorRef& lookupError = existing.error();
    if (!(lookupError && lookupError->isTarn() && lookupError->code() == TarnErrorNotFound))
        return lookupError;
    TARN_TRY(stepFailpoint("replace.moveNew"));
    if (TarnStatus moved =
            TarnFileManager::defaultManager().moveItemAtURL(info_.newURL, info_.destURL);
        !moved.ok())
        return TARN_ERROR_IN(kReplace, TarnErrorReplaceFailed, moved.error(),
                             "Failed to replace: %@ with: %@ at: %@", info_.oldURL, info_.newURL,
                             info_.destURL);
    newAtDestination_ = true;
    TARN_TRY(uncache(newMetadata_, "replace.uncacheNew"));
    return recacheNewAtDestination();
}

TarnStatus Replacement::moveNewIntoPlace() {
    if (preserve_) {
        const bool exchanged = TARN_TRY(exchangeNewWithOld());
        if (exchanged) return {};
    }
    TARN_TRY(parkOldThenRenameNew());
    if (preserve_) {
        // Renamed in with its own UUID: until this write a crash would leave
        // it there under that one.
        TARN_TRY(newMetadataWithPreservedUUID(info_.destURL)->writeMetadataToDiskWithError());
    }
    return {};
}

TarnStatus Replacement::parkOldThenRenameNew() {
    auto& fm = TarnFileManager::defaultManager();
    TarnStatus parked = stepFailpoint("replace.park");
    if (parked.ok()) parked = fm.moveItemAtURL(info_.oldURL, info_.stagingURL);
    if (!parked.ok())
        return TARN_ERROR_IN(kReplace, TarnErrorReplaceStagingFailed, parked.error(),
                             "Failed to move old %@ to staging %@", info_.oldURL, info_.stagingURL);
    TarnStatus moved = stepFailpoint("replace.moveNew");
    if (moved.ok()) moved = fm.moveItemAtURL(info_.newURL, info_.destURL);
    if (!moved.ok())
        return TARN_ERROR_IN(kReplace, TarnErrorReplaceFailed, moved.error(),
                             "Failed to replace: %@ with: %@ at: %@", info_.oldURL, info_.newURL,
                             info_.destURL);
    newAtDestination_ = true;
    return {};
}

TarnResult<bool> Replacement::exchangeNewWithOld() {
    auto& fm = TarnFileManager::defaultManager();
    const auto replaceFailed = [&](const TarnErrorRef& underlying) {
        return TARN_ERROR_IN(kReplace, TarnErrorReplaceFailed, underlying,
                             "Failed to replace: %@ with: %@ at: %@", info_.oldURL, info_.newURL,
                             info_.destURL);
    };
    TarnStatus parked = stepFailpoint("replace.park");
    if (parked.ok()) parked = fm.moveItemAtURL(info_.newURL, info_.stagingURL);
    if (!parked.ok()) return replaceFailed(parked.error());

    // The swap puts it in place already carrying the old UUID.
    TarnStatus swapped =
        newMetadataWithPreservedUUID(info_.stagingURL)->writeMetadataToDiskWithError();
    if (swapped.ok()) swapped = stepFailpoint("replace.moveNew");
    if (swapped.ok()) swapped = fm.exchangeItemAtURL(info_.stagingURL, info_.destURL);
    if (swapped.ok()) {
        newAtDestination_ = true;
        return true;
    }
    // Back where it was, as it was; the old container never moved.
    TarnMutableMetadataRef own = newMetadata_->copy();
    own->setUrl(info_.stagingURL);
    (void)own
        ->writeMetadataToDiskWithError();  // at worst it keeps the old UUID in the transient tree
    if (TarnStatus back = fm.moveItemAtURL(info_.stagingURL, info_.newURL); !back.ok())
        return replaceFailed(back.error());
    if (TarnFileManager::exchangeIsUnsupported(swapped.error())) return false;
    return replaceFailed(swapped.error());
}

TarnMutableMetadataRef Replacement::newMetadataWithPreservedUUID(const FileURL& url) const {
    TarnMutableMetadataRef metadata = newMetadata_->copy();
    metadata->setUuid(oldIdentity_->uuid());
    metadata->setUrl(url);
    return metadata;
}

TarnStatus Replacement::uncache(const TarnMetadataRef& metadata, const char* failpoint) {
    TarnStatus removed = stepFailpoint(failpoint);
    if (removed.ok())
        removed = TarnContainerCache::sharedInstance().removeContainerForUserIdentity(
            metadata->userIdentity(), metadata->containerClass(), metadata->identifier(),
            metadata->transient());
    if (!removed.ok())
        return TARN_ERROR_IN(
            kReplace, TarnErrorCacheRemoveFailed, removed.error(),
            "Failed to remove from cache id: %@, class: %ld, transient: %d", metadata->identifier(),
            static_cast<int64_t>(metadata->containerClass()), metadata->transient());
    return {};
}

TarnStatus Replacement::recacheNewAtDestination() {
    TarnMutableMetadataRef metadata =
        preserve_ ? newMetadataWithPreservedUUID(info_.destURL) : newMetadata_->copy();
    metadata->setUrl(info_.destURL);
    metadata->setTransient(oldTransient_);
    TarnStatus added = stepFailpoint("replace.cacheNew");
    if (added.ok())
        added = TarnContainerCache::sharedInstance().addContainerMetadata(
            metadata, info_.destURL, oldTransient_, /*updateSandbox=*/true);
    if (!added.ok())
        return TARN_ERROR_IN(kReplace, TarnErrorCacheAddFailed, added.error(),
                             "Failed to add to cache: %@, url: %@, transient: %d", metadata,
                             info_.destURL, oldTransient_);
    return {};
}

TarnStatus Replacement::restore(bool threw) {
    if (info_.stagingURL.empty() || info_.oldURL.empty()) return {};
    const auto restored =
        restoreParkedOldContainer(kReplace, info_,
                                  threw ? "Recovering from exception by moving: %@ to %@"
                                        : "Recovering from failed replace by moving: %@ to %@");
    if (restored.ok()) {
        recacheOldAfterFailure();
        return {};
    }
    // Only the replace file still knows where the old container is: the
    // next start finishes the restore from it.
    if (threw) std::_Exit(EXIT_FAILURE);
    replaceURL_.clear();
    info_.stagingURL.clear();
    return restored.error();
}

void Replacement::recacheOldAfterFailure() {
    // The old container is at its place again (or never left it), but the
    // cache learns of it otherwise only at the next start: until then its
    // identifier would look free and a create would make a twin of it.
    if (!oldUncached_ || newAtDestination_ || !exists(info_.oldURL)) return;
    if (TarnStatus added = TarnContainerCache::sharedInstance().addContainerMetadata(
            oldMetadata_, info_.oldURL, oldTransient_, /*updateSandbox=*/true);
        !added.ok())
        TarnLog(kLogError, kReplace, "Failed to re-add old container to cache: %@, url: %@ : %@",
                oldMetadata_, info_.oldURL, added.error());
}

TarnStatus Replacement::cleanUp(bool startDeletionThread) {
    TarnStatus result;
    if (!replaceURL_.empty() && newAtDestination_) {
        // The moves are durable before the record that explains them goes.
        (void)FsFsyncDirectoryOf(info_.destURL);  // a lost sync only repeats the recovery
        if (PathParent(info_.oldURL) != PathParent(info_.destURL))
            (void)FsFsyncDirectoryOf(info_.oldURL);
    }
    if (!info_.stagingURL.empty()) {
        TarnStatus discarded = stepFailpoint("replace.discardStaging");
        if (discarded.ok())
            discarded = connection_._moveItemAtURLToDeathRow(info_.stagingURL, /*isDir=*/true,
                                                             /*startDeletionThread=*/false);
        if (!discarded.ok())
            result = TARN_ERROR_IN(kReplace, TarnErrorRemoveFileFailed, discarded.error(),
                                   "Failed to remove staging dir: %@", info_.stagingURL);
    }
    if (!replaceURL_.empty()) {
        TarnStatus discarded = stepFailpoint("replace.discardFile");
        if (discarded.ok())
            discarded = connection_._moveItemAtURLToDeathRow(replaceURL_, /*isDir=*/false,
                                                             startDeletionThread);
        if (!discarded.ok())
            result = TARN_ERROR_IN(kReplace, TarnErrorRemoveFileFailed, discarded.error(),
                                   "Failed to remove replace file: %@", replaceURL_);
    }
    return result;
}

bool isAbsolutePathBelowRoot(const std::string& path) {
    if (path.empty() || path.front() != '/' || path.find('\0') != std::string::npos) return false;
    if (containsDotDotPathComponents(path)) return false;
    const std::string& root = RootPrefix();
    if (RootIsSystemRoot()) return true;
    return path.size() > root.size() && path.starts_with(root) && path[root.size()] == '/';
}

// A directory URL: no trailing slashes (the daemon's URLs carry none).
FileURL directoryURL(std::string path) {
    while (path.size() > 1 && path.back() == '/') path.pop_back();
    return path;
}

}  // namespace

TarnStatus TarnClientConnection::replaceContainerIdentity(
    const TarnConcreteContainerIdentityRef& oldIdentity,
    const TarnConcreteContainerIdentityRef& newIdentity, bool preserveOldUUID,
    bool startDeletionThread) {
    if (!newIdentity || !TarnContainerClassIsValid(newIdentity->containerClass())) {
        return TARN_ERROR(TarnErrorInvalidArgument, nullptr,
                          "Can't act on an invalid object: newUUID: %@, Class: %ld",
                          newIdentity ? newIdentity->uuid().string() : std::string("(null)"),
                          newIdentity ? static_cast<int64_t>(newIdentity->containerClass()) : 0);
    }
    if (oldIdentity) {
        if (oldIdentity->containerClass() != newIdentity->containerClass())
            return TARN_ERROR(TarnErrorReplaceClassMismatch, nullptr,
                              "Can't replace containers of different class types: %ld and %ld",
                              static_cast<int64_t>(oldIdentity->containerClass()),
                              static_cast<int64_t>(newIdentity->containerClass()));
        if (!oldIdentity->userIdentity()->isEqualToUserIdentity(*newIdentity->userIdentity()))
            return TARN_ERROR(TarnErrorPersonaMismatch, nullptr,
                              "Can't replace containers of different personas: %@ and %@",
                              oldIdentity->userIdentity(), newIdentity->userIdentity());
    } else if (preserveOldUUID) {
        return TARN_ERROR(TarnErrorInvalidArgument, nullptr,
                          "Can't have a nil oldContainerUUID when preserving the UUID");
    }

    TarnGlobalLockHolder lock(TarnGlobalLockHolder::Mode::Write);
    Replacement replacement(*this, oldIdentity, newIdentity, preserveOldUUID);
    TarnStatus result = TarnFenceExceptions(kReplace, [&] { return replacement.perform(); });
    if (!result.ok()) {
        const bool threw = result.code(TarnSuccess) == TarnErrorException;
        if (TarnStatus restored = replacement.restore(threw); !restored.ok()) result = restored;
    }
    if (TarnStatus cleaned = replacement.cleanUp(startDeletionThread); !cleaned.ok())
        return cleaned;
    return result;
}

TarnStatus TarnClientConnection::_writeToDiskReplaceAt(const FileURL& replaceURL,
                                                       const FileURL& old, const FileURL& withNew,
                                                       const FileURL& usingStaging,
                                                       const FileURL& toDestination) {
    if (replaceURL.empty() || old.empty() || withNew.empty() || usingStaging.empty() ||
        toDestination.empty()) {
        return TARN_ERROR(TarnErrorInvalidReplaceInfo, nullptr,
                          "Invalid Replace File Info: old: %@, new: %@, staging: %@, dest: %@", old,
                          withNew, usingStaging, toDestination);
    }
    PlistValue dictionary{PlistDict{}};
    dictionary.set(kOldURLKey, old);
    dictionary.set(kNewURLKey, withNew);
    dictionary.set(kStagingURLKey, usingStaging);
    dictionary.set(kDestURLKey, toDestination);
    // Atomic: the file is synced before its rename and the directory after,
    // so it is on disk before the first container moves.
    TarnStatus written = stepFailpoint("replace.writeFile");
    if (written.ok())
        written =
            Tarn_writeToURL(dictionary, replaceURL, kTarnWriteAtomic | kTarnWriteNoFileProtection);
    if (!written.ok()) {
        return TARN_ERROR(TarnErrorWriteFailed, written.error(),
                          "Failed to write replace dictionary to URL %@", replaceURL);
    }
    return {};
}

TarnResult<TarnClientConnection::ReplaceInfo> TarnClientConnection::_validateReplaceDictionary(
    const PlistValue& root, const FileURL& url) {
    if (!root.isDict())
        return TARN_ERROR(TarnErrorReplaceRecoveryFailed, nullptr, "Bad Data in replace file: %@",
                          url);
    const auto pathFor = [&](const char* key) -> std::optional<std::string> {
        const PlistValue* value = root.find(key);
        const std::string* path = value ? value->asString() : nullptr;
        if (!path || !isAbsolutePathBelowRoot(*path)) return std::nullopt;
        return *path;
    };
    const std::optional<std::string> old = pathFor(kOldURLKey), neu = pathFor(kNewURLKey),
                                     staging = pathFor(kStagingURLKey), dest = pathFor(kDestURLKey);
    if (!old || !neu || !staging || !dest) {
        const auto shown = [&](const char* key) {
            const PlistValue* value = root.find(key);
            return value ? value->description() : std::string("(null)");
        };
        return TARN_ERROR(TarnErrorReplaceRecoveryFailed, nullptr,
                          "Invalid replace data: Old: %@, New: %@, Staging: %@, Dest: %@",
                          shown(kOldURLKey), shown(kNewURLKey), shown(kStagingURLKey),
                          shown(kDestURLKey));
    }
    return ReplaceInfo{directoryURL(*old), directoryURL(*neu), directoryURL(*staging),
                       directoryURL(*dest)};
}

TarnResult<TarnClientConnection::ReplaceInfo>
TarnClientConnection::_readAndValidateReplaceFileAtUrl(const FileURL& url) {
    TarnResult<PlistValue> read = Tarn_dictionaryWithContentsOfURL(url, 0);
    if (!read.ok()) {
        const TarnErrorRef& error = read.error();
        // Parsed, but its top level is not a dictionary.
        if (error && error->domain() == kPlatformErrorDomain)
            return TARN_ERROR(TarnErrorReplaceRecoveryFailed, error, "Bad Data in replace file: %@",
                              url);
        return TARN_ERROR(TarnErrorReplaceRecoveryFailed, error,
                          "Failed to read replace file at URL %@", url);
    }
    return _validateReplaceDictionary(*read, url);
}

TarnStatus TarnClientConnection::_recoverFromReplaceOperationsWithError() {
    static constexpr const char* kRecover = "_recoverFromReplaceOperationsWithError";
    const FileURL directory = TarnGlobalConfiguration::sharedInstance().replaceDirectory();
    auto items = TarnFileManager::defaultManager().urlsForItemsInDirectoryAtURL(directory);
    if (!items.ok()) {
        const TarnErrorRef& error = items.error();
        if (!(error && error->posixCode() == ENOENT))
            TarnLog(kLogError, kRecover, "Failed to get items at replace URL %@ : %@", directory,
                    error);
        return {};
    }
    for (const FileURL& item : *items) {
        // An invalid file has been reported with its reason and is not acted on.
        if (const TarnResult<ReplaceInfo> info = _readAndValidateReplaceFileAtUrl(item);
            info.ok()) {
            TarnLog(kLogDebug, kRecover, "Doing a replace of %@ with info: %@", item,
                    describe(*info));
            if (const TarnResult<bool> restored = restoreParkedOldContainer(
                    kRecover, *info, "Recovering from failed replace by moving: %@ to %@");
                !restored.ok())
                return restored.error();
        }
        TarnStatus discarded = stepFailpoint("replace.recover.discard");
        if (discarded.ok())
            discarded = _moveItemAtURLToDeathRow(item, /*isDir=*/false,
                                                 /*startDeletionThread=*/false);
        if (!discarded.ok())
            return TARN_ERROR_IN(kRecover, TarnErrorRemoveFileFailed, discarded.error(),
                                 "Failed to remove replace file at %@", item);
    }
    return {};
}

}  // namespace tarn
