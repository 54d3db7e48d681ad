#include "Daemon/TarnAssetCommands.h"

#include <optional>
#include <string>

#include "Daemon/TarnClientConnection.h"
#include "Daemon/TarnContainerCommands.h"
#include "Daemon/TarnContainerIdentity.h"
#include "Daemon/TarnError.h"
#include "Daemon/TarnResult.h"

namespace tarn {

namespace {

// A foreign (file-layer) error or none answers this.
constexpr uint64_t kHandlerFallback = TarnErrorInvalidArgument;

// The data container (class 2) named by "Identifier", for the persona the
// caller may act for.
TarnResult<TarnContainerIdentityRef> assetsContainerIdentity(
    const PlistValue& request, const TarnClientConnection& connection) {
    const std::optional<std::string> identifier = stringForKey(request, "Identifier");
    const TarnUserIdentityRef user = TARN_TRY(
        userIdentityForContainerIdentifier(connection, identifier, TarnContainerClassAppData));
    return TarnContainerIdentity::containerIdentityWithUserIdentity(user, identifier,
                                                                    TarnContainerClassAppData);
}

}  // namespace

void TarnHandleStageSharedContentCommand(const TarnRequestContext& context,
                                         const PlistValue& request, PlistValue& reply,
                                         TarnClientConnection* connection, uint64_t* error) {
    TarnResult<FileURL> staged = connection->stageSharedContentForIdentifier(
        stringForKey(request, "Identifier"), stringForKey(request, "SourcePath"),
        stringForKey(request, "DestPath"));
    if (!TarnReport(staged, error, kHandlerFallback)) return;
    reply.set("ReplyPath", std::move(*staged));
}

void TarnHandleUserManagedAssetsPathCommand(const TarnRequestContext& context,
                                            const PlistValue& request, PlistValue& reply,
                                            TarnClientConnection* connection, uint64_t* error) {
    TarnResult<TarnContainerIdentityRef> identity = assetsContainerIdentity(request, *connection);
    if (!TarnReport(identity, error, kHandlerFallback)) return;
    TarnResult<TarnClientConnection::AssetsPath> assets =
        connection->userManagedAssetsPathWithContainerIdentity(
            *identity, boolForKey(request, "IsRelative"), boolForKey(request, "CreateIfNecessary"));
    if (!TarnReport(assets, error, kHandlerFallback)) return;
    reply.set("ReplyPath", assets->path);
    reply.set("ReplyExisted", assets->existed);
}

void TarnHandleDeleteUserManagedAssetCommand(const TarnRequestContext& context,
                                             const PlistValue& request, PlistValue& reply,
                                             TarnClientConnection* connection, uint64_t* error) {
    TarnResult<TarnContainerIdentityRef> identity = assetsContainerIdentity(request, *connection);
    if (!TarnReport(identity, error, kHandlerFallback)) return;
    (void)TarnReport(connection->deleteUserManagedAssetWithContainerIdentity(
                         *identity, stringForKey(request, "SourcePath")),
                     error, kHandlerFallback);
}

}  // namespace tarn
