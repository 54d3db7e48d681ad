#include "Daemon/TarnDataProtectionChangeOperation.h"

#include <cerrno>
#include <cstring>

#include "Daemon/TarnClientConnection.h"
#include "Daemon/TarnDaemon.h"
#include "Daemon/TarnExceptionFence.h"
#include "Daemon/TarnFileManager.h"
#include "Daemon/TarnGlobalConfiguration.h"
#include "Daemon/TarnLocks.h"
#include "Daemon/TarnLog.h"
#include "Daemon/TarnPropertyListFile.h"
#include "Daemon/TarnUserIdentityCache.h"
#include "Platform/FileSystem.h"

namespace tarn {

namespace {

constexpr const char* kReadTag = "_readAndValidateDataProtectionUpdateAtURL";
constexpr const char* kPassTag = "_runChangeOperationNeedToRetry";
constexpr const char* kPerformTag = "performChangeOperation";

// Pending files hold a handful of keys; anything near this is not one.
constexpr size_t kMaxPendingFileBytes = 64 * 1024;

// What the platform's number objects hold: integers, reals and booleans.
std::optional<int64_t> numberValue(const PlistValue* value) {
    if (!value || !(value->isNumber() || value->isBool())) return std::nullopt;
    return value->asInt64();
}

std::string describe(const PlistValue* value) {
    return value ? value->description() : std::string("(null)");
}

// One component of a file name: nothing in it may lead out of the directory.
std::string fileNameComponent(std::string_view text) {
    static const char kHex[] = "0123456789ABCDEF";
    std::string out;
    out.reserve(text.size());
    for (unsigned char c : text) {
        if (c == '/' || c == '%' || c == '\0') {
            out += '%';
            out += kHex[c >> 4];
            out += kHex[c & 0xF];
        } else {
            out += static_cast<char>(c);
        }
    }
    return out;
}

std::string errText(int err) { return std::strerror(err); }

}  // namespace

// ---- Construction ----

TarnDataProtectionChangeOperation::TarnDataProtectionChangeOperation(
    PrivateTag, TarnMetadataRef metadata, int32_t newClass, bool retryIfLocked, uint32_t changeType,
    Uuid internalChangeID, DispatchQueueRef queue, TarnUserIdentityCache& userIdentityCache)
    : retryIfLocked_(retryIfLocked),
      newDataProtectionClass_(newClass),
      changeType_(changeType),
      dataContainerMetadata_(std::move(metadata)),
      internalChangeID_(internalChangeID),
      queue_(std::move(queue)),
      userIdentityCache_(userIdentityCache) {}

TarnDataProtectionChangeOperationRef
TarnDataProtectionChangeOperation::dataProtectionChangeOperationWithContainerMetadata(
    TarnMetadataRef metadata, int32_t settingClass, bool retryingIfLocked, uint32_t changeType,
    DispatchQueueRef queue) {
    return initWithContainerMetadata(std::move(metadata), settingClass, retryingIfLocked,
                                     changeType, std::nullopt, std::move(queue),
                                     TarnUserIdentitySharedCache::sharedInstance());
}

TarnDataProtectionChangeOperationRef TarnDataProtectionChangeOperation::initWithContainerMetadata(
    TarnMetadataRef metadata, int32_t newClass, bool retryingIfLocked, uint32_t changeType,
    std::optional<Uuid> internalChangeID, DispatchQueueRef queue,
    TarnUserIdentityCache& userIdentityCache) {
    return std::make_shared<TarnDataProtectionChangeOperation>(
        PrivateTag{}, std::move(metadata), newClass, retryingIfLocked, changeType,
        internalChangeID.value_or(Uuid::generate()), std::move(queue), userIdentityCache);
}

std::string TarnDataProtectionChangeOperation::describeContainer() const {
    const TarnMetadata& m = *dataContainerMetadata_;
    return Format("user: %@, id: %@, containerClass: %llu", m.userIdentity(), m.identifier(),
                  m.containerClass());
}

// ---- The pending file ----

FileURL TarnDataProtectionChangeOperation::urlForProtectionOperationWithContainerIdentity(
    const TarnContainerIdentity& identity) {
    const std::string user = identity.userIdentity() ? identity.userIdentity()->identifier() : "";
    const std::string name = Format("%@-%llu-%@.plist", fileNameComponent(identity.identifier()),
                                    identity.containerClass(), fileNameComponent(user));
    return PathJoin(TarnGlobalConfiguration::sharedInstance().pendingUpdatesDirectory(), name);
}

FileURL TarnDataProtectionChangeOperation::url() const {
    return urlForProtectionOperationWithContainerIdentity(
        *dataContainerMetadata_->containerIdentity());
}

TarnStatus TarnDataProtectionChangeOperation::deleteUpdateFileWithContainerIdentity(
    const TarnContainerIdentity& identity) {
    const FileURL url = urlForProtectionOperationWithContainerIdentity(identity);
    TarnStatus removed = TarnFileManager::defaultManager().removeItemAtURL(url);
    if (!removed.ok())
        TarnLog(kLogError, __func__, "Failed to remove data protection file at %@ : %@", url,
                removed.error());
    return removed;
}

TarnResult<TarnDataProtectionUpdate>
TarnDataProtectionChangeOperation::_readAndValidateDataProtectionUpdateAtURL(
    const FileURL& url, TarnUserIdentityCache& userIdentityCache) {
    if (url.empty())
        return TARN_ERROR_IN(kReadTag, TarnErrorBadInput, nullptr, "URL cannot be nil");
    TarnResult<std::string> bytes =
        TarnFileManager::defaultManager().readDataAtURL(url, kMaxPendingFileBytes);
    if (!bytes.ok())
        return TARN_ERROR_IN(kReadTag, TarnErrorReadFailed, bytes.error(),
                             "Failed to read update info at URL %@", url);
    return _validateDataProtectionUpdate(*bytes, url, userIdentityCache);
}

TarnResult<TarnDataProtectionUpdate>
TarnDataProtectionChangeOperation::_validateDataProtectionUpdate(
    const std::string& bytes, const FileURL& path, TarnUserIdentityCache& userIdentityCache) {
    std::optional<PlistValue> dictionary = PlistValue::fromBytes(bytes.data(), bytes.size());
    if (!dictionary || !dictionary->isDict())
        return TARN_ERROR_IN(kReadTag, TarnErrorReadFailed, nullptr,
                             "Failed to read update info at URL %@", path);
    const PlistValue& d = *dictionary;
    TarnDataProtectionUpdate update;

    const PlistValue* identifier = d.find(kTarnDataOperationIdentifierKey);
    if (!identifier || !identifier->isString())
        return TARN_ERROR_IN(kReadTag, TarnErrorInvalidMetadata, nullptr,
                             "Invalid update info Identifier: %@ at %@", describe(identifier),
                             path);
    update.identifier = *identifier->asString();

    const std::optional<int64_t> containerClass =
        numberValue(d.find(kTarnDataOperationContainerClassKey));
    if (!containerClass || !TarnContainerClassIsValid(static_cast<uint64_t>(*containerClass)))
        return TARN_ERROR_IN(kReadTag, TarnErrorInvalidMetadata, nullptr,
                             "Invalid update info container class: %ld at %@",
                             containerClass.value_or(0), path);
    update.containerClass = static_cast<TarnContainerClass>(*containerClass);

    if (TarnUserIdentity::isUserIdentityRequiredForContainerClass(update.containerClass)) {
        const PlistValue* stored = d.find(kTarnDataOperationUserIdentityKey);
        const PlistValue* uid = d.find(kTarnDataOperationUserIdKey);
        if (stored) {
            TarnResult<TarnUserIdentityRef> resolved =
                TarnUserIdentity::userIdentityWithPlist(*stored, userIdentityCache);
            if (!resolved.ok() || !*resolved)
                return TARN_ERROR_IN(kReadTag, TarnErrorInvalidMetadata, resolved.error(),
                                     "Invalid update info user identity: %@ at %@: %llu", *stored,
                                     path, resolved.code(TarnErrorInvalidUserIdentityData));
            update.userIdentity = *resolved;
        } else if (std::optional<int64_t> id = numberValue(uid);
                   id && *id >= 0 && *id <= UINT32_MAX) {
            update.legacyUserId = static_cast<uint64_t>(*id);
            const auto posixID = static_cast<uint32_t>(*id);
            update.userIdentity =
                userIdentityCache.userIdentityForPersonalPersonaWithUID(posixID, posixID);
            if (!update.userIdentity)
                return TARN_ERROR_IN(kReadTag, TarnErrorInvalidMetadata, nullptr,
                                     "Invalid update info user id: %@ at %@", describe(uid), path);
        } else {
            return TARN_ERROR_IN(kReadTag, TarnErrorInvalidMetadata, nullptr,
                                 "Invalid update info user id: %@ at %@", describe(uid), path);
        }
    }

    const PlistValue* protectionClass = d.find(kTarnDataOperationProtectionClassKey);
    const std::optional<int64_t> protection = numberValue(protectionClass);
    if (!protection)
        return TARN_ERROR_IN(kReadTag, TarnErrorInvalidMetadata, nullptr,
                             "Invalid update info protection class: %@ at %@",
                             describe(protectionClass), path);
    update.protectionClass = static_cast<int32_t>(*protection);

    const PlistValue* changeType = d.find(kTarnDataOperationChangeTypeKey);
    const std::optional<int64_t> change = numberValue(changeType);
    if (!change)
        return TARN_ERROR_IN(kReadTag, TarnErrorInvalidMetadata, nullptr,
                             "Invalid update info change type: %@ at %@", describe(changeType),
                             path);
    update.changeType = static_cast<uint32_t>(*change);

    const PlistValue* retry = d.find(kTarnDataOperationRetryIfLockedKey);
    const std::optional<int64_t> retryValue = numberValue(retry);
    if (!retryValue)
        return TARN_ERROR_IN(kReadTag, TarnErrorInvalidMetadata, nullptr,
                             "Invalid update info retry: %@ at %@", describe(retry), path);
    update.retryIfLocked = *retryValue != 0;

    const PlistValue* internalID = d.find(kTarnDataOperationInternalIDKey);
    if (!internalID || !internalID->isString())
        return TARN_ERROR_IN(kReadTag, TarnErrorInvalidMetadata, nullptr,
                             "Invalid update info UUID String: %@ at %@", describe(internalID),
                             path);
    std::optional<Uuid> uuid = Uuid::parse(*internalID->asString());
    if (!uuid)
        return TARN_ERROR_IN(kReadTag, TarnErrorInvalidMetadata, nullptr,
                             "Invalid update info UUID: %@ at %@", *internalID, path);
    update.internalChangeID = *uuid;
    return update;
}

TarnResult<TarnDataProtectionChangeOperationRef>
TarnDataProtectionChangeOperation::dataProtectionChangeOperationAtURL(const FileURL& url,
                                                                      DispatchQueueRef queue) {
    TarnUserIdentitySharedCache& cache = TarnUserIdentitySharedCache::sharedInstance();
    TarnResult<TarnDataProtectionUpdate> read =
        _readAndValidateDataProtectionUpdateAtURL(url, cache);
    if (!read.ok()) {
        TarnLog(kLogError, __func__, "Failed to read data protection update at %@", url);
        return read.error();
    }
    const TarnDataProtectionUpdate& update = *read;
    TarnUserIdentityRef owner =
        update.userIdentity ? update.userIdentity : TarnUserIdentityCache::defaultUserIdentity();
    TarnResult<TarnContainerIdentityRef> identity =
        TarnContainerIdentity::containerIdentityWithUserIdentity(owner, update.identifier,
                                                                 update.containerClass);
    if (!identity.ok())
        return TARN_ERROR(identity.code(TarnErrorInvalidArgument), identity.error(),
                          "Could not create user identity.");
    TarnResult<TarnMetadataRef> found =
        TarnClientConnection::privilegedClientConnectionWithUserIdentity(owner)
            ->createOrLookupContainerWithContainerIdentity(*identity, /*createIfNecessary=*/false,
                                                           /*transient=*/false,
                                                           /*useLocking=*/true);
    if (!found.ok())
        return TARN_ERROR(
            TarnErrorNotFound, found.error(),
            "Failed to lookup container metadata from file userId: %u, identifier: %@, Class: "
            "%llu : %llu",
            static_cast<uint32_t>(update.legacyUserId.value_or(0)), update.identifier,
            update.containerClass, found.code(TarnErrorNotFound));
    return initWithContainerMetadata(*found, update.protectionClass, update.retryIfLocked,
                                     update.changeType, update.internalChangeID, std::move(queue),
                                     cache);
}

TarnStatus TarnDataProtectionChangeOperation::writeToDiskWithError() {
    TarnStatus result;
    queue_->sync([&] { result = _onQueue_writeToDiskWithError(); });
    return result;
}

bool TarnDataProtectionChangeOperation::_stillMostCurrentUpdate() {
    bool current = false;
    queue_->sync([&] { current = _onQueue_stillMostCurrentUpdate(); });
    return current;
}

TarnStatus TarnDataProtectionChangeOperation::_deleteUpdateFileWithError() {
    TarnStatus result;
    queue_->sync([&] { result = _onQueue_deleteUpdateFileWithError(); });
    return result;
}

TarnStatus TarnDataProtectionChangeOperation::_onQueue_writeToDiskWithError() {
    if (!dataContainerMetadata_ || changeType_ == 0)
        return TARN_ERROR(TarnErrorBadInput, nullptr,
                          "Invalid Update Info: metadata: %@, changeType: %u",
                          dataContainerMetadata_, changeType_);
    const TarnMetadata& m = *dataContainerMetadata_;
    PlistValue d{PlistDict{}};
    d.set(kTarnDataOperationIdentifierKey, m.identifier());
    d.set(kTarnDataOperationContainerClassKey, uint64_t{m.containerClass()});
    d.set(kTarnDataOperationProtectionClassKey, newDataProtectionClass_);
    d.set(kTarnDataOperationChangeTypeKey, changeType_);
    d.set(kTarnDataOperationRetryIfLockedKey, retryIfLocked_);
    d.set(kTarnDataOperationInternalIDKey, internalChangeID_.string());
    if (TarnUserIdentity::isUserIdentityRequiredForContainerClass(m.containerClass()) &&
        m.userIdentity())
        d.set(kTarnDataOperationUserIdentityKey, m.userIdentity()->plist());

    const FileURL target = url();
    auto& fm = TarnFileManager::defaultManager();
    if (TarnStatus removed = fm.removeItemAtURL(target); !removed.ok())
        return TARN_ERROR(TarnErrorRemoveFileFailed, removed.error(),
                          "Failed to remove pending data protection file at %@", target);
    if (TarnStatus written =
            Tarn_writeToURL(d, target, kTarnWriteAtomic | kTarnWriteNoFileProtection);
        !written.ok())
        return TARN_ERROR(TarnErrorWriteFailed, written.error(),
                          "Failed to write data protection update dictionary to URL %@", target);
    return {};
}

bool TarnDataProtectionChangeOperation::_onQueue_stillMostCurrentUpdate() {
    const FileURL target = url();
    TarnResult<TarnDataProtectionUpdate> read =
        _readAndValidateDataProtectionUpdateAtURL(target, userIdentityCache_);
    if (!read.ok()) {
        TarnLog(kLogError, __func__, "Failed to read data protection update from %@", target);
        return false;
    }
    return read->internalChangeID == internalChangeID_;
}

TarnStatus TarnDataProtectionChangeOperation::_onQueue_deleteUpdateFileWithError() {
    if (!_onQueue_stillMostCurrentUpdate()) {
        TarnLog(kLogNotice, __func__, "Nothing to delete because there is a newer update for %@",
                describeContainer());
        return {};
    }
    return deleteUpdateFileWithContainerIdentity(*dataContainerMetadata_->containerIdentity());
}

// ---- Running ----

TarnResult<bool> TarnDataProtectionChangeOperation::_runChangeOperationNeedToRetry() {
    const TarnMetadata& m = *dataContainerMetadata_;
    // Container operations that take the write lock on this UUID (deletion,
    // replacement) wait for the pass, so it never walks a tree being moved.
    TarnScopedIdentifierLock lock(m.uuid().string(), /*writing=*/false);

    TarnResult<TarnMetadataRef> found =
        TarnClientConnection::sharedClientConnection().createOrLookupContainerWithContainerIdentity(
            m.containerIdentity()->baseIdentity(), /*createIfNecessary=*/false,
            /*transient=*/false, /*useLocking=*/false);
    if (!found.ok())
        return TARN_ERROR_IN(kPassTag, TarnErrorNotFound, found.error(),
                             "Failed to lookup container to set data protection for user "
                             "identity: %@, identifier: %@, Class: %llu",
                             m.userIdentity(), m.identifier(), m.containerClass());
    if ((*found)->url() != m.url())
        return TARN_ERROR_IN(kPassTag, TarnErrorInvalidPath, nullptr,
                             "Cancelling data protection operation because container path "
                             "changed on disk. This indicates the app may have been updated and "
                             "changed its protection level.");
    if (!_stillMostCurrentUpdate())
        return TARN_ERROR_IN(kPassTag, TarnErrorSuperseded, nullptr,
                             "Cancelling data protection operation because another more current "
                             "operation on this container has taken precedence");

    auto& fm = TarnFileManager::defaultManager();
    std::vector<FileURL> items;
    for (const std::string& name :
         TarnGlobalConfiguration::sharedInstance().appUserDataItemNames()) {
        FileURL item = PathJoin(m.url(), name);
        if (item.empty()) {
            TarnLog(kLogError, kPassTag, "itemURL is nil for item: %@", name);
            continue;
        }
        if (fm.itemExistsAtURL(item)) items.push_back(std::move(item));
    }

    const int32_t newClass = newDataProtectionClass_;
    const int32_t fileTarget = newClass == 0 ? kTarnDataProtectionClassC : newClass;
    const bool directories = changeType_ & kTarnChangeDirectories;
    const bool files = changeType_ & kTarnChangeFiles;
    const bool onlyStronger = changeType_ & kTarnChangeFilesOnlyToStrongerClass;

    TarnErrorRef failure;
    // Sets one entry's class; false ends the walk with `failure`.
    auto set = [&](const FsWalkEntry& entry, int32_t toClass,
                   const TarnDataProtectionPredicate& predicate) {
        auto changing = [&](int32_t current) {
            if (!predicate(current)) return false;
            TarnLog(kLogDebug, kPassTag, "Setting protection class of %s to %d", entry.path,
                    toClass);
            return true;
        };
        TarnStatus s = fm.setDataProtectionClassOfItemInDirectory(entry.parentFd, entry.name,
                                                                  entry.path, toClass, changing);
        if (s.ok()) return true;
        if (s.error() && s.error()->posixCode() == EBADF) {
            TarnLog(kLogError, kPassTag,
                    "Ignoring failure to set protection class to %d on %@ (mode 0%o): %@", toClass,
                    entry.path, entry.st.mode, s.error());
            return true;
        }
        failure = s.error();
        return false;
    };

    for (const FileURL& item : items) {
        const int err = FsWalk(item, [&](const FsWalkEntry& entry) {
            switch (entry.type) {
                case FsWalkType::Directory:
                case FsWalkType::Symlink:
                case FsWalkType::Other:
                    return true;
                case FsWalkType::DirectoryPost:
                    if (!directories) return true;
                    return set(entry, newClass, [](int32_t current) {
                        return current != kTarnDataProtectionClassB;
                    });
                case FsWalkType::File:
                    if (!files) return true;
                    return set(entry, fileTarget, [&](int32_t current) {
                        return current != kTarnDataProtectionClassB && current != fileTarget &&
                               !(onlyStronger && fileTarget > current);
                    });
                case FsWalkType::Error:
                    break;
            }
            TarnLog(kLogError, kPassTag, "FTS returned error for %s : %s", entry.path,
                    errText(entry.error));
            return true;
        });
        if (failure) break;
        if (err != 0 && err != ECANCELED)
            return TARN_POSIX_ERROR_IN(kPassTag, err, "fts_open failed for %@ : %s", item,
                                       errText(err));
    }
    if (!failure) return false;
    // Not permitted: an item of a class whose keys are gone while locked.
    if (failure->posixCode() == EPERM) return true;
    return failure;
}

void TarnDataProtectionChangeOperation::performChangeOperation() {
    TarnResult<bool> pass =
        TarnFenceExceptions(kPerformTag, [&] { return _runChangeOperationNeedToRetry(); });
    bool locked = pass.valueOr(false);
    TarnErrorRef error = pass.error();
    if (!pass.ok())
        TarnLog(kLogNotice, kPerformTag,
                "Operation to update protection classes for %@ to class %d failed with error %@",
                describeContainer(), newDataProtectionClass_, error);

    if (locked && retryIfLocked_) {
        TarnLog(kLogNotice, kPerformTag,
                "Retrying container protection update to %d on next unlock for %@",
                newDataProtectionClass_, describeContainer());
        // Act on the lock now rather than when its notification arrives: until
        // the queue is suspended the retry would run at once and meet the lock
        // again, over and over.
        TarnLockStateCallback();
        transactionAsync(TarnLockStateQueue(), [self = shared_from_this()] {
            (void)TarnFenceExceptions(kPerformTag, [&] {
                if (!self->retried_ && self->retryStartBlock_) self->retryStartBlock_();
                self->retried_ = true;
                self->performChangeOperation();
            });
        });
        return;
    }
    if (locked)
        error = TARN_ERROR_IN(kPerformTag, TarnErrorLockedNotRetried, nullptr,
                              "Tried to update %@ to protection class %d, but was locked and "
                              "didn't retry",
                              describeContainer(), newDataProtectionClass_);
    if (TarnStatus deleted = _deleteUpdateFileWithError(); !deleted.ok())
        TarnLog(kLogError, kPerformTag, "Failed to delete update file for %@, protection class %d",
                describeContainer(), newDataProtectionClass_);
    if (completionBlock_) completionBlock_(locked, error);
}

}  // namespace tarn
