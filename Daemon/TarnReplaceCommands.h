// Handlers of the replacement command (2) and of the two wipes (11: an
// entitled plug-in data container; 12: a data container of any class, for a
// client entitled to delete container content). Same conventions as the
// container handlers (Daemon/TarnContainerCommands.h).
#pragma once

#include <cstdint>

#include "Daemon/TarnRequestContext.h"
#include "Platform/PropertyList.h"

namespace tarn {

class TarnClientConnection;

void TarnHandleReplaceCommand(const TarnRequestContext& context, const PlistValue& request,
                              PlistValue& reply, TarnClientConnection* connection,
                              uint64_t* error);  // 2
void TarnHandleWipeContainerCommand(const TarnRequestContext& context, const PlistValue& request,
                                    PlistValue& reply, TarnClientConnection* connection,
                                    uint64_t* error);  // 11
void TarnHandleWipeAnyContainerCommand(const TarnRequestContext& context, const PlistValue& request,
                                       PlistValue& reply, TarnClientConnection* connection,
                                       uint64_t* error);  // 12

}  // namespace tarn
