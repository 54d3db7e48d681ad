// Handlers of the code-signing and group commands that change or read the
// code-signing mapping as a whole: 14 (the group identifiers of an owner), 18
// (record code-signing information) and 20 (invalidate applications without
// a bundle container). Same contract as every handler (TarnCommandTable.h).
#pragma once

#include <cstdint>

#include "Daemon/TarnRequestContext.h"
#include "Platform/PropertyList.h"

namespace tarn {

class TarnClientConnection;

// "Identifier" (the caller's own by default) → "ReplyGroupIdentifiersArray".
void TarnHandleGroupIdentifiersCommand(const TarnRequestContext& context, const PlistValue& request,
                                       PlistValue& reply, TarnClientConnection* connection,
                                       uint64_t* error);  // 14
// "CodeSigningInfo" (dictionary; absent removes the identifier's record),
// "Identifier", "OptionsDictionary". Values of the wrong type are refused
// with TarnErrorInvalidArgument before anything changes.
void TarnHandleProcessCodeSigningInfoCommand(const TarnRequestContext& context,
                                             const PlistValue& request, PlistValue& reply,
                                             TarnClientConnection* connection,
                                             uint64_t* error);  // 18
void TarnHandleInvalidateAppsWithoutBundleCommand(const TarnRequestContext& context,
                                                  const PlistValue& request, PlistValue& reply,
                                                  TarnClientConnection* connection,
                                                  uint64_t* error);  // 20

}  // namespace tarn
