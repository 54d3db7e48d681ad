#include "Daemon/TarnGroupCommands.h"

#include <algorithm>
#include <map>
#include <optional>
#include <string>
#include <vector>

#include "Daemon/TarnClientConnection.h"
#include "Daemon/TarnCodeSigningMapping.h"
#include "Daemon/TarnContainerCommands.h"
#include "Daemon/TarnError.h"
#include "Daemon/TarnGlobalConfiguration.h"
#include "Daemon/TarnLog.h"
#include "Daemon/TarnUserIdentityCache.h"
#include "Daemon/TarnWhitelist.h"
#include "Platform/PlatformLog.h"

namespace tarn {

namespace {

// Handlers write the code of a failure into the error slot; a foreign
// (file-layer) error or none answers this.
constexpr uint64_t kHandlerFallback = TarnErrorInvalidArgument;

// Platform-log category of request handling.
constexpr const char* kCategory = "conduit";

// Any client may reach this system group: the platform's shared-device logging.
constexpr const char* kSharedLoggingSystemGroup = "systemgroup.com.ostrea.sharedpclogging";

PlistValue stringArray(const std::vector<std::string>& strings) {
    return PlistValue(PlistArray(strings.begin(), strings.end()));
}

// The user identity whose group containers command 13 answers with. A
// caller without a specific persona gets the persona the owning application
// (a plug-in's parent) belongs to, which must be one.
TarnResult<TarnUserIdentityRef> groupOwnerUserIdentity(TarnClientConnection& connection,
                                                       const std::string& identifier) {
    TarnUserIdentityRef own = clientUserIdentity(connection);
    if (own && !own->isNoSpecificPersona()) return own;

    std::string bundleIdentifier;
    if (TarnCodeSigningMapping* mapping = TarnCodeSigningMapping::sharedInstance())
        bundleIdentifier = mapping->parentIdentifierForChildIdentifier(identifier);
    if (bundleIdentifier.empty()) bundleIdentifier = identifier;
    const TarnUserIdentitySet candidates =
        connection.userIdentityCache().userIdentitiesForBundleIdentifier(bundleIdentifier);
    PlatformLog(kCategory, PlatformLogType::Debug,
                "Chose bundleIdentifier: %@ for group container lookup, userIdentities: %@ for "
                "identifier: %@",
                bundleIdentifier, TarnUserIdentitySetDescription(candidates), identifier);

    return soleUserIdentity(connection, candidates, own, [&] {
        TarnLog(kLogError, "createOrLookupGroupContainers",
                "%@ trying to look up persona for group owner %@",
                connection.clientBundleIdentifier(), identifier);
    });
}

// Every group operation names its owner; a request whose "Identifier" is not
// a string (or an anonymous caller's default) has none.
TarnResult<std::string> ownerIdentifier(const PlistValue& request,
                                        const TarnClientConnection& connection) {
    std::optional<std::string> identifier = identifierWithDefault(request, connection);
    if (!identifier)
        return TARN_ERROR(TarnErrorInvalidArgument, nullptr,
                          "Can't act on an invalid object: ID: %@", identifier);
    return std::move(*identifier);
}

PlistValue pathsByGroup(const std::map<std::string, TarnMetadataRef>& containers) {
    PlistValue paths{PlistDict{}};
    for (const auto& [group, container] : containers) paths.set(group, container->url());
    return paths;
}

}  // namespace

void TarnHandleGroupContainersCommand(const TarnRequestContext& context, const PlistValue& request,
                                      PlistValue& reply, TarnClientConnection* connection,
                                      uint64_t* error) {
    TarnResult<std::string> owner = ownerIdentifier(request, *connection);
    if (!TarnReport(owner, error, kHandlerFallback)) return;
    TarnResult<TarnUserIdentityRef> userIdentity = groupOwnerUserIdentity(*connection, *owner);
    if (!TarnReport(userIdentity, error, kHandlerFallback)) return;
    // The groups of the identifier asked for, not of its parent.
    TarnResult<std::map<std::string, TarnMetadataRef>> containers =
        connection->groupContainersForOwnerIdentifier(*owner, *userIdentity,
                                                      TarnContainerClassAppGroup);
    if (!TarnReport(containers, error, kHandlerFallback)) return;
    reply.set("ReplyGroupContainerDict", pathsByGroup(*containers));

    const TarnClientIdentity* client = connection->clientIdentity().get();
    if (!client || !client->isSandboxed()) return;
    PlistValue tokens{PlistDict{}};
    PlistValue personas{PlistDict{}};
    for (const auto& [group, container] : *containers) {
        issueSandboxExtension(tokens, group.c_str(), *container, client);
        const TarnUserIdentityRef& containerUser = container->userIdentity();
        if (containerUser && containerUser->personaUniqueString())
            personas.set(group, *containerUser->personaUniqueString());
    }
    if (!tokens.asDict()->empty()) reply.set("ReplySandboxTokenDict", std::move(tokens));
    if (!personas.asDict()->empty()) reply.set("ReplyPersonaUniqueStringDict", std::move(personas));
}

void TarnHandleSystemContainerPathCommand(const TarnRequestContext& context,
                                          const PlistValue& request, PlistValue& reply,
                                          TarnClientConnection* connection, uint64_t* error) {
    const std::optional<std::string> identifier = identifierWithDefault(request, *connection);
    // A well-known system container is anyone's to look up.
    if (identifier && *identifier != connection->clientBundleIdentifier() &&
        !connection->allowOtherIdLookup() &&
        TarnWhitelist::sharedWhitelist().systemContainerIdIsWellknown(*identifier))
        connection->setAllowOtherIdLookup(true);

    TarnResult<TarnUserIdentityRef> userIdentity =
        userIdentityForContainerIdentifier(*connection, identifier, TarnContainerClassSystemData);
    if (!TarnReport(userIdentity, error, kHandlerFallback)) return;
    TarnResult<TarnContainerIdentityRef> identity =
        TarnContainerIdentity::containerIdentityWithUserIdentity(*userIdentity, identifier,
                                                                 TarnContainerClassSystemData);
    if (!TarnReport(identity, error, kHandlerFallback)) return;
    TarnResult<TarnMetadataRef> container =
        connection->createOrLookupContainerWithContainerIdentity(
            *identity, /*createIfNecessary=*/true, /*transient=*/false, /*useLocking=*/true);
    if (!TarnReport(container, error, kHandlerFallback)) return;
    reply.set("ReplyPath", (*container)->url());
}

void TarnHandleSystemGroupContainersCommand(const TarnRequestContext& context,
                                            const PlistValue& request, PlistValue& reply,
                                            TarnClientConnection* connection, uint64_t* error) {
    TarnResult<std::string> owner = ownerIdentifier(request, *connection);
    if (!TarnReport(owner, error, kHandlerFallback)) return;
    TarnResult<TarnUserIdentityRef> userIdentity =
        userIdentityForContainerIdentifier(*connection, *owner, TarnContainerClassSystemGroup);
    if (!TarnReport(userIdentity, error, kHandlerFallback)) return;
    TarnResult<std::map<std::string, TarnMetadataRef>> containers =
        connection->groupContainersForOwnerIdentifier(*owner, *userIdentity,
                                                      TarnContainerClassSystemGroup);
    if (!TarnReport(containers, error, kHandlerFallback)) return;
    reply.set("ReplyGroupContainerDict", pathsByGroup(*containers));
}

void TarnHandleSystemGroupContainerPathCommand(const TarnRequestContext& context,
                                               const PlistValue& request, PlistValue& reply,
                                               TarnClientConnection* connection, uint64_t* error) {
    const std::optional<std::string> group = stringForKey(request, "GroupIdentifier");
    const std::optional<std::string> owner = identifierWithDefault(request, *connection);
    const std::string clientBundleIdentifier = connection->clientBundleIdentifier();
    constexpr TarnContainerClass kClass = TarnContainerClassSystemGroup;

    std::vector<std::string> entitled;
    if (TarnCodeSigningMapping* mapping = TarnCodeSigningMapping::sharedInstance())
        entitled = mapping->systemGroupIdentifiersForIdentifier(clientBundleIdentifier)
                       .value_or(std::vector<std::string>{});
    PlatformLog(kCategory, PlatformLogType::Debug,
                "Group ID: %@, bundle ID: %@, entitled group container IDs: %@", group,
                clientBundleIdentifier, stringArray(entitled));

    TarnResult<TarnUserIdentityRef> userIdentity =
        userIdentityForContainerIdentifier(*connection, owner, kClass);
    if (!userIdentity.ok()) {
        const uint64_t code = userIdentity.code(kHandlerFallback);
        PlatformLog(kCategory, PlatformLogType::Error,
                    "Could not generate a user identity for bundle: %@, class: %llu, error: %llu",
                    owner, kClass, code);
        TarnSetError(error, code);
        return;
    }

    std::optional<std::string> path;
    if (group && std::find(entitled.begin(), entitled.end(), *group) != entitled.end()) {
        // Entitled: the group is one of the owner's, found (or made) with the others.
        TarnResult<std::map<std::string, TarnMetadataRef>> containers =
            TARN_ERROR_CODE(TarnErrorInvalidArgument, nullptr);  // no owner: nothing to ask
        if (owner)
            containers =
                connection->groupContainersForOwnerIdentifier(*owner, *userIdentity, kClass);
        if (TarnReport(containers, error, kHandlerFallback)) {
            if (auto it = containers->find(*group); it != containers->end())
                path = it->second->url();
        } else {
            PlatformLog(kCategory, PlatformLogType::Error,
                        "No results returned for group container query for identity: %@, error: "
                        "%llu",
                        owner, *error);
        }
    } else {
        const bool admitted =
            (group && TarnWhitelist::sharedWhitelist().systemGroupContainerIdIsWellknown(*group)) ||
            connection->allowGroupIdLookup() || group == kSharedLoggingSystemGroup;
        if (!admitted) {
            TarnLog(kLogError, "systemGroupContainerPath",
                    "%@ is not entitled for system group identifier: %@.  Only entitled for: %@",
                    clientBundleIdentifier, group, stringArray(entitled));
            TarnSetError(error, TarnErrorNotEntitled);
            return;
        }
        connection->setAllowGroupIdLookup(true);
        TarnResult<TarnContainerIdentityRef> identity =
            TarnContainerIdentity::containerIdentityWithUserIdentity(*userIdentity, group, kClass);
        if (!identity.ok()) {
            const uint64_t code = identity.code(kHandlerFallback);
            PlatformLog(kCategory, PlatformLogType::Error,
                        "Could not generate a container identity for system group lookup "
                        "identifier: %@, class: %llu, userIdentity: %@, error: %llu",
                        group, kClass, *userIdentity, code);
            TarnSetError(error, code);
            return;
        }
        TarnResult<TarnMetadataRef> container =
            connection->createOrLookupContainerWithContainerIdentity(
                *identity, /*createIfNecessary=*/true, /*transient=*/false, /*useLocking=*/true);
        if (TarnReport(container, error, kHandlerFallback)) {
            path = (*container)->url();
        } else {
            PlatformLog(kCategory, PlatformLogType::Error,
                        "No results returned for system group lookup identity: %@, error: %llu",
                        *identity, *error);
        }
    }

    if (!path) {
        TarnLog(kLogError, "systemGroupContainerPath",
                "Did not find system group container with identifier: %@ for %@", group, owner);
        TarnSetError(error, TarnErrorNotFound);
        return;
    }
    reply.set("ReplyPath", std::move(*path));
}

void TarnHandleRetryTestCommand(const TarnRequestContext& context, const PlistValue& request,
                                PlistValue& reply, TarnClientConnection* connection,
                                uint64_t* error) {
    if (!TarnGlobalConfiguration::sharedInstance().isInternalImage()) {
        TarnLog(kLogError, "retryTest",
                "People really shouldn't be calling this on non-internal installs!");
        return;
    }
    (void)TarnReport(connection->retryTestWithNumCrashes(uint64ForKey(request, "NumRetryCrashes")),
                     error, kHandlerFallback);
}

void TarnHandlePersonaStringsCommand(const TarnRequestContext& context, const PlistValue& request,
                                     PlistValue& reply, TarnClientConnection* connection,
                                     uint64_t* error) {
    PlistArray strings;
    const TarnUserIdentityRef own = clientUserIdentity(*connection);
    if (own && own->isNoSpecificPersona()) {
        // A caller without a persona of its own sees them all.
        connection->userIdentityCache().forEachAccessibleUserIdentitySynchronouslyExecuteBlock(
            [&](const TarnUserIdentityRef& identity) {
                if (identity && identity->personaUniqueString())
                    strings.emplace_back(*identity->personaUniqueString());
            });
    } else if (own && own->personaUniqueString()) {
        strings.emplace_back(*own->personaUniqueString());
    }
    reply.set("ReplyPersonaUniqueStringsArray", std::move(strings));
}

}  // namespace tarn
