// Handlers of the group, system-container and persona commands: 13 (the
// caller's group containers), 15 (a system container's path), 16 (system
// group containers of an owner), 17 (one system group container's path), 25
// (the crash-and-retry test) and 32 (persona strings visible to the caller).
// Same contract as every handler (TarnCommandTable.h).
#pragma once

#include <cstdint>

#include "Daemon/TarnRequestContext.h"
#include "Platform/PropertyList.h"

namespace tarn {

class TarnClientConnection;

void TarnHandleGroupContainersCommand(const TarnRequestContext& context, const PlistValue& request,
                                      PlistValue& reply, TarnClientConnection* connection,
                                      uint64_t* error);  // 13
void TarnHandleSystemContainerPathCommand(const TarnRequestContext& context,
                                          const PlistValue& request, PlistValue& reply,
                                          TarnClientConnection* connection, uint64_t* error);  // 15
void TarnHandleSystemGroupContainersCommand(const TarnRequestContext& context,
                                            const PlistValue& request, PlistValue& reply,
                                            TarnClientConnection* connection,
                                            uint64_t* error);  // 16
void TarnHandleSystemGroupContainerPathCommand(const TarnRequestContext& context,
                                               const PlistValue& request, PlistValue& reply,
                                               TarnClientConnection* connection,
                                               uint64_t* error);  // 17
void TarnHandleRetryTestCommand(const TarnRequestContext& context, const PlistValue& request,
                                PlistValue& reply, TarnClientConnection* connection,
                                uint64_t* error);  // 25
void TarnHandlePersonaStringsCommand(const TarnRequestContext& context, const PlistValue& request,
                                     PlistValue& reply, TarnClientConnection* connection,
                                     uint64_t* error);  // 32

}  // namespace tarn
