// Handler of the data-protection command: sets the class of a data container
// and answers from the change's completion (a row with replyOnReturn 0).
#pragma once

#include <cstdint>

#include "Daemon/TarnRequestContext.h"
#include "Platform/PropertyList.h"

namespace tarn {

class TarnClientConnection;

// Request keys: "Identifier" (required), "ContainerClass", "DataProtectionClass"
// (int64), "IsThirdParty" (bool), "RetryIfLocked" (bool). Answers exactly
// once: through the error slot when it fails before the change starts,
// otherwise through the request's deferred reply.
void TarnHandleSetDataProtectionCommand(const TarnRequestContext& context,
                                        const PlistValue& request, PlistValue& reply,
                                        TarnClientConnection* connection, uint64_t* error);  // 21

}  // namespace tarn
