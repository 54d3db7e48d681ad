// Handlers of the container commands (create or look up, list, stage for
// deletion, death-row deletion, info values, metadata, structure repair,
// directory UUID, deletion, disk usage) and the request-decoding rules that
// every container-related handler shares.
//
// Handlers run on the request's thread, inside the request processor, with the
// request's own client connection; they write reply keys and, on failure, a
// code into the error slot (which starts at TarnSuccess). A handler that fails before it
// reaches its connection operation writes no reply key. Decoding never trusts
// a value's type: a key holding the wrong type reads as missing.
#pragma once

#include <cstdint>
#include <functional>
#include <optional>
#include <string>
#include <string_view>

#include "Daemon/TarnContainerClass.h"
#include "Daemon/TarnContainerIdentity.h"
#include "Daemon/TarnMetadata.h"
#include "Daemon/TarnRequestContext.h"
#include "Daemon/TarnResult.h"
#include "Daemon/TarnUserIdentity.h"
#include "Platform/PropertyList.h"

namespace tarn {

class TarnClientConnection;
class TarnClientIdentity;

// ---- Request decoding ----

// The string under `key`; empty when missing or not a string.
std::optional<std::string> stringForKey(const PlistValue& request, std::string_view key);
// The value under `key`, whatever its type; empty when missing.
std::optional<PlistValue> plistForKey(const PlistValue& request, std::string_view key);
// The unsigned integer under `key`; 0 when missing or not an integer that fits.
uint64_t uint64ForKey(const PlistValue& request, std::string_view key);
// The boolean under `key`; false when missing or not a boolean.
bool boolForKey(const PlistValue& request, std::string_view key);

// "Identifier", or the caller's bundle identifier when the key is missing. A
// value of another type gives none.
std::optional<std::string> identifierWithDefault(const PlistValue& request,
                                                 const TarnClientConnection& connection);

// The user identity that owns the container `identifier` of `containerClass`
// for this caller. A caller without a specific persona asking for a per-user
// class is mapped to the one persona the application belongs to (plug-in data
// follows its parent application). TarnErrorPersonaMismatch when no single
// identity fits.
// The caller's user identity, or null for a caller without an identity.
TarnUserIdentityRef clientUserIdentity(const TarnClientConnection& connection);
// The last step of choosing a persona for a caller without a specific one:
// the single candidate, or the caller's own among several (else the
// "Ambiguous user identity" fault); TarnErrorPersonaMismatch otherwise.
// `logNone` writes the line for an empty set, which differs by command.
TarnResult<TarnUserIdentityRef> soleUserIdentity(const TarnClientConnection& connection,
                                                 const TarnUserIdentitySet& candidates,
                                                 const TarnUserIdentityRef& own,
                                                 const std::function<void()>& logNone);

TarnResult<TarnUserIdentityRef> userIdentityForContainerIdentifier(
    const TarnClientConnection& connection, const std::optional<std::string>& identifier,
    TarnContainerClass containerClass);

// The user identity a persona unique string names, as long as the caller may
// act for it (a caller without a specific persona may act for any);
// TarnErrorPersonaMismatch otherwise. In shared-device mode the caller's own
// identity, always.
TarnResult<TarnUserIdentityRef> userIdentityForPersonaUniqueString(
    const TarnClientConnection& connection, const std::optional<std::string>& personaUniqueString);

// A container identity from an identifier key and a class key, validated:
// TarnErrorMissingIdentifier without identifier, TarnErrorInvalidContainerClass
// for a class outside 1 to 13, TarnErrorPersonaMismatch when the persona
// cannot be settled. `identifierKey` null: "Identifier" with the caller's
// bundle identifier as default; otherwise the key is required.
TarnResult<TarnContainerIdentityRef> validatedContainerIdentity(
    const PlistValue& request, const TarnClientConnection& connection, const char* identifierKey,
    const char* classKey);

// Request keys of a concrete identity (the replace command reads two sets).
struct TarnConcreteIdentityKeys {
    const char* identifier = "Identifier";
    const char* containerClass = "ContainerClass";
    const char* uuid = "UUID";
    const char* personaUniqueString = "PersonaUniqueString";
};
// A concrete identity from the keys: TarnErrorMissingIdentifier without
// identifier; the class is not range-checked here (the identity constructor
// refuses it with TarnErrorInvalidArgument); per-user classes take their user
// identity from the persona string.
TarnResult<TarnConcreteContainerIdentityRef> concreteContainerIdentity(
    const PlistValue& request, const TarnClientConnection& connection,
    const TarnConcreteIdentityKeys& keys);

// The sandbox extension class for a container, or null: only enterprise
// data and application-group containers get one (the others are reachable
// through the common sandbox profile already).
const char* sandboxExtensionClassForContainer(TarnContainerClass containerClass,
                                              const TarnUserIdentity* userIdentity);
// Stores a token granting the caller's process access to the container under
// `replyKey`, when the caller is sandboxed and the container needs one. A
// failure to issue is logged and leaves the key out; the request still succeeds.
void issueSandboxExtension(PlistValue& reply, const char* replyKey, const TarnMetadata& container,
                           const TarnClientIdentity* clientIdentity);

// ---- Handlers ----

void TarnHandleCreateOrLookupCommand(const TarnRequestContext& context, const PlistValue& request,
                                     PlistValue& reply, TarnClientConnection* connection,
                                     uint64_t* error);  // 0
void TarnHandleContainersWithClassCommand(const TarnRequestContext& context,
                                          const PlistValue& request, PlistValue& reply,
                                          TarnClientConnection* connection, uint64_t* error);  // 1
void TarnHandleStageForDeleteCommand(const TarnRequestContext& context, const PlistValue& request,
                                     PlistValue& reply, TarnClientConnection* connection,
                                     uint64_t* error);  // 3
// Replies from the deletion pass's completion (asynchronous reply).
void TarnHandleDeleteDeathRowCommand(const TarnRequestContext& context, const PlistValue& request,
                                     PlistValue& reply, TarnClientConnection* connection,
                                     uint64_t* error);  // 4
void TarnHandleSetInfoValueCommand(const TarnRequestContext& context, const PlistValue& request,
                                   PlistValue& reply, TarnClientConnection* connection,
                                   uint64_t* error);  // 5
void TarnHandleInfoValueCommand(const TarnRequestContext& context, const PlistValue& request,
                                PlistValue& reply, TarnClientConnection* connection,
                                uint64_t* error);  // 6
void TarnHandleMetadataCommand(const TarnRequestContext& context, const PlistValue& request,
                               PlistValue& reply, TarnClientConnection* connection,
                               uint64_t* error);  // 7
void TarnHandleRecreateStructureCommand(const TarnRequestContext& context,
                                        const PlistValue& request, PlistValue& reply,
                                        TarnClientConnection* connection,
                                        uint64_t* error);  // 8, 22
void TarnHandleRegenerateUUIDCommand(const TarnRequestContext& context, const PlistValue& request,
                                     PlistValue& reply, TarnClientConnection* connection,
                                     uint64_t* error);  // 9
void TarnHandleDeleteContainerCommand(const TarnRequestContext& context, const PlistValue& request,
                                      PlistValue& reply, TarnClientConnection* connection,
                                      uint64_t* error);  // 10
void TarnHandleDiskUsageCommand(const TarnRequestContext& context, const PlistValue& request,
                                PlistValue& reply, TarnClientConnection* connection,
                                uint64_t* error);  // 23

}  // namespace tarn
