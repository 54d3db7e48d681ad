#include "Daemon/TarnReplaceCommands.h"

#include "Daemon/TarnClientConnection.h"
#include "Daemon/TarnContainerCommands.h"
#include "Daemon/TarnError.h"

namespace tarn {

namespace {

// A foreign (file-layer) error or none answers this.
constexpr uint64_t kHandlerFallback = TarnErrorInvalidArgument;

constexpr TarnConcreteIdentityKeys kOldKeys{.identifier = "OldIdentifier",
                                            .containerClass = "OldContainerClass",
                                            .uuid = "OldContainerUUID",
                                            .personaUniqueString = "OldPersonaUniqueString"};
constexpr TarnConcreteIdentityKeys kNewKeys{.identifier = "NewIdentifier",
                                            .containerClass = "NewContainerClass",
                                            .uuid = "NewContainerUUID",
                                            .personaUniqueString = "NewPersonaUniqueString"};

void wipe(const PlistValue& request, TarnClientConnection& connection, uint64_t* error,
          TarnContainerClass containerClass) {
    const std::optional<std::string> identifier = stringForKey(request, "Identifier");
    // Without an identifier the wipe itself refuses, with its own line.
    TarnContainerIdentityRef identity;
    if (identifier) {
        TarnResult<TarnUserIdentityRef> user =
            userIdentityForContainerIdentifier(connection, identifier, containerClass);
        if (!TarnReport(user, error, kHandlerFallback)) return;
        TarnResult<TarnContainerIdentityRef> made =
            TarnContainerIdentity::containerIdentityWithUserIdentity(std::move(*user), identifier,
                                                                     containerClass);
        if (!TarnReport(made, error, kHandlerFallback)) return;
        identity = std::move(*made);
    }
    (void)TarnReport(connection.deleteDataContainerContentWithContainerIdentity(identity), error,
                     kHandlerFallback);
}

}  // namespace

void TarnHandleReplaceCommand(const TarnRequestContext& context, const PlistValue& request,
                              PlistValue& reply, TarnClientConnection* connection,
                              uint64_t* error) {
    // No old identifier: nothing is replaced, the new container is promoted.
    TarnResult<TarnConcreteContainerIdentityRef> oldIdentity =
        concreteContainerIdentity(request, *connection, kOldKeys);
    if (!oldIdentity.ok() && oldIdentity.code(kHandlerFallback) != TarnErrorMissingIdentifier) {
        (void)TarnReport(oldIdentity, error, kHandlerFallback);
        return;
    }
    TarnResult<TarnConcreteContainerIdentityRef> newIdentity =
        concreteContainerIdentity(request, *connection, kNewKeys);
    if (!TarnReport(newIdentity, error, kHandlerFallback)) return;
    (void)TarnReport(
        connection->replaceContainerIdentity(oldIdentity.valueOr(nullptr), *newIdentity,
                                             /*preserveOldUUID=*/false,
                                             /*startDeletionThread=*/false),
        error, kHandlerFallback);
}

void TarnHandleWipeContainerCommand(const TarnRequestContext& context, const PlistValue& request,
                                    PlistValue& reply, TarnClientConnection* connection,
                                    uint64_t* error) {
    wipe(request, *connection, error, TarnContainerClassPluginData);
}

void TarnHandleWipeAnyContainerCommand(const TarnRequestContext& context, const PlistValue& request,
                                       PlistValue& reply, TarnClientConnection* connection,
                                       uint64_t* error) {
    // The command's own entitlement grants every container.
    connection->setUnrestricted(true);
    wipe(request, *connection, error, uint64ForKey(request, "ContainerClass"));
}

}  // namespace tarn
