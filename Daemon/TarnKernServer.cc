#include "Daemon/TarnKernServer.h"

#include <packbuff/packbuff.h>

#include <algorithm>
#include <cstring>
#include <memory>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "Daemon/TarnClientConnection.h"
#include "Daemon/TarnCodeSigningMapping.h"
#include "Daemon/TarnContainerIdentity.h"
#include "Daemon/TarnExceptionFence.h"
#include "Daemon/TarnLog.h"
#include "Daemon/TarnUserIdentity.h"
#include "Daemon/TarnUserIdentityCache.h"
#include "Platform/Conduit.h"
#include "Platform/Failpoints.h"
#include "Platform/HostConfiguration.h"
#include "Platform/Path.h"
#include "Platform/PersonaRoster.h"
#include "Platform/PlatformLog.h"
#include "Platform/RootPrefix.h"

namespace tarn {

using namespace upcall;

namespace {

constexpr const char* kRoutine = "server_get_process_containers";
constexpr const char* kCategory = "upcall";

// Request value types.
enum : uint16_t {
    kRequestCodeSignatureID = 0,
    kRequestContainerID = 1,
    kRequestApplicationID = 2,
    kRequestUID = 3,
    kRequestAppGroupID = 4,
    kRequestContainerType = 5,
    kRequestSystemContainerID = 6,
    kRequestSystemGroupContainerID = 7,
    kRequestPersonaID = 8,
};

// Answer value types.
enum : uint16_t {
    kAnswerStatus = 0,
    kAnswerDataContainer = 1,
    kAnswerTemporaryDirectory = 2,
    kAnswerGroupID = 3,
    kAnswerGroupContainer = 4,
    kAnswerHomeDirectory = 100,
    kAnswerSystemContainer = 101,
    kAnswerSystemGroupID = 102,
    kAnswerSystemGroupContainer = 103,
};

// Return codes of the routine.
enum : int32_t {
    kKernSuccess = 0,
    kKernInvalidValue = 4,
    kKernFailure = 5,
    kKernResourceShortage = 9,
};

constexpr uint32_t kNoPersona = 0xFFFFFFFF;
constexpr uint32_t kSandboxTypePlugin = 1;
constexpr uint32_t kSandboxTypeApp = 0;
constexpr size_t kAnswerBlockSize = 4096;
constexpr uint32_t kMinimumTrailerSize = 32;
constexpr uint64_t kMultiUserModeBit = uint64_t{1} << 31;

const char* requestKeyName(uint16_t valueType) {
    switch (valueType) {
        case kRequestCodeSignatureID:
            return "CM_KERN_REQUEST_CODE_SIGNATURE_ID";
        case kRequestContainerID:
            return "CM_KERN_REQUEST_CONTAINER_ID";
        case kRequestApplicationID:
            return "CM_KERN_REQUEST_APPLICATION_ID";
        case kRequestUID:
            return "CM_KERN_REQUEST_UID";
        case kRequestAppGroupID:
            return "CM_KERN_REQUEST_APP_GROUP_ID";
        case kRequestContainerType:
            return "CM_KERN_REQUEST_CONTAINER_TYPE";
        case kRequestSystemContainerID:
            return "CM_KERN_REQUEST_CONTAINER_ID";
        case kRequestSystemGroupContainerID:
            return "CM_KERN_REQUEST_SYSTEM_GROUP_CONTAINER_ID";
        case kRequestPersonaID:
            return "CM_KERN_REQUEST_PERSONA_ID";
    }
    return "?";
}

struct PackbuffFree {
    void operator()(sb_packbuff_t* packbuff) const { sb_packbuff_free(packbuff); }
};
using PackbuffPtr = std::unique_ptr<sb_packbuff_t, PackbuffFree>;

struct KernRequest {
    std::optional<std::string> codeSignatureID;
    std::optional<std::string> containerID;
    std::optional<std::string> applicationID;
    std::optional<std::string> systemContainerID;
    uint32_t uid = 0;
    uint32_t containerType = kSandboxTypeApp;
    uint32_t personaID = kNoPersona;
    std::vector<std::string> appGroupIDs;
    std::vector<std::string> systemGroupIDs;
};

// Identifier -> path, in the order asked, each identifier once.
using GroupPaths = std::vector<std::pair<std::string, std::string>>;

struct KernContainers {
    std::optional<std::string> dataContainer;
    std::optional<std::string> systemContainer;
    GroupPaths groups;
    GroupPaths systemGroups;
};

// The request's items; a return code other than kKernSuccess when one cannot
// be read.
int32_t unpackRequest(sb_packbuff_t* packbuff, KernRequest* request) {
    uint16_t valueType = 0;
    while (sb_packbuff_get_item_value_type(packbuff, &valueType)) {
        if (valueType > kRequestPersonaID) {
            TarnLog(kLogError, kRoutine, "unexpected value: %u\n", valueType);
            return kKernInvalidValue;
        }
        int error = 0;
        if (valueType == kRequestUID || valueType == kRequestContainerType ||
            valueType == kRequestPersonaID) {
            const uint32_t value = sb_packbuff_unpack_uint32(packbuff, &error);
            if (error != 0) {
                TarnLog(kLogError, kRoutine, "failed: to unpack uint32 for %s. error: %d\n",
                        requestKeyName(valueType), error);
                return kKernFailure;
            }
            (valueType == kRequestUID             ? request->uid
             : valueType == kRequestContainerType ? request->containerType
                                                  : request->personaID) = value;
            continue;
        }
        const char* text = sb_packbuff_unpack_string(packbuff, nullptr, &error);
        if (error != 0 || !text) {
            TarnLog(kLogError, "unpackToString", "failed: to unpack string for %s. error: %d\n",
                    requestKeyName(valueType), error);
            return kKernFailure;
        }
        // Up to the first zero byte, as the kernel's C strings end.
        std::string value(text);
        switch (valueType) {
            case kRequestCodeSignatureID:
                request->codeSignatureID = std::move(value);
                break;
            case kRequestContainerID:
                request->containerID = std::move(value);
                break;
            case kRequestApplicationID:
                request->applicationID = std::move(value);
                break;
            case kRequestAppGroupID:
                request->appGroupIDs.push_back(std::move(value));
                break;
            case kRequestSystemContainerID:
                request->systemContainerID = std::move(value);
                break;
            case kRequestSystemGroupContainerID:
                request->systemGroupIDs.push_back(std::move(value));
                break;
        }
    }
    return kKernSuccess;
}

// The user identity the process runs under; nullptr after the fault line.
TarnUserIdentityRef userIdentityForRequest(const KernRequest& request, int32_t* result) {
    TarnUserIdentitySharedCache& cache = TarnUserIdentitySharedCache::sharedInstance();
    const std::optional<uint64_t>& flags = HostConfiguration::shared().multiUserFlags;
    TarnUserIdentityRef identity;
    if (flags && (*flags & kMultiUserModeBit)) {
        identity = cache.userIdentityForPersonalPersonaWithUID(request.uid, request.uid);
    } else if (request.personaID == kNoPersona) {
        identity = cache.userIdentityForPersonalPersona();
    } else {
        std::optional<KernelPersonaInfo> info = PersonaRoster::sharedManager().kernelPersonaInfo(
            request.personaID, KernelPersonaInfo::kVersion);
        if (!info) {
            PlatformLog(kCategory, PlatformLogType::Fault,
                        "%s: Could not look up info for persona id %u", kRoutine,
                        request.personaID);
            *result = kKernInvalidValue;
            return nullptr;
        }
        identity =
            info->type == kKernelPersonaTypeEnterprise || info->type == kKernelPersonaTypeUniversal
                ? cache.userIdentityWithPersonaID(request.personaID)
                : cache.userIdentityForPersonalPersona();
    }
    if (!identity) {
        PlatformLog(kCategory, PlatformLogType::Fault,
                    "%s: Unable to find user identity for persona id %u", kRoutine,
                    request.personaID);
        *result = kKernInvalidValue;
    }
    return identity;
}

// The data-container class for the identifier as the sandbox sees the process.
TarnContainerClass dataContainerClass(const std::string& identifier, uint32_t containerType) {
    TarnCodeSigningMapping* mapping = TarnCodeSigningMapping::sharedInstance();
    TarnContainerClass containerClass =
        mapping ? mapping->dataContainerTypeForIdentifier(identifier) : 0;
    switch (containerClass) {
        case 2:
        case 4:
        case 6:
        case 7:
        case 9:
        case 10:
        case 11:
            if (containerType == kSandboxTypePlugin &&
                containerClass != TarnContainerClassPluginData) {
                TarnLog(kLogNotice, kRoutine,
                        "SB Type: %u, Pallet Type: %llu.  Declaring this a plugin", containerType,
                        containerClass);
                containerClass = TarnContainerClassPluginData;
            } else if (containerType == kSandboxTypeApp &&
                       containerClass != TarnContainerClassAppData) {
                TarnLog(kLogNotice, kRoutine, "SB type is app, but Pallet type is %llu",
                        containerClass);
            }
            return containerClass;
        default:
            TarnLog(kLogError, kRoutine, "Invalid data container class for %@: %llu", identifier,
                    containerClass);
            containerClass = containerType == kSandboxTypePlugin ? TarnContainerClassPluginData
                                                                 : TarnContainerClassAppData;
            TarnLog(kLogNotice, kRoutine, "SB Type: %u, falling back to class: %llu", containerType,
                    containerClass);
            return containerClass;
    }
}

// The kernel's user id is reported, not enforced: the container belongs to
// the user identity.
void checkUID(const TarnClientConnection& connection, TarnContainerClass containerClass,
              uint32_t uid) {
    const uint32_t expected =
        connection.clientIdentity()->posixUIDForContainerClass(containerClass);
    if (expected != uid)
        TarnLog(kLogError, kRoutine, "Invalid UID from kernel: %u, expected: %u", uid, expected);
}

// The container's path, found or created; the failure line names `what`.
std::optional<std::string> containerPath(TarnClientConnection& connection,
                                         const TarnUserIdentityRef& userIdentity,
                                         const std::string& identifier,
                                         TarnContainerClass containerClass, const char* what) {
    TarnResult<TarnMetadataRef> container = [&]() -> TarnResult<TarnMetadataRef> {
        if (TARN_FAILPOINT("upcall.createOrLookup"))
            return TARN_ERROR_CODE(TarnErrorCreateDirectoryFailed, nullptr);
        TarnContainerIdentityRef identity =
            TARN_TRY(TarnContainerIdentity::containerIdentityWithUserIdentity(
                userIdentity, identifier, containerClass));
        return connection.createOrLookupContainerWithContainerIdentity(
            identity, /*createIfNecessary=*/true, /*transient=*/false, /*useLocking=*/true);
    }();
    if (!container.ok()) {
        TarnLog(kLogError, kRoutine, "%s Failed with error: %llu", what,
                container.code(TarnErrorInvalidArgument));
        return std::nullopt;
    }
    return (*container)->url();
}

// Finds or creates every container the request names; false when one failed.
bool collectContainers(TarnClientConnection& connection, const TarnUserIdentityRef& userIdentity,
                       const KernRequest& request, KernContainers* found) {
    bool complete = true;
    const std::optional<std::string>& dataIdentifier =
        request.containerID ? request.containerID : request.codeSignatureID;
    if (dataIdentifier) {
        const TarnContainerClass containerClass =
            dataContainerClass(*dataIdentifier, request.containerType);
        checkUID(connection, containerClass, request.uid);
        found->dataContainer = containerPath(connection, userIdentity, *dataIdentifier,
                                             containerClass, "createOrLookupContainerForUser:");
        complete &= found->dataContainer.has_value();
    }
    if (request.systemContainerID) {
        found->systemContainer = containerPath(connection, userIdentity, *request.systemContainerID,
                                               TarnContainerClassSystemData,
                                               "createOrLookupContainerForUser:(system container)");
        complete &= found->systemContainer.has_value();
    }
    auto groups = [&](const std::vector<std::string>& identifiers,
                      TarnContainerClass containerClass, const char* what, GroupPaths* paths) {
        if (identifiers.empty()) return;
        checkUID(connection, containerClass, request.uid);
        for (const std::string& identifier : identifiers) {
            const bool seen = std::any_of(paths->begin(), paths->end(), [&](const auto& entry) {
                return entry.first == identifier;
            });
            if (seen) continue;
            // One group that cannot be made does not keep the others from being made.
            std::optional<std::string> path =
                containerPath(connection, userIdentity, identifier, containerClass, what);
            if (path)
                paths->emplace_back(identifier, std::move(*path));
            else
                complete = false;
        }
    };
    groups(request.appGroupIDs, TarnContainerClassAppGroup,
           "createOrLookupGroupContainersForUser:", &found->groups);
    groups(request.systemGroupIDs, TarnContainerClassSystemGroup,
           "createOrLookupContainerForUser:(system group container)", &found->systemGroups);
    return complete;
}

std::string describeGroups(const GroupPaths& groups) {
    std::string out = "{";
    for (const auto& [identifier, path] : groups) out += Format(" %@ = %@;", identifier, path);
    return out + " }";
}

// Packs the container items in answer order; false after the first failure
// (its line written), leaving out the rest.
bool packContainers(sb_packbuff_t* answer, const std::string& home, const KernContainers& found) {
    auto string = [answer](uint16_t valueType, const std::string& path) {
        const int error = sb_packbuff_pack_string(answer, valueType, path.c_str(), path.size());
        if (error != 0)
            TarnLog(kLogError, kRoutine,
                    "sb_packbuff_pack_string() fails: %d; type: %u, path: %s\n", error, valueType,
                    path);
        return error == 0;
    };
    auto keyed = [answer](uint16_t keyType, uint16_t valueType, const GroupPaths& groups,
                          const char* what) {
        for (const auto& [identifier, path] : groups) {
            const int error = sb_packbuff_pack_key_with_string_value(
                answer, keyType, identifier.c_str(), valueType, path.c_str());
            if (error != 0) {
                TarnLog(
                    kLogError, kRoutine,
                    "sb_packbuff_pack_key_with_string_value() fails: %d; group ID: %s, %s: %s\n",
                    error, identifier, what, path);
                return false;
            }
        }
        return true;
    };
    if (!string(kAnswerHomeDirectory, home)) return false;
    if (found.dataContainer) {
        if (!string(kAnswerDataContainer, *found.dataContainer)) return false;
        if (!string(kAnswerTemporaryDirectory, PathJoin(*found.dataContainer, "tmp"))) return false;
    }
    if (!keyed(kAnswerGroupID, kAnswerGroupContainer, found.groups, "group container"))
        return false;
    if (found.systemContainer && !string(kAnswerSystemContainer, *found.systemContainer))
        return false;
    return keyed(kAnswerSystemGroupID, kAnswerSystemGroupContainer, found.systemGroups,
                 "system group container");
}

// Everything after the message checks: the answer buffer's bytes, or the
// return code of an error reply.
int32_t answerRequest(uint8_t* requestBytes, size_t requestSize,
                      std::vector<uint8_t>* answerBytes) {
    TarnLog(kLogDebug, kRoutine, "request size: %u (%p)", static_cast<uint32_t>(requestSize),
            static_cast<const void*>(requestBytes));
    KernRequest request;
    {
        PackbuffPtr wrapper(sb_packbuff_init_with_buffer(requestBytes, requestSize,
                                                         /*has_content=*/true,
                                                         SB_PACKBUFF_DEALLOC_NONE));
        if (!wrapper) {
            TarnLog(kLogError, kRoutine, "sb_packbuff_init() of request data fails");
            return kKernResourceShortage;
        }
        if (int32_t result = unpackRequest(wrapper.get(), &request); result != kKernSuccess)
            return result;
    }
    PackbuffPtr answer(sb_packbuff_new(kAnswerBlockSize));
    if (!answer) return kKernResourceShortage;

    int32_t result = kKernSuccess;
    TarnUserIdentityRef userIdentity = userIdentityForRequest(request, &result);
    if (!userIdentity) return result;

    std::shared_ptr<TarnClientConnection> connection =
        TarnClientConnection::privilegedClientConnectionWithUserIdentity(userIdentity,
                                                                         /*kernel=*/true);
    connection->setAllowOtherIdLookup(true);
    connection->setAllowGroupIdLookup(true);
    connection->setUnrestricted(true);
    KernContainers found;
    uint32_t status = collectContainers(*connection, userIdentity, request, &found) ? 1 : 0;
    // Nothing a look-up queues may be dropped.
    uint64_t queued = TarnSuccess;
    (void)connection->completeWithError(&queued);  // a queued failure is logged where it fails

    if (status == 1) {
        const std::string home =
            request.uid == 0 ? RootPath("/private/var/root") : userIdentity->homeDirectoryURL();
        const std::string& identifier =
            request.containerID ? *request.containerID : request.codeSignatureID.value_or("(null)");
        TarnLog(kLogDebug, kRoutine, "UPCALL-Containers for %@(%u):", identifier, request.uid);
        TarnLog(kLogDebug, kRoutine, "dataContainerURL: %@",
                found.dataContainer.value_or("(null)"));
        TarnLog(kLogDebug, kRoutine, "tempContainerURL: %@",
                found.dataContainer ? PathJoin(*found.dataContainer, "tmp") : "(null)");
        TarnLog(kLogDebug, kRoutine, "homeDirURL: %@", home);
        TarnLog(kLogDebug, kRoutine, "groupURLs: %@", describeGroups(found.groups));
        TarnLog(kLogDebug, kRoutine, "systemContainerURL: %@",
                found.systemContainer.value_or("(null)"));
        TarnLog(kLogDebug, kRoutine, "systemGroupURLs: %@", describeGroups(found.systemGroups));
        if (!packContainers(answer.get(), home, found)) status = 0;
    }
    if (int error = sb_packbuff_pack_uint32(answer.get(), kAnswerStatus, status); error != 0)
        TarnLog(kLogError, kRoutine, "sb_packbuff_pack_uint32() fails: %d; type: %u, value: %u\n",
                error, kAnswerStatus, status);

    const auto* bytes = static_cast<const uint8_t*>(sb_packbuff_get_bytes(answer.get()));
    const size_t size = sb_packbuff_get_size(answer.get());
    if (bytes) answerBytes->assign(bytes, bytes + size);
    TarnLog(kLogDebug, kRoutine, "packbuff bytes: %p, reply bytes: %p, reply size: %u",
            static_cast<const void*>(bytes), static_cast<const void*>(answerBytes->data()),
            static_cast<uint32_t>(answerBytes->size()));
    return kKernSuccess;
}

ReplyMessage successReply(const ReceivedMessage& request, std::vector<uint8_t> answer) {
    ReplyMessage reply;
    reply.header.assign(kSuccessReplySize, 0);
    uint8_t* h = reply.header.data();
    const uint8_t* r = request.bytes.data();
    const auto size = static_cast<uint32_t>(answer.size());
    StoreU32(h + kOffsetBits, kComplexBit | (LoadU32(r + kOffsetBits) & kRemoteDispositionMask));
    StoreU32(h + kOffsetSize, kSuccessReplySize);
    StoreU32(h + kOffsetRemotePort, LoadU32(r + kOffsetRemotePort));
    StoreU32(h + kOffsetID, LoadU32(r + kOffsetID) + kReplyIDOffset);
    StoreU32(h + kOffsetDescriptorCount, 1);
    // The answer is a copy the reply owns and releases once sent.
    h[kOffsetDescriptorDeallocate] = 1;
    h[kOffsetDescriptorCopy] = kVirtualCopy;
    h[kOffsetDescriptorType] = kOutOfLineDescriptor;
    StoreU32(h + kOffsetDescriptorSize, size);
    StoreDataRepresentation(h + kOffsetDataRepresentation);
    StoreU32(h + kOffsetDataCount, size);
    reply.outOfLine = std::move(answer);
    return reply;
}

// The message-level checks; kKernSuccess when the message may be served.
int32_t checkMessage(const ReceivedMessage& request) {
    const uint8_t* m = request.bytes.data();
    if (!(LoadU32(m + kOffsetBits) & kComplexBit) || LoadU32(m + kOffsetDescriptorCount) != 1 ||
        LoadU32(m + kOffsetSize) != kRequestMessageSize)
        return kUpcallBadArguments;
    if (m[kOffsetDescriptorType] != kOutOfLineDescriptor ||
        LoadU32(m + kOffsetDescriptorSize) != LoadU32(m + kOffsetDataCount))
        return kUpcallTypeError;
    if (LoadU32(m + kOffsetTrailerType) != 0 ||
        LoadU32(m + kOffsetTrailerSize) < kMinimumTrailerSize)
        return kUpcallTrailerError;
    return kKernSuccess;
}

std::shared_ptr<UpcallPort>* gPort = nullptr;  // set once by start-up, never freed

}  // namespace

void server_get_process_containers(const ReceivedMessage& request, ReplyMessage* reply) {
    if (int32_t check = checkMessage(request); check != kKernSuccess) {
        *reply = MakeErrorReply(request.bytes.data(), check);
        return;
    }
    SignpostInterval interval(kCategory, "KernelUpcall");
    conduit::AuditToken token;
    std::memcpy(token.data(), request.bytes.data() + kOffsetTrailerAuditToken, token.size());
    std::vector<uint8_t> answer;
    int32_t result = kKernFailure;
    if (conduit::ParseAuditToken(token).pid == 0) {
        TarnResult<int32_t> answered = TarnFenceExceptions(kRoutine, [&] {
            return answerRequest(request.outOfLine, request.outOfLineSize, &answer);
        });
        result = answered.valueOr(kKernFailure);
    }
    interval.end();
    *reply = result == kKernSuccess ? successReply(request, std::move(answer))
                                    : MakeErrorReply(request.bytes.data(), result);
}

bool demux_server(const ReceivedMessage& request, ReplyMessage* reply) {
    const auto id = static_cast<int32_t>(LoadU32(request.bytes.data() + kOffsetID));
    TarnLog(kLogDebug, "demux_server", "msgh_id: %d", id);
    if (id != kProcessContainersRequestID && id != kProcessContainersRequestID + 1) return false;
    *reply = MakeErrorReply(request.bytes.data(), kKernSuccess);
    bool handled = false;
    if (id == kProcessContainersRequestID) {
        server_get_process_containers(request, reply);
        handled = true;
    } else {
        *reply = MakeErrorReply(request.bytes.data(), kUpcallBadID);
    }
    TarnLog(kLogDebug, "demux_server", "result: %d", handled);
    return handled;
}

bool TarnKernServerStart(DispatchQueueRef targetQueue) {
    constexpr const char* kTag = "TarnKernServerStart";
    std::string why;
    std::shared_ptr<UpcallPort> port = UpcallPort::checkIn(kUpcallServiceName, &why);
    if (!port) {
        TarnLog(kLogError, kTag, "service check-in: %s", why);
        return false;
    }
    DispatchQueueRef queue =
        DispatchQueue::createSerial("com.ostrea.tarnkeeperd.upcall", std::move(targetQueue));
    const bool made = port->setReceiveHandler(
        queue,
        [](const ReceivedMessage& request) {
            ReplyMessage reply;
            // An id of no service here is still answered, so the sender does not wait.
            if (!demux_server(request, &reply) && reply.empty())
                reply = MakeErrorReply(request.bytes.data(), kUpcallBadID);
            return reply;
        },
        &why);
    if (!made) {
        TarnLog(kLogError, kTag, "Unable to create the upcall receive source: %s", why);
        return false;
    }
    port->resume();
    gPort = new std::shared_ptr<UpcallPort>(std::move(port));
    return true;
}

}  // namespace tarn
