// Wiping a data container: a fresh container of the same identity is made in
// the transient tree and swapped in by a replacement that keeps the old
// directory and UUID, so clients holding the path or the UUID keep them;
// the old contents go to death row.
#include <algorithm>

#include "Daemon/TarnClientConnection.h"
#include "Daemon/TarnError.h"
#include "Daemon/TarnLog.h"

namespace tarn {

namespace {

// A plain line and a bare code: the client learns the code, the log the reason.
TarnErrorRef refused(uint64_t code) {
    return TARN_ERROR_CODE_IN("deleteDataContainerContentWithContainerIdentity", code, nullptr);
}

}  // namespace

TarnStatus TarnClientConnection::deleteDataContainerContentWithContainerIdentity(
    const TarnContainerIdentityRef& identity) {
    if (!identity) {
        TarnLog(kLogError, __func__, "Can't wipe container with nil identifier: %@", identity);
        return refused(TarnErrorMissingIdentifier);
    }
    const std::string& identifier = identity->identifier();
    const TarnContainerClass containerClass = identity->containerClass();
    if (!TarnContainerClassIsPerUser(containerClass)) {
        TarnLog(kLogError, __func__,
                "Can't wipe container non-data container of type: %llu, identifier: %@",
                containerClass, identifier);
        return refused(TarnErrorInvalidArgument);
    }
    if (!unrestricted_) {
        if (containerClass != TarnContainerClassPluginData) {
            TarnLog(kLogError, __func__, "Can't wipe container with of type: %llu, identifier: %@",
                    containerClass, identifier);
            return refused(TarnErrorInvalidArgument);
        }
        const PlistArray* entitled =
            entitledWipeIdentifiers_ ? entitledWipeIdentifiers_->asArray() : nullptr;
        const bool listed =
            entitled && std::any_of(entitled->begin(), entitled->end(), [&](const PlistValue& v) {
                const std::string* s = v.asString();
                return s && *s == identifier;
            });
        if (!listed) {
            TarnLog(kLogError, __func__, "Not entitled to wipe container with identifier: %@",
                    identifier);
            return refused(TarnErrorNotEntitled);
        }
    }
    // The wipe has been authorised above; the look-ups below must not ask again.
    allowOtherIdLookup_ = true;

    TarnResult<TarnMetadataRef> existing = createOrLookupContainerWithContainerIdentity(
        identity, /*createIfNecessary=*/false, /*transient=*/false, /*useLocking=*/true);
    TarnConcreteContainerIdentityRef oldIdentity =
        existing.ok() ? (*existing)->containerIdentity() : nullptr;
    if (!oldIdentity) {
        TarnLog(kLogError, __func__, "Failed to lookup existing container to wipe-identifier: %@",
                identifier);
        return existing.ok() ? refused(TarnErrorInvalidArgument) : existing.error();
    }
    TarnResult<TarnMetadataRef> fresh = createOrLookupContainerWithContainerIdentity(
        identity, /*createIfNecessary=*/true, /*transient=*/true, /*useLocking=*/true);
    TarnConcreteContainerIdentityRef newIdentity =
        fresh.ok() ? (*fresh)->containerIdentity() : nullptr;
    if (!newIdentity) {
        TarnLog(kLogError, __func__, "Failed to create transient container for wipe-identifier: %@",
                identifier);
        return fresh.ok() ? refused(TarnErrorInvalidArgument) : fresh.error();
    }
    if (TarnStatus replaced = replaceContainerIdentity(oldIdentity, newIdentity,
                                                       /*preserveOldUUID=*/true,
                                                       /*startDeletionThread=*/true);
        !replaced.ok()) {
        TarnLog(kLogError, __func__, "Failed replace operation during delete all content");
        return replaced;
    }
    return {};
}

}  // namespace tarn
