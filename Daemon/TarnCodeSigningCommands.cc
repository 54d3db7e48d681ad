#include "Daemon/TarnCodeSigningCommands.h"

#include <optional>
#include <string>

#include "Daemon/TarnClientConnection.h"
#include "Daemon/TarnCodeSigningMapping.h"
#include "Daemon/TarnContainerClass.h"
#include "Daemon/TarnContainerCommands.h"
#include "Daemon/TarnError.h"
#include "Daemon/TarnGroupManager.h"
#include "Daemon/TarnLog.h"

namespace tarn {

namespace {

constexpr uint64_t kHandlerFallback = TarnErrorInvalidArgument;

// A value that is present must have the type the mapping reads it as; the
// mapping itself would read a wrong one as absent and record something the
// caller never asked for.
bool hasType(const PlistValue* value, bool (*isType)(const PlistValue&)) {
    return !value || isType(*value);
}

bool isDictionary(const PlistValue& v) { return v.isDict(); }
bool isString(const PlistValue& v) { return v.isString(); }
bool isBoolean(const PlistValue& v) { return v.asBool().has_value(); }
bool isContainerClassNumber(const PlistValue& v) {
    // 0 records "unknown", as an absent option does.
    const std::optional<uint64_t> c = v.asUInt64();
    return c && (*c == 0 || TarnContainerClassIsValid(*c));
}

// Why the code-signing info or its options cannot be recorded; empty when they can.
std::optional<std::string> malformedCodeSigningRequest(const PlistValue* info,
                                                       const PlistValue* options) {
    if (!hasType(info, isDictionary)) return "CodeSigningInfo is not a dictionary";
    if (!hasType(options, isDictionary)) return "OptionsDictionary is not a dictionary";
    if (info && !hasType(info->find(TarnCodeSigningMapping::kEntitlementsKey), isDictionary))
        return "the entitlements are not a dictionary";
    if (!options) return std::nullopt;
    if (!hasType(options->find(TarnCodeSigningMapping::kOptionDataContainerClass),
                 isContainerClassNumber))
        return "the data-container class is not a container class";
    if (!hasType(options->find(TarnCodeSigningMapping::kOptionParentBundleID), isString))
        return "the parent identifier is not a string";
    for (const char* flag :
         {TarnCodeSigningMapping::kOptionRegisteredByCaller,
          TarnCodeSigningMapping::kOptionPlaceholder, TarnCodeSigningMapping::kOptionAdvanceCopy}) {
        if (!hasType(options->find(flag), isBoolean))
            return std::string(flag) + " is not a boolean";
    }
    return std::nullopt;
}

}  // namespace

void TarnHandleGroupIdentifiersCommand(const TarnRequestContext& context, const PlistValue& request,
                                       PlistValue& reply, TarnClientConnection* connection,
                                       uint64_t* error) {
    TarnResult<std::vector<std::string>> groups =
        TarnGroupManager::defaultManager().groupContainerIdentifiersForOwnerIdentifier(
            identifierWithDefault(request, *connection), TarnContainerClassAppGroup,
            /*useLocking=*/true);
    if (!TarnReport(groups, error, kHandlerFallback)) return;
    PlistArray identifiers;
    identifiers.reserve(groups->size());
    for (std::string& group : *groups) identifiers.emplace_back(std::move(group));
    reply.set("ReplyGroupIdentifiersArray", std::move(identifiers));
}

void TarnHandleProcessCodeSigningInfoCommand(const TarnRequestContext& context,
                                             const PlistValue& request, PlistValue& reply,
                                             TarnClientConnection* connection, uint64_t* error) {
    TarnCodeSigningMapping* mapping = TarnCodeSigningMapping::sharedInstance();
    if (!mapping) {
        TarnSetError(error, TarnErrorDatabase);
        return;
    }
    const PlistValue* info = request.find("CodeSigningInfo");
    const PlistValue* options = request.find("OptionsDictionary");
    if (info && info->isNull()) info = nullptr;
    if (options && options->isNull()) options = nullptr;
    const std::optional<std::string> identifier = stringForKey(request, "Identifier");
    if (std::optional<std::string> why = malformedCodeSigningRequest(info, options)) {
        TarnLog(kLogError, "processCodeSigningInfo", "Can't act on an invalid input for %@: %@",
                identifier, *why);
        TarnSetError(error, TarnErrorInvalidArgument);
        return;
    }
    // No identifier: the mapping answers TarnErrorMissingIdentifier.
    std::optional<PlistDict> codeSigningInfo;
    if (info) codeSigningInfo = *info->asDict();
    const TarnStatus processed = mapping->processCodeSigningInfo(
        codeSigningInfo, identifier.value_or(std::string()),
        options ? *options->asDict() : PlistDict{}, connection->commandQueue().get());
    (void)TarnReport(processed, error, kHandlerFallback);
}

void TarnHandleInvalidateAppsWithoutBundleCommand(const TarnRequestContext& context,
                                                  const PlistValue& request, PlistValue& reply,
                                                  TarnClientConnection* connection,
                                                  uint64_t* error) {
    TarnCodeSigningMapping* mapping = TarnCodeSigningMapping::sharedInstance();
    if (!mapping) {
        TarnSetError(error, TarnErrorDatabase);
        return;
    }
    (void)TarnReport(mapping->invalidateCodeSigningInfoForAppsWithoutBundleContainer(), error,
                     kHandlerFallback);
}

}  // namespace tarn
