// Handlers of the migration commands: 24 (the data migrator's once-per-device
// migration) and 30 (the per-user migration). Both answer the migrator's
// code; work they stage (group containers no entitlement names any more,
// deprecated containers) runs on the request's command queue afterwards.
// Same contract as every handler (TarnCommandTable.h).
#pragma once

#include <cstdint>

#include "Daemon/TarnRequestContext.h"
#include "Platform/PropertyList.h"

namespace tarn {

class TarnClientConnection;

void TarnHandleDataMigrationCommand(const TarnRequestContext& context, const PlistValue& request,
                                    PlistValue& reply, TarnClientConnection* connection,
                                    uint64_t* error);  // 24
void TarnHandlePerUserDataMigrationCommand(const TarnRequestContext& context,
                                           const PlistValue& request, PlistValue& reply,
                                           TarnClientConnection* connection,
                                           uint64_t* error);  // 30

}  // namespace tarn
