#include "Daemon/TarnDataProtectionCommands.h"

#include "Daemon/TarnClientConnection.h"
#include "Daemon/TarnContainerCommands.h"
#include "Daemon/TarnDataProtectionManager.h"

namespace tarn {

void TarnHandleSetDataProtectionCommand(const TarnRequestContext& context,
                                        const PlistValue& request, PlistValue& reply,
                                        TarnClientConnection* connection, uint64_t* error) {
    TarnResult<TarnContainerIdentityRef> identity =
        validatedContainerIdentity(request, *connection, "Identifier", "ContainerClass");
    if (!TarnReport(identity, error, TarnErrorInvalidArgument)) return;

    // One reply per request. The processor answers when the slot holds a
    // failure after the handler and its completeWithError(); the change's
    // completion answers otherwise. So the commands this request queued run
    // here, before the change starts: a failing one is the request's answer
    // and the change never starts. Nothing can be queued after this point, so
    // the processor's own run finds the queue empty and leaves the slot at
    // success, and the completion's reply is the only one.
    if (!connection->completeWithError(error)) {
        // The request ends at its first failure; the rest is not run later.
        connection->commandQueue()->removeAllCommands();
        return;
    }
    std::function<void(uint64_t)> completion;
    if (std::shared_ptr<TarnDeferredReply> deferred = context.deferredReply)
        completion = [deferred](uint64_t code) { deferred->send(code); };

    int32_t dataProtectionClass = 0;
    if (const PlistValue* value = request.find("DataProtectionClass"); value && value->isInteger())
        dataProtectionClass = static_cast<int32_t>(value->asInt64().value_or(0));
    TarnDataProtectionManager::defaultManager()
        .setDataProtectionOnDataContainerForContainerIdentity(
            *identity, dataProtectionClass, boolForKey(request, "IsThirdParty"),
            boolForKey(request, "RetryIfLocked"), std::move(completion));
}

}  // namespace tarn
