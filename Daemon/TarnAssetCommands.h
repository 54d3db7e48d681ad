// Handlers of the user-managed assets and shared-content commands: 26 (stage
// shared content in a system group container), 28 (the assets path), 29
// (delete one asset).
// Same contract as every handler (TarnCommandTable.h).
#pragma once

#include <cstdint>

#include "Daemon/TarnRequestContext.h"
#include "Platform/PropertyList.h"

namespace tarn {

class TarnClientConnection;

void TarnHandleStageSharedContentCommand(const TarnRequestContext& context,
                                         const PlistValue& request, PlistValue& reply,
                                         TarnClientConnection* connection, uint64_t* error);  // 26
void TarnHandleUserManagedAssetsPathCommand(const TarnRequestContext& context,
                                            const PlistValue& request, PlistValue& reply,
                                            TarnClientConnection* connection,
                                            uint64_t* error);  // 28
void TarnHandleDeleteUserManagedAssetCommand(const TarnRequestContext& context,
                                             const PlistValue& request, PlistValue& reply,
                                             TarnClientConnection* connection,
                                             uint64_t* error);  // 29

}  // namespace tarn
