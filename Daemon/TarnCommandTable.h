// The command table: 33 rows, indexed by the request's "Command" number, each
// naming the handler, the entitlement that grants the command and how the
// request processor treats it. The one place that lists command numbers.
#pragma once

#include <cstdint>
#include <memory>

#include "Platform/PropertyList.h"

namespace tarn {

class TarnClientConnection;

// A handler writes reply keys into `reply` and, on failure, a code into *error.
// It never sends the reply itself unless its row has replyOnReturn 0.
using TarnCommandHandler = void (*)(const PlistValue& request, PlistValue& reply,
                                    TarnClientConnection* connection, uint64_t* error);

struct TarnCommandTableRow {
    uint64_t command;
    TarnCommandHandler handler;  // may be null: the command answers 49
    const char* entitlement;
    uint8_t replyOnReturn;
    uint8_t anyClient;
    uint8_t lookupAllowed;
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

// Asynchronous replies (rows with replyOnReturn 0): inside a handler, take the
// request's reply; the completion later calls send(code), which sets
// "ReplyError" and sends it. Valid only on the handler's thread, while it runs.
class TarnDeferredReply {
public:
    virtual ~TarnDeferredReply() = default;
    virtual PlistValue& body() = 0;
    virtual void send(uint64_t code) = 0;
};
std::shared_ptr<TarnDeferredReply> TarnTakeDeferredReply();

// Handlers that do not exist yet answer 49 through a null entry; this one is
// for commands that never will (27).
void TarnHandleUnsupportedCommand(const PlistValue& request, PlistValue& reply,
                                  TarnClientConnection* connection, uint64_t* error);

}  // namespace tarn
