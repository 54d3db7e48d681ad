#include "Daemon/TarnRequestProcessor.h"

#include "Daemon/TarnClientConnection.h"
#include "Daemon/TarnClientIdentity.h"
#include "Daemon/TarnCodeSigningMapping.h"
#include "Daemon/TarnCommandTable.h"
#include "Daemon/TarnError.h"
#include "Daemon/TarnExceptionFence.h"
#include "Daemon/TarnGlobalConfiguration.h"
#include "Daemon/TarnLog.h"
#include "Platform/CodeSignRegistry.h"
#include "Platform/Conduit.h"
#include "Platform/PersonaRoster.h"
#include "Platform/PlatformLog.h"

namespace tarn {

namespace {

constexpr const char* kTag = "TarnProcessConduitEvent";
constexpr const char* kGateTag = "checkEntitlementsAndInitClientObject";

// The reply of a request whose completion answers (rows with replyOnReturn 0).
class ConduitDeferredReply final : public TarnDeferredReply {
  public:
    explicit ConduitDeferredReply(conduit::MessageRef reply) : reply_(std::move(reply)) {}
    PlistValue& body() override { return reply_->body(); }
    void send(uint64_t code) override {
        reply_->body().set("ReplyError", PlistValue(code));
        if (auto remote = reply_->remoteConnection()) remote->send(reply_);
    }

  private:
    conduit::MessageRef reply_;
};

// The command's row, or nullptr with its line and TarnErrorInvalidCommand.
const TarnCommandTableRow* commandTableRow(uint64_t command, uint64_t* error) {
    if (command >= kTarnCommandCount) {
        TarnLog(kLogError, kTag, "Invalid command index: %lld", command);
    } else if (gTarnCommandTable[command].command != command) {
        TarnLog(kLogError, kTag, "Invalid command at index %llu", command);
    } else if (!gTarnCommandTable[command].handler) {
        TarnLog(kLogError, kTag, "Invalid command handler: %lld", command);
    } else {
        return &gTarnCommandTable[command];
    }
    TarnSetError(error, TarnErrorInvalidCommand);
    return nullptr;
}

// Admission: the caller's identity, the entitlement gate, the registration of
// the caller's entitlements and the client connection with the caller's
// rights. Fills the context's persona; nullptr with TarnErrorNotEntitled for
// a caller the gate turns away.
std::shared_ptr<TarnClientConnection> admitClient(const std::shared_ptr<conduit::Connection>& peer,
                                                  const TarnCommandTableRow& row,
                                                  TarnRequestContext& context,
                                                  TarnClientIdentity::Reuse* reuse,
                                                  uint64_t* error) {
    auto codeSignInfo = TarnClientIdentity::codeSignInfoForConnection(peer);
    context.personaUniqueString = codeSignInfo ? codeSignInfo->personaUniqueString : std::nullopt;
    TarnClientIdentityRef identity =
        TarnClientIdentity::clientIdentityWithConduitConnection(peer, codeSignInfo, reuse);
    TarnEntitlementGate gate = TarnCheckEntitlements(identity, row);
    if (!gate.admitted) {
        TarnLog(kLogError, kGateTag, "connection attempt from pid %d (%@) is not entitled",
                identity ? identity->posixPID() : peer->pid(),
                identity ? identity->bundleIdentifier() : std::string("(null)"));
        TarnSetError(error, TarnErrorNotEntitled);
        return nullptr;
    }
    // Without a code-signing store (it could not be opened) there is nothing
    // to register; the request itself still goes ahead.
    TarnCodeSigningMapping* mapping = TarnCodeSigningMapping::sharedInstance();
    if (identity && mapping) {
        TarnStatus registered = mapping->processCallerRegisteredEntitlements(
            *identity->entitlements().asDict(), identity->bundleIdentifier(),
            context.commandQueue.get());
        if (!registered.ok())
            TarnLog(kLogError, kGateTag, "Error processing entitlements for %@ : %llu",
                    identity->bundleIdentifier(), registered.code(TarnErrorDatabase));
    }
    return TarnClientConnection::initWithClientIdentity(
        identity, gate.entitled, gate.allowOtherIdLookup, gate.unrestricted, gate.lookup,
        gate.wipeList, context.commandQueue);
}

// The handler, then the request's queued commands. The queue runs even after
// a handler that threw: what was queued before (staged deletions, say) was
// asked for by this request.
void runCommand(const TarnCommandTableRow& row, const TarnRequestContext& context,
                const PlistValue& request, PlistValue& reply, TarnClientConnection& connection,
                uint64_t* error) {
    auto fenced = [&](auto&& step) {
        TarnStatus status = TarnFenceExceptions(kTag, step);
        if (!status.ok()) *error = status.code(TarnErrorException);
    };
    fenced([&] { row.handler(context, request, reply, &connection, error); });
    fenced([&] { connection.completeWithError(error); });
}

}  // namespace

TarnEntitlementGate TarnCheckEntitlements(const TarnClientIdentityRef& identity,
                                          const TarnCommandTableRow& row) {
    TarnEntitlementGate g;
    if (!identity) {
        g.admitted = row.anyClient;
        return g;
    }
    const std::string_view key = row.entitlement;
    if (identity->boolValueOfEntitlement(kTarnEntitlementAllowed)) {
        g.allowOtherIdLookup = true;
        g.unrestricted = key != kTarnEntitlementTestability;
    } else {
        g.allowOtherIdLookup = identity->boolValueOfEntitlement(kTarnEntitlementOtherIdLookup);
        if (row.lookupAllowed) {
            if (auto* l = identity->entitlements().find(kTarnEntitlementLookup); l && l->isDict())
                g.lookup = *l;
        }
    }
    if (key == kTarnEntitlementWipeContainer) {
        auto* w = identity->entitlements().find(key);
        if (w && w->isArray()) {
            g.wipeList = *w;
            g.entitled = true;
        } else {
            TarnLog(kLogError, kGateTag, "No entitled containers to wipe");
            g.entitled = g.unrestricted;
        }
    } else {
        g.entitled = g.unrestricted || identity->boolValueOfEntitlement(key);
    }
    g.admitted = row.anyClient || g.lookup || g.entitled;
    return g;
}

void TarnProcessConduitEvent(const std::shared_ptr<conduit::Connection>& peer,
                             const conduit::Event& event, TarnClientIdentity::Reuse* reuse) {
    if (event.kind != conduit::Event::Kind::Message || !event.message) return;
    uint64_t error = TarnSuccess;
    const PlistValue& request = event.message->body();
    uint64_t command = 0;
    if (const PlistValue* c = request.find("Command")) command = c->asUInt64().value_or(0);

    conduit::MessageRef reply = event.message->createReply();
    if (!reply) {
        TarnLog(kLogError, kTag, "Dictionary does not have reply context");
        peer->cancel();
        return;
    }

    // The attribute strings are built only when someone records signposts.
    const bool recording = PlatformLogVerbose();
    SignpostInterval signpost(
        "conduit", recording ? "ConduitEventProcessing" : std::string(),
        recording
            ? std::vector<std::pair<std::string, std::string>>{{"command", std::to_string(command)}}
            : std::vector<std::pair<std::string, std::string>>{});

    std::shared_ptr<TarnClientConnection> connection;
    const TarnCommandTableRow* row = commandTableRow(command, &error);
    if (row) {
        TarnRequestContext context;
        context.commandQueue = std::make_shared<TarnCommandQueue>();
        if (!row->replyOnReturn)
            context.deferredReply = std::make_shared<ConduitDeferredReply>(reply);
        connection = admitClient(peer, *row, context, reuse, &error);
        if (connection) runCommand(*row, context, request, reply->body(), *connection, &error);
    }

    // "<unknown>" means no connection was made; a connection without a bundle
    // identifier (a caller admitted without an identity) prints as nil does.
    std::string client = "<unknown>";
    if (connection) {
        client = connection->clientBundleIdentifier();
        if (client.empty()) client = "(null)";
    }
    if (recording)
        signpost.end({{"command", std::to_string(command)}, {"clientIdentifier", client}});
    else
        signpost.end();
    // Before the reply, so that whoever reads the platform-log file after the
    // answer finds the line; without a file it is only queued (PlatformLog.h).
    PlatformLog("conduit", PlatformLogType::Default, "command=%llu, client=%@, error=%llu", command,
                client, error);
    if (!(error == TarnSuccess && row && row->replyOnReturn == 0)) {
        reply->body().set("ReplyError", PlistValue(error));
        peer->send(reply);
    }
}

}  // namespace tarn
