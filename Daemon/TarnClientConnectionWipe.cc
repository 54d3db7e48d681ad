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

    // The container of the identity, existing or made fresh in the transient
    // tree; a failure writes `line` and answers the look-up's error.
    const auto concrete = [&](bool fresh,
                              const char* line) -> TarnResult<TarnConcreteContainerIdentityRef> {
        TarnResult<TarnMetadataRef> found = createOrLookupContainerWithContainerIdentity(
            identity, /*createIfNecessary=*/fresh, /*transient=*/fresh, /*useLocking=*/true);
        TarnConcreteContainerIdentityRef made =
            found.ok() ? (*found)->containerIdentity() : nullptr;
        if (made) return made;
        TarnLog(kLogError, "deleteDataContainerContentWithContainerIdentity", line, identifier);
        return found.ok() ? refused(TarnErrorInvalidArgument) : found.error();
    };
    const TarnConcreteContainerIdentityRef oldIdentity =
        TARN_TRY(concrete(false, "Failed to lookup existing container to wipe-identifier: %@"));
    const TarnConcreteContainerIdentityRef newIdentity =
        TARN_TRY(concrete(true, "Failed to create transient container for wipe-identifier: %@"));
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
