// The command table: 33 rows, indexed by the request's "Command" number, each
// naming the handler, the entitlement that grants the command and how the
// request processor treats it. The one place that lists command numbers.
#pragma once

#include <cstdint>
#include <memory>

#include "Daemon/TarnRequestContext.h"
#include "Platform/PropertyList.h"

namespace tarn {

class TarnClientConnection;

// A handler writes reply keys into `reply` and, on failure, a code into *error
// (the request's error slot: TarnSuccess until something fails). It never sends the
// reply itself unless its row has replyOnReturn 0; then, once it has started
// its operation, the operation's completion answers through
// context.deferredReply.
using TarnCommandHandler = void (*)(const TarnRequestContext& context, const PlistValue& request,
                                    PlistValue& reply, TarnClientConnection* connection,
                                    uint64_t* error);

struct TarnCommandTableRow {
    uint64_t command = 0;
    TarnCommandHandler handler = nullptr;  // null: the command answers TarnErrorInvalidCommand
    const char* entitlement = nullptr;
    // The processor answers when the handler returns; 0: on success the
    // handler's completion answers.
    uint8_t replyOnReturn = 1;
    // A connection is built even for a caller without the entitlement (it
    // then applies the per-container lookup rules).
    uint8_t anyClient = 0;
    // The caller's lookup entitlement is honoured.
    uint8_t lookupAllowed = 0;
};

inline constexpr size_t kTarnCommandCount = 33;
extern const TarnCommandTableRow gTarnCommandTable[kTarnCommandCount];

// Entitlement keys.
inline constexpr const char* kTarnEntitlementAllowed = "com.ostrea.private.TarnKeeper.allowed";
inline constexpr const char* kTarnEntitlementOtherIdLookup =
    "com.ostrea.private.TarnKeeper.otherIdLookup";
inline constexpr const char* kTarnEntitlementLookup = "com.ostrea.private.TarnKeeper.lookup";
inline constexpr const char* kTarnEntitlementWipeContainer =
    "com.ostrea.private.TarnKeeper.wipeContainer";
inline constexpr const char* kTarnEntitlementDeleteContainerContent =
    "com.ostrea.private.TarnKeeper.deleteContainerContent";
inline constexpr const char* kTarnEntitlementUserManagedAssets =
    "com.ostrea.private.TarnKeeper.userManagedAssets";
inline constexpr const char* kTarnEntitlementDataMigration =
    "com.ostrea.private.TarnKeeper.dataMigration";
inline constexpr const char* kTarnEntitlementTestability =
    "com.ostrea.private.TarnKeeper.testability";
inline constexpr const char* kTarnEntitlementStageSharedContent =
    "com.ostrea.private.TarnKeeper.stageSharedContent";

// Handlers that do not exist yet answer TarnErrorInvalidCommand through a
// null entry; this one is for a command that never will (27).
void TarnHandleUnsupportedCommand(const TarnRequestContext& context, const PlistValue& request,
                                  PlistValue& reply, TarnClientConnection* connection,
                                  uint64_t* error);

}  // namespace tarn
