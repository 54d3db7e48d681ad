#include "Daemon/TarnUserIdentity.h"

#include <limits>

#include "Daemon/TarnError.h"
#include "Daemon/TarnFileManager.h"
#include "Daemon/TarnLog.h"
#include "Daemon/TarnUserIdentityCache.h"
#include "Platform/ContainerLibrary.h"
#include "Platform/PlatformLog.h"

namespace tarn {

namespace {

constexpr uint32_t kFirstNonRoleUID = 501;

// Human-readable kind of a stored value, for the malformed-data log lines.
const char* valueKindName(const PlistValue* v) {
    if (!v) return "(null)";
    switch (v->type()) {
        case PlistValue::Type::Null: return "null";
        case PlistValue::Type::Bool: return "boolean";
        case PlistValue::Type::UInt:
        case PlistValue::Type::Int:
        case PlistValue::Type::Real: return "number";
        case PlistValue::Type::String: return "string";
        case PlistValue::Type::Data: return "data";
        case PlistValue::Type::Date: return "date";
        case PlistValue::Type::Uuid: return "uuid";
        case PlistValue::Type::Array: return "array";
        case PlistValue::Type::Dict: return "dictionary";
    }
    return "unknown";
}

std::string valueDescription(const PlistValue* v) { return v ? v->description() : "(null)"; }

// A stored uint32 number. Negative, fractional or too large values are as
// malformed as a string would be.
std::optional<uint32_t> storedUInt32(const PlistValue* v) {
    if (!v || !v->isInteger()) return std::nullopt;
    auto u = v->asUInt64();
    if (!u || *u > std::numeric_limits<uint32_t>::max()) return std::nullopt;
    return static_cast<uint32_t>(*u);
}

// The lines of the readers below are their reports: the error values are
// silent, so that nothing is logged twice.
TarnResult<uint32_t> readNumber(const PlistValue& plist, const char* key) {
    const PlistValue* v = plist.find(key);
    auto n = storedUInt32(v);
    if (!n) {
        TarnLog(kLogError, "initWithPlist",
                "Invalid user identity plist data. Expected number for %@, got %@. Data: %@", key,
                valueKindName(v), plist);
        return TARN_ERROR_CODE_IN("initWithPlist", TarnErrorInvalidUserIdentityData, nullptr);
    }
    return *n;
}

}  // namespace

TarnUserIdentity::TarnUserIdentity(PrivateTag, FileURL home, uint32_t personaID, uint32_t uid,
                                   uint32_t gid, uint32_t type,
                                   std::optional<std::string> personaUniqueString)
    : homeDirectoryURL_(std::move(home)),
      kernelPersonaID_(personaID),
      posixUID_(uid),
      posixGID_(gid),
      personaType_(type),
      personaUniqueString_(std::move(personaUniqueString)),
      identifier_(_identifierForPOSIXUID(uid, personaUniqueString_, type)) {}

TarnUserIdentityRef TarnUserIdentity::initWithUID(uint32_t uid, uint32_t GID,
                                                  FileURL homeDirectoryURL,
                                                  std::optional<std::string> personaUniqueString,
                                                  uint32_t personaType, uint32_t kernelPersonaID) {
    if (uid < kFirstNonRoleUID) {
        TarnLog(kLogError, "initWithUID",
                "Attempt to create a TarnUserIdentity object with a role user uid is not allowed: "
                "uid = %u, gid = %u",
                uid, GID);
        return nullptr;
    }
    if (homeDirectoryURL.empty()) {
        PlatformLog("default", PlatformLogType::Fault, "Home directory cannot be nil");
    }
    return std::make_shared<const TarnUserIdentity>(PrivateTag{}, std::move(homeDirectoryURL),
                                                    kernelPersonaID, uid, GID, personaType,
                                                    std::move(personaUniqueString));
}

TarnUserIdentityRef TarnUserIdentity::init() {
    return initWithUID(kFirstNonRoleUID, kFirstNonRoleUID,
                       TarnFileManager::homeDirectoryURLForPOSIXUID(kFirstNonRoleUID), std::nullopt,
                       TarnPersonaTypePersonal, kFirstNonRoleUID);
}

std::string TarnUserIdentity::_identifierForPOSIXUID(
    uint32_t uid, const std::optional<std::string>& personaUniqueString, uint32_t personaType) {
    if (personaType == TarnPersonaTypeEnterprise && personaUniqueString) return *personaUniqueString;
    return std::to_string(uid);
}

const char* TarnUserIdentity::personaTypeName(uint32_t personaType) {
    switch (personaType) {
        case TarnPersonaTypePersonal: return "personal";
        case TarnPersonaTypeEnterprise: return "enterprise";
        case TarnPersonaTypeUnspecific: return "unspecific";
        default: return "unknown";
    }
}

bool TarnUserIdentity::isUserIdentityRequiredForContainerClass(TarnContainerClass containerClass) {
    return !TarnContainerClassIsGlobal(containerClass);
}

uint32_t TarnUserIdentity::posixUIDForContainerClass(TarnContainerClass containerClass) const {
    if (TarnContainerClassIsBundle(containerClass)) return CONTAINER_INSTALLATION_UID;
    if (TarnContainerClassIsSystem(containerClass)) return CONTAINER_SYSTEM_UID;
    return posixUID_;
}

uint32_t TarnUserIdentity::posixGIDForContainerClass(TarnContainerClass containerClass) const {
    // The platform has no separate group constants: the user ids serve as both.
    if (TarnContainerClassIsBundle(containerClass)) return CONTAINER_INSTALLATION_UID;
    if (TarnContainerClassIsSystem(containerClass)) return CONTAINER_SYSTEM_UID;
    return posixGID_;
}

PlistValue TarnUserIdentity::plist() const {
    PlistDict d;
    d["posixUID"] = PlistValue(posixUID_);
    d["posixGID"] = PlistValue(posixGID_);
    d["type"] = PlistValue(personaType_);
    d["version"] = PlistValue("2");
    if (personaUniqueString_) d["personaUniqueString"] = PlistValue(*personaUniqueString_);
    return PlistValue(std::move(d));
}

TarnResult<TarnUserIdentityRef> TarnUserIdentity::userIdentityWithPlist(const PlistValue& plist,
                                                                        TarnUserIdentityCache& cache) {
    return initWithPlist(plist, cache);
}

bool TarnUserIdentity::userIdentityWithEntries(const PlistEntries& entries,
                                               TarnUserIdentityCache& cache,
                                               TarnUserIdentityRef* identity) {
    const PlistValue *version = nullptr, *uid = nullptr, *gid = nullptr, *type = nullptr;
    for (const auto& [key, value] : entries) {
        if (key == "version") version = &value;
        else if (key == "posixUID") uid = &value;
        else if (key == "posixGID") gid = &value;
        else if (key == "type") type = &value;
    }
    const std::string* versionString = version ? version->asString() : nullptr;
    if (!versionString || *versionString != "2") return false;
    auto u = storedUInt32(uid), g = storedUInt32(gid), t = storedUInt32(type);
    // An enterprise type may name its persona by its unique string: that
    // reading, and every refusal, stays with the dictionary reader.
    if (!u || !g || !t || *t > TarnPersonaTypeUnspecific || *t == TarnPersonaTypeEnterprise)
        return false;
    *identity = cache.userIdentityForPersonalPersonaWithUID(*u, *g);
    return true;
}

TarnResult<TarnUserIdentityRef> TarnUserIdentity::initWithPlist(const PlistValue& plist,
                                                                TarnUserIdentityCache& cache) {
    const PlistValue* version = plist.isDict() ? plist.find("version") : nullptr;
    const std::string* versionString = version ? version->asString() : nullptr;
    if (versionString && *versionString == "2") {
        return initWithVersion2PlistDictionary(plist, cache);
    }
    if (versionString && *versionString == "1") {
        return initWithVersion1PlistDictionary(plist, cache);
    }
    // Neither reader applies (not a dictionary, or an unknown or non-string
    // version): the data is not a stored identity we can trust.
    TarnLog(kLogError, "initWithPlist",
            "Invalid user identity plist data. Unknown version %@. Data: %@",
            valueDescription(version), plist);
    return TARN_ERROR_CODE(TarnErrorInvalidUserIdentityData, nullptr);
}

TarnResult<TarnUserIdentityRef> TarnUserIdentity::initWithVersion2PlistDictionary(
    const PlistValue& plist, TarnUserIdentityCache& cache) {
    const uint32_t uid = TARN_TRY(readNumber(plist, "posixUID"));
    const uint32_t gid = TARN_TRY(readNumber(plist, "posixGID"));
    const uint32_t type = TARN_TRY(readNumber(plist, "type"));
    if (type > TarnPersonaTypeUnspecific) {
        TarnLog(kLogError, "initWithVersion2PlistDictionary",
                "Invalid user identity plist data. Expected persona type for %@, got %@. Data: %@",
                "type", valueDescription(plist.find("type")), plist);
        return TARN_ERROR_CODE(TarnErrorInvalidUserIdentityData, nullptr);
    }
    const PlistValue* unique = plist.find("personaUniqueString");
    const std::string* uniqueString = unique ? unique->asString() : nullptr;
    TarnUserIdentityRef result;
    if (type == TarnPersonaTypeEnterprise && uniqueString) {
        result = cache.userIdentityForPersonaUniqueString(*uniqueString, uid, gid);
        if (result && !result->isEnterprise()) {
            TarnLog(kLogError, "initWithVersion2PlistDictionary",
                    "Invalid user identity plist data. Expected %@ to be enterprise, but it was "
                    "not. Data: %@",
                    result, plist);
        }
    } else {
        result = cache.userIdentityForPersonalPersonaWithUID(uid, gid);
    }
    // Empty when the cache knows no such identity: no failure of the data.
    return result;
}

TarnResult<TarnUserIdentityRef> TarnUserIdentity::initWithVersion1PlistDictionary(
    const PlistValue& plist, TarnUserIdentityCache& cache) {
    const uint32_t uid = TARN_TRY(readNumber(plist, "posixUID"));
    const uint32_t gid = TARN_TRY(readNumber(plist, "posixGID"));
    const PlistValue* persona = plist.find("personaIdentifier");
    const std::string* personaString = persona ? persona->asString() : nullptr;
    TarnUserIdentityRef result;
    if (personaString) result = cache.userIdentityForPersonaUniqueString(*personaString, uid, gid);
    if (!result) result = cache.userIdentityForPersonalPersonaWithUID(uid, gid);
    // Empty when the cache knows no such identity: no failure of the data.
    return result;
}

std::string TarnUserIdentity::shortDescription() const {
    return Format("%@/%s", identifier_, personaTypeName(personaType_));
}

std::string TarnUserIdentity::description() const {
    return Format(
        "<TarnUserIdentity: %p; identifier = %@, type = %s, uid = %u, gid = %u, personaID = %u, "
        "personaUniqueString = %@, home = %@>",
        static_cast<const void*>(this), identifier_, personaTypeName(personaType_), posixUID_,
        posixGID_, kernelPersonaID_, personaUniqueString_, homeDirectoryURL_);
}

std::string TarnUserIdentitySetDescription(const TarnUserIdentitySet& identities) {
    std::string text = "(";
    for (const auto& identity : identities) {
        if (text.size() > 1) text += ", ";
        text += identity ? identity->description() : std::string("(null)");
    }
    return text + ")";
}

}  // namespace tarn
