#include "Daemon/TarnContainerCommands.h"

#include <functional>
#include <memory>
#include <type_traits>
#include <utility>
#include <vector>

#include "Daemon/TarnClientConnection.h"
#include "Daemon/TarnClientIdentity.h"
#include "Daemon/TarnCodeSigningMapping.h"
#include "Daemon/TarnCommandStageForDelete.h"
#include "Daemon/TarnCommandTable.h"
#include "Daemon/TarnContainerCache.h"
#include "Daemon/TarnError.h"
#include "Daemon/TarnLog.h"
#include "Daemon/TarnUserIdentityCache.h"
#include "Platform/HostConfiguration.h"
#include "Platform/PlatformLog.h"
#include "Platform/Sandbox.h"

namespace tarn {

namespace {

// Platform-log category of the decoding lines: they belong to request handling.
constexpr const char* kDecodingCategory = "conduit";

// Shared-device mode: every request acts for the caller's own user.
constexpr uint64_t kMultiUserSharedDeviceBit = 1ull << 31;

const PlistArray* arrayForKey(const PlistValue& request, std::string_view key) {
    const PlistValue* value = request.find(key);
    return value ? value->asArray() : nullptr;
}

}  // namespace

// ---- Request decoding ----

std::optional<std::string> stringForKey(const PlistValue& request, std::string_view key) {
    const PlistValue* value = request.find(key);
    if (!value) return std::nullopt;
    if (const std::string* s = value->asString()) return *s;
    return std::nullopt;
}

std::optional<PlistValue> plistForKey(const PlistValue& request, std::string_view key) {
    const PlistValue* value = request.find(key);
    if (!value || value->isNull()) return std::nullopt;
    return *value;
}

uint64_t uint64ForKey(const PlistValue& request, std::string_view key) {
    const PlistValue* value = request.find(key);
    return value ? value->asUInt64().value_or(0) : 0;
}

bool boolForKey(const PlistValue& request, std::string_view key) {
    const PlistValue* value = request.find(key);
    return value ? value->asBool().value_or(false) : false;
}

std::optional<std::string> identifierWithDefault(const PlistValue& request,
                                                 const TarnClientConnection& connection) {
    if (request.find("Identifier")) return stringForKey(request, "Identifier");
    std::string own = connection.clientBundleIdentifier();
    if (own.empty()) return std::nullopt;  // an anonymous caller has no container of its own
    return own;
}

TarnResult<TarnUserIdentityRef> userIdentityForContainerIdentifier(
    const TarnClientConnection& connection, const std::optional<std::string>& identifier,
    TarnContainerClass containerClass) {
    TarnUserIdentityRef own = clientUserIdentity(connection);
    // A caller without a specific persona acts for whichever persona the
    // application belongs to; global containers have no persona to choose.
    const bool choosePersona =
        own && own->isNoSpecificPersona() && TarnContainerClassIsPerUser(containerClass);
    // Otherwise the caller's own identity is the one candidate: no set needed.
    if (own && !choosePersona) return own;
    TarnUserIdentitySet candidates;
    if (own) candidates.insert(own);

    if (choosePersona) {
        std::optional<std::string> bundleIdentifier = identifier;
        if (containerClass == TarnContainerClassPluginData ||
            containerClass == TarnContainerClassVPNPluginData) {
            // Plug-ins live in their application's persona.
            std::string parent;
            if (TarnCodeSigningMapping* mapping = TarnCodeSigningMapping::sharedInstance())
                parent = mapping->parentIdentifierForChildIdentifier(identifier.value_or(""));
            bundleIdentifier = parent.empty() ? std::nullopt : std::optional<std::string>(parent);
        }
        candidates = TarnContainerCache::sharedInstance()
                         .userIdentityCache()
                         .userIdentitiesForBundleIdentifier(bundleIdentifier.value_or(""));
        PlatformLog(
            kDecodingCategory, PlatformLogType::Debug,
            "Chose bundleIdentifier: %@, userIdentities: %@ for identifier: %@, class: %llu",
            bundleIdentifier, TarnUserIdentitySetDescription(candidates), identifier,
            containerClass);
    }

    return soleUserIdentity(connection, candidates, own, [&] {
        TarnLog(kLogError, "userIdentityForContainerIdentifier",
                "%@ trying to look up persona for %llu:%@", connection.clientBundleIdentifier(),
                containerClass, identifier);
    });
}

TarnUserIdentityRef clientUserIdentity(const TarnClientConnection& connection) {
    const auto& client = connection.clientIdentity();
    return client ? client->userIdentity() : nullptr;
}

TarnResult<TarnUserIdentityRef> soleUserIdentity(const TarnClientConnection& connection,
                                                 const TarnUserIdentitySet& candidates,
                                                 const TarnUserIdentityRef& own,
                                                 const std::function<void()>& logNone) {
    if (candidates.size() == 1) return *candidates.begin();
    if (candidates.size() > 1) {
        if (own && candidates.count(own)) return own;
        PlatformLog(kDecodingCategory, PlatformLogType::Fault,
                    "Ambiguous user identity from [%@]. Expected one of [%@], got %@",
                    connection.clientBundleIdentifier(), TarnUserIdentitySetDescription(candidates),
                    own);
    } else {
        logNone();
    }
    return TARN_ERROR_CODE(TarnErrorPersonaMismatch, nullptr);
}

TarnResult<TarnUserIdentityRef> userIdentityForPersonaUniqueString(
    const TarnClientConnection& connection, const std::optional<std::string>& personaUniqueString) {
    TarnUserIdentityRef own = clientUserIdentity(connection);
    const auto& flags = HostConfiguration::shared().multiUserFlags;
    if (flags && (*flags & kMultiUserSharedDeviceBit)) {
        if (!own) return TARN_ERROR_CODE(TarnErrorPersonaMismatch, nullptr);
        return own;
    }
    TarnUserIdentityRef found =
        connection.userIdentityCache().userIdentityForCurrentUserWithPersonaUniqueString(
            personaUniqueString);
    if (!found) {
        PlatformLog(kDecodingCategory, PlatformLogType::Error,
                    "Cannot reconstitute a user identity from provided persona unique string; "
                    "client = [%@], personaUniqueString = [%@]",
                    connection.clientBundleIdentifier(), personaUniqueString);
        return TARN_ERROR_CODE(TarnErrorPersonaMismatch, nullptr);
    }
    if (own && (own->isNoSpecificPersona() || own->isEqualToUserIdentity(*found))) return found;
    PlatformLog(kDecodingCategory, PlatformLogType::Error,
                "Persona unique string is not valid for this client; client = [%@], "
                "personaUniqueString = [%@]",
                connection.clientBundleIdentifier(), personaUniqueString);
    return TARN_ERROR_CODE(TarnErrorPersonaMismatch, nullptr);
}

TarnResult<TarnContainerIdentityRef> validatedContainerIdentity(
    const PlistValue& request, const TarnClientConnection& connection, const char* identifierKey,
    const char* classKey) {
    std::optional<std::string> identifier = identifierKey
                                                ? stringForKey(request, identifierKey)
                                                : identifierWithDefault(request, connection);
    if (!identifier) return TARN_ERROR_CODE(TarnErrorMissingIdentifier, nullptr);
    const TarnContainerClass containerClass =
        uint64ForKey(request, classKey ? classKey : "ContainerClass");
    if (!TarnContainerClassIsValid(containerClass))
        return TARN_ERROR_CODE(TarnErrorInvalidContainerClass, nullptr);
    TarnUserIdentityRef user =
        TARN_TRY(userIdentityForContainerIdentifier(connection, identifier, containerClass));
    return TarnContainerIdentity::containerIdentityWithUserIdentity(
        std::move(user), std::move(identifier), containerClass);
}

TarnResult<TarnConcreteContainerIdentityRef> concreteContainerIdentity(
    const PlistValue& request, const TarnClientConnection& connection,
    const TarnConcreteIdentityKeys& keys) {
    const PlistValue* identifier = request.find(keys.identifier);
    if (!identifier || identifier->isNull())
        return TARN_ERROR_CODE(TarnErrorMissingIdentifier, nullptr);
    // Out-of-range classes are refused by the identity itself
    // (TarnErrorInvalidArgument), not here.
    const TarnContainerClass containerClass = uint64ForKey(request, keys.containerClass);
    TarnUserIdentityRef user =
        TarnUserIdentity::isUserIdentityRequiredForContainerClass(containerClass)
            ? TARN_TRY(userIdentityForPersonaUniqueString(
                  connection, stringForKey(request, keys.personaUniqueString)))
            : clientUserIdentity(connection);
    return TarnConcreteContainerIdentity::containerIdentityWithUUID(request.find(keys.uuid), user,
                                                                    identifier, containerClass);
}

const char* sandboxExtensionClassForContainer(TarnContainerClass containerClass,
                                              const TarnUserIdentity* userIdentity) {
    if (!userIdentity || !userIdentity->isEnterprise()) return nullptr;
    switch (containerClass) {
        case TarnContainerClassAppData:
        case TarnContainerClassPluginData:
        case TarnContainerClassVPNPluginData:
        case TarnContainerClassDaemonData:
            return kSandboxExtensionClassContainer;
        case TarnContainerClassAppGroup:
            return kSandboxExtensionClassApplicationGroup;
        default:
            return nullptr;
    }
}

void issueSandboxExtension(PlistValue& reply, const char* replyKey, const TarnMetadata& container,
                           const TarnClientIdentity* clientIdentity) {
    if (!clientIdentity || !clientIdentity->isSandboxed()) return;
    const TarnUserIdentity* owner = container.userIdentity().get();
    const bool enterprise = owner && owner->isEnterprise();
    const std::string& path = container.url();
    const char* extensionClass =
        sandboxExtensionClassForContainer(container.containerClass(), owner);
    if (!extensionClass) {
        PlatformLog("sandbox", PlatformLogType::Info,
                    "%@ is sandboxed and container (type: %llu) is enterprise: %d. NOT issuing "
                    "token for path: %s",
                    clientIdentity->bundleIdentifier(), container.containerClass(), enterprise,
                    path);
        return;
    }
    PlatformLog("sandbox", PlatformLogType::Default,
                "%@ is sandboxed and container (type: %llu) is enterprise: %d. Issuing token for "
                "path: %s",
                clientIdentity->bundleIdentifier(), container.containerClass(), enterprise, path);
    int err = 0;
    std::optional<std::string> token =
        SandboxExtensionIssueFile(extensionClass, path, clientIdentity->auditToken(), &err);
    if (!token) {
        TarnLog(kLogError, __func__, "sandbox_extension_issue_file failed for %@ at path %s: %d",
                clientIdentity->bundleIdentifier(), path, err);
        return;
    }
    reply.set(replyKey, std::move(*token));
}

// ---- Handlers ----

namespace {

// Handlers write the code of a failure into the error slot; a foreign
// (file-layer) error or none answers this.
constexpr uint64_t kHandlerFallback = TarnErrorInvalidArgument;

// The persona unique string of a container's owner, or null for none.
const std::string* personaUniqueStringOf(const TarnMetadata& container) {
    const TarnUserIdentityRef& owner = container.userIdentity();
    return owner && owner->personaUniqueString() ? &*owner->personaUniqueString() : nullptr;
}

void setPersonaUniqueString(PlistValue& reply, const TarnMetadata& container) {
    if (const std::string* persona = personaUniqueStringOf(container))
        reply.set("ReplyPersonaUniqueString", *persona);
}

// The shape of the handlers that name one existing container: decode its
// concrete identity, then hand it to the connection operation `forward`, whose
// result `answer` turns into reply keys. A failure at either step goes into
// the error slot.
template <class Forward, class Answer>
void forwardConcreteIdentity(const PlistValue& request, TarnClientConnection& connection,
                             uint64_t* error, Forward&& forward, Answer&& answer) {
    TarnResult<TarnConcreteContainerIdentityRef> identity =
        concreteContainerIdentity(request, connection, {});
    if (!TarnReport(identity, error, kHandlerFallback)) return;
    auto result = forward(*identity);
    if (!TarnReport(result, error, kHandlerFallback)) return;
    if constexpr (std::is_void_v<typename decltype(result)::ValueType>)
        answer();
    else
        answer(*result);
}

template <class Forward>
void forwardConcreteIdentity(const PlistValue& request, TarnClientConnection& connection,
                             uint64_t* error, Forward&& forward) {
    forwardConcreteIdentity(request, connection, error, std::forward<Forward>(forward),
                            [](auto&&...) {});
}

}  // namespace

void TarnHandleCreateOrLookupCommand(const TarnRequestContext& context, const PlistValue& request,
                                     PlistValue& reply, TarnClientConnection* connection,
                                     uint64_t* error) {
    TarnResult<TarnContainerIdentityRef> identity =
        validatedContainerIdentity(request, *connection, nullptr, "ContainerClass");
    if (!TarnReport(identity, error, kHandlerFallback)) return;
    TarnResult<TarnMetadataRef> found = connection->createOrLookupContainerWithContainerIdentity(
        *identity, boolForKey(request, "CreateIfNecessary"), boolForKey(request, "Transient"),
        /*useLocking=*/true);
    if (!TarnReport(found, error, kHandlerFallback)) return;
    const TarnMetadata& container = **found;
    reply.set("ReplyUUID", container.uuid());
    reply.set("ReplyExisted", container.existed());
    reply.set("ReplyPath", container.url());
    reply.set("ReplyIdentifier", container.identifier());
    setPersonaUniqueString(reply, container);
    issueSandboxExtension(reply, "ReplySandboxToken", container,
                          connection->clientIdentity().get());
}

void TarnHandleContainersWithClassCommand(const TarnRequestContext& context,
                                          const PlistValue& request, PlistValue& reply,
                                          TarnClientConnection* connection, uint64_t* error) {
    TarnResult<std::vector<TarnMetadataRef>> containers = connection->containersWithClass(
        uint64ForKey(request, "ContainerClass"), boolForKey(request, "Transient"));
    if (!TarnReport(containers, error, kHandlerFallback)) return;
    PlistArray identifiers, uuids, personas;
    identifiers.reserve(containers->size());
    uuids.reserve(containers->size());
    personas.reserve(containers->size());
    for (const TarnMetadataRef& container : *containers) {
        if (!container) continue;  // keeps the three arrays parallel
        identifiers.emplace_back(container->identifier());
        uuids.emplace_back(container->uuid());
        const std::string* persona = personaUniqueStringOf(*container);
        personas.emplace_back(persona ? *persona : std::string());
    }
    reply.set("ReplyIdsArray", std::move(identifiers));
    reply.set("ReplyUUIDsArray", std::move(uuids));
    reply.set("ReplyPersonaUniqueStringsArray", std::move(personas));
}

void TarnHandleStageForDeleteCommand(const TarnRequestContext& context, const PlistValue& request,
                                     PlistValue& reply, TarnClientConnection* connection,
                                     uint64_t* error) {
    static const PlistArray kNone;
    const PlistArray* classes = arrayForKey(request, "ContainerClassesArray");
    const PlistArray* uuids = arrayForKey(request, "UUIDsArray");
    const PlistArray* identifiers = arrayForKey(request, "IdentifiersArray");
    const PlistArray* personas = arrayForKey(request, "PersonaUniqueStringsArray");
    if (!classes) classes = &kNone;
    if (!uuids) uuids = &kNone;
    if (!identifiers) identifiers = &kNone;
    if (!personas) personas = &kNone;
    const size_t count = classes->size();
    if (count != uuids->size() || count != identifiers->size() || count != personas->size()) {
        TarnLog(kLogError, "stageContainerForDelete",
                "Can't act on an invalid input: UUID count: %ld, class count: %ld, ID count: %lu, "
                "persona string count: %lu",
                static_cast<long>(uuids->size()), static_cast<long>(count), identifiers->size(),
                personas->size());
        TarnSetError(error, TarnErrorBadInput);
        return;
    }

    std::vector<TarnContainerIdentityRef> identities;
    identities.reserve(count);
    for (size_t i = 0; i < count; ++i) {
        const TarnContainerClass containerClass = (*classes)[i].asUInt64().value_or(0);
        // One container of someone else's persona spoils the whole request.
        TarnUserIdentityRef user;
        if (TarnUserIdentity::isUserIdentityRequiredForContainerClass(containerClass)) {
            const std::string* persona = (*personas)[i].asString();
            TarnResult<TarnUserIdentityRef> named = userIdentityForPersonaUniqueString(
                *connection, persona ? std::optional<std::string>(*persona) : std::nullopt);
            if (!TarnReport(named, error, TarnErrorPersonaMismatch)) return;
            user = std::move(*named);
        } else {
            user = connection->userIdentityCache().userIdentityForCurrentContext(
                context.personaUniqueString);
            // Without an identity the code of an earlier malformed entry stands.
            if (!user) {
                if (*error == TarnSuccess) TarnSetError(error, TarnErrorPersonaMismatch);
                return;
            }
        }
        // A malformed entry is skipped; its code stays in the slot.
        TarnResult<TarnConcreteContainerIdentityRef> identity =
            TarnConcreteContainerIdentity::containerIdentityWithUUID(
                &(*uuids)[i], user, &(*identifiers)[i], containerClass);
        if (TarnReport(identity, error, kHandlerFallback))
            identities.push_back(std::move(*identity));
    }
    connection->commandQueue()->insertCommand(
        TarnCommandStageForDelete::commandForStageForDeleteWithContainerIdentities(
            std::move(identities), /*useLocking=*/true, nullptr));
}

void TarnHandleDeleteDeathRowCommand(const TarnRequestContext& context, const PlistValue& request,
                                     PlistValue& reply, TarnClientConnection* connection,
                                     uint64_t* error) {
    // Run what the request queued (entitlement registration) before the pass
    // starts: a failure there must be the one reply, not a second one after
    // the completion's. The processor's own run then finds the queue empty;
    // after a failure the rest is dropped, as the request ends at its first.
    if (!connection->completeWithError(error)) {
        connection->commandQueue()->removeAllCommands();
        return;
    }
    std::shared_ptr<TarnDeferredReply> deferred = context.deferredReply;
    if (!deferred) {
        // Called outside a request (no reply to keep): just start the pass.
        connection->deleteContainersOnDeathRowWithCompletion(nullptr);
        return;
    }
    connection->deleteContainersOnDeathRowWithCompletion(
        [deferred](uint64_t code) { deferred->send(code); });
}

void TarnHandleSetInfoValueCommand(const TarnRequestContext& context, const PlistValue& request,
                                   PlistValue& reply, TarnClientConnection* connection,
                                   uint64_t* error) {
    forwardConcreteIdentity(request, *connection, error, [&](const auto& identity) {
        return connection->setInfoValue(plistForKey(request, "Value"), stringForKey(request, "Key"),
                                        identity, /*useLocking=*/true);
    });
}

void TarnHandleInfoValueCommand(const TarnRequestContext& context, const PlistValue& request,
                                PlistValue& reply, TarnClientConnection* connection,
                                uint64_t* error) {
    forwardConcreteIdentity(
        request, *connection, error,
        [&](const auto& identity) {
            return connection->infoValueForKey(stringForKey(request, "Key"), identity,
                                               /*useLocking=*/true);
        },
        [&](PlistValue& value) { reply.set("ReplyInfoValue", std::move(value)); });
}

void TarnHandleMetadataCommand(const TarnRequestContext& context, const PlistValue& request,
                               PlistValue& reply, TarnClientConnection* connection,
                               uint64_t* error) {
    forwardConcreteIdentity(
        request, *connection, error,
        [&](const auto& identity) { return connection->metadataWithContainerIdentity(identity); },
        [&](const TarnMetadataRef& found) {
            const TarnMetadata& container = *found;
            reply.set("ReplyPath", container.url());
            reply.set("ReplyTransient", container.transient());
            if (boolForKey(request, "InfoDictRequested") && container.info())
                reply.set("ReplyInfoDictionary", *container.info());
            issueSandboxExtension(reply, "ReplySandboxToken", container,
                                  connection->clientIdentity().get());
            setPersonaUniqueString(reply, container);
        });
}

void TarnHandleRecreateStructureCommand(const TarnRequestContext& context,
                                        const PlistValue& request, PlistValue& reply,
                                        TarnClientConnection* connection, uint64_t* error) {
    forwardConcreteIdentity(request, *connection, error, [&](const auto& identity) {
        return connection->recreateDefaultStructureWithContainerIdentity(identity);
    });
}

void TarnHandleRegenerateUUIDCommand(const TarnRequestContext& context, const PlistValue& request,
                                     PlistValue& reply, TarnClientConnection* connection,
                                     uint64_t* error) {
    forwardConcreteIdentity(request, *connection, error, [&](const auto& identity) {
        return connection->regenerateDirectoryUUIDWithContainerIdentity(identity);
    });
}

void TarnHandleDeleteContainerCommand(const TarnRequestContext& context, const PlistValue& request,
                                      PlistValue& reply, TarnClientConnection* connection,
                                      uint64_t* error) {
    TarnResult<TarnContainerIdentityRef> identity =
        validatedContainerIdentity(request, *connection, "Identifier", "ContainerClass");
    if (!TarnReport(identity, error, kHandlerFallback)) return;
    (void)TarnReport(connection->deleteContainerWithContainerIdentity(
                         *identity, boolForKey(request, "Transient")),
                     error, kHandlerFallback);
}

void TarnHandleDiskUsageCommand(const TarnRequestContext& context, const PlistValue& request,
                                PlistValue& reply, TarnClientConnection* connection,
                                uint64_t* error) {
    forwardConcreteIdentity(
        request, *connection, error,
        [&](const auto& identity) { return connection->diskUsageWithContainerIdentity(identity); },
        [&](uint64_t bytes) { reply.set("ReplyDiskUsage", bytes); });
}

}  // namespace tarn
