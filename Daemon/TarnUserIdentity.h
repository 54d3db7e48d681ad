// TarnUserIdentity: the POSIX user, group, home directory and persona that own
// a tree of per-user containers. Immutable after construction and shared
// freely between threads as TarnUserIdentityRef.
//
// Identity is the `identifier` alone: the persona unique string for an
// enterprise persona, the decimal user id otherwise. The personal and the
// unspecific identity of one user are therefore equal and collapse to one
// entry in sets and map keys (use TarnUserIdentitySet / TarnUserIdentityMap).
//
// The stored form (`plist`, version 2) is what container metadata and pending
// data-protection operations keep; reading it maps it back onto the cache's
// current identities, so home directory and kernel persona id never come from
// a file.
#pragma once

#include <cstddef>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <unordered_map>
#include <unordered_set>

#include "Daemon/TarnContainerClass.h"
#include "Daemon/TarnResult.h"
#include "Platform/Path.h"
#include "Platform/PropertyList.h"

namespace tarn {

class TarnUserIdentity;
class TarnUserIdentityCache;
using TarnUserIdentityRef = std::shared_ptr<const TarnUserIdentity>;

enum : uint32_t {
    TarnPersonaTypePersonal = 0,
    TarnPersonaTypeEnterprise = 1,
    TarnPersonaTypeUnspecific = 2,
};

// Hash and equality of shared immutable values through their own hash() and
// isEqual(); two empty pointers are equal. For unordered containers keyed by
// identities.
template <class T>
struct TarnRefHash {
    size_t operator()(const std::shared_ptr<const T>& v) const { return v ? v->hash() : 0; }
};
template <class T>
struct TarnRefEqual {
    bool operator()(const std::shared_ptr<const T>& a, const std::shared_ptr<const T>& b) const {
        if (!a || !b) return !a && !b;
        return a.get() == b.get() || a->isEqual(*b);
    }
};

class TarnUserIdentity {
    struct PrivateTag {};

public:
    // The designated initialiser. A uid below 501 (a role user) is refused
    // with a level-3 line and nullptr. An empty home directory is logged as a
    // fault and the identity is still made.
    static TarnUserIdentityRef initWithUID(uint32_t uid, uint32_t GID, FileURL homeDirectoryURL,
                                           std::optional<std::string> personaUniqueString,
                                           uint32_t personaType, uint32_t kernelPersonaID);
    // User 501, group 501, the home directory of 501, personal, persona id 501.
    static TarnUserIdentityRef init();

    // Reads a stored identity against `cache` (versions "1" and "2").
    // Malformed data fails with TarnErrorInvalidUserIdentityData (the line
    // saying why is logged, the error value is silent); well-formed data that
    // names no identity the cache knows is a success holding an empty ref.
    static TarnResult<TarnUserIdentityRef> userIdentityWithPlist(const PlistValue& plist,
                                                                 TarnUserIdentityCache& cache);
    // The common case of userIdentityWithPlist() for a stored identity whose
    // entries were decoded as a list (a metadata rebuild): a well-formed
    // version-2 identity that is not enterprise, answered as that would
    // (nullptr when the cache knows none, which is no failure there either).
    // False, with *identity untouched, for anything else: the caller then
    // asks userIdentityWithPlist(), which reads or reports it.
    static bool userIdentityWithEntries(const PlistEntries& entries, TarnUserIdentityCache& cache,
                                        TarnUserIdentityRef* identity);
    static TarnResult<TarnUserIdentityRef> initWithPlist(const PlistValue& plist,
                                                         TarnUserIdentityCache& cache);
    static TarnResult<TarnUserIdentityRef> initWithVersion1PlistDictionary(
        const PlistValue& plist, TarnUserIdentityCache& cache);
    static TarnResult<TarnUserIdentityRef> initWithVersion2PlistDictionary(
        const PlistValue& plist, TarnUserIdentityCache& cache);

    // Version-2 dictionary: "posixUID", "posixGID", "type", "version" = "2",
    // and "personaUniqueString" when present.
    PlistValue plist() const;

    // False for exactly the global classes (bundle and system).
    static bool isUserIdentityRequiredForContainerClass(TarnContainerClass containerClass);
    // Installation owner for bundles, system-container owner for system
    // classes, this identity's ids otherwise.
    uint32_t posixUIDForContainerClass(TarnContainerClass containerClass) const;
    uint32_t posixGIDForContainerClass(TarnContainerClass containerClass) const;

    static std::string _identifierForPOSIXUID(uint32_t uid,
                                              const std::optional<std::string>& personaUniqueString,
                                              uint32_t personaType);
    // "personal", "enterprise", "unspecific" or "unknown".
    static const char* personaTypeName(uint32_t personaType);

    const FileURL& homeDirectoryURL() const { return homeDirectoryURL_; }
    uint32_t kernelPersonaID() const { return kernelPersonaID_; }
    uint32_t posixUID() const { return posixUID_; }
    uint32_t posixGID() const { return posixGID_; }
    uint32_t personaType() const { return personaType_; }
    const std::optional<std::string>& personaUniqueString() const { return personaUniqueString_; }
    const std::string& identifier() const { return identifier_; }

    bool isEnterprise() const { return personaType_ == TarnPersonaTypeEnterprise; }
    bool isNoSpecificPersona() const { return personaType_ == TarnPersonaTypeUnspecific; }
    bool isHomeDirectoryInCommonSandbox() const {
        return personaType_ == TarnPersonaTypePersonal || personaType_ == TarnPersonaTypeUnspecific;
    }

    bool isEqualToUserIdentity(const TarnUserIdentity& other) const {
        return identifier_ == other.identifier_;
    }
    bool isEqual(const TarnUserIdentity& other) const { return isEqualToUserIdentity(other); }
    size_t hash() const { return std::hash<std::string>()(identifier_); }

    // "501/personal" style, for log lines that embed identities.
    std::string shortDescription() const;
    std::string description() const;

    // For make_shared only; use initWithUID().
    TarnUserIdentity(PrivateTag, FileURL home, uint32_t personaID, uint32_t uid, uint32_t gid,
                     uint32_t type, std::optional<std::string> personaUniqueString);

private:
    const FileURL homeDirectoryURL_;
    const uint32_t kernelPersonaID_;
    const uint32_t posixUID_;
    const uint32_t posixGID_;
    const uint32_t personaType_;
    const std::optional<std::string> personaUniqueString_;
    const std::string identifier_;
};

// Unordered containers of identities, by identifier equality.
using TarnUserIdentitySet = std::unordered_set<TarnUserIdentityRef, TarnRefHash<TarnUserIdentity>,
                                               TarnRefEqual<TarnUserIdentity>>;
// "(a, b)" with each identity's description, "(null)" for an empty slot.
std::string TarnUserIdentitySetDescription(const TarnUserIdentitySet& identities);
template <class V>
using TarnUserIdentityMap = std::unordered_map<TarnUserIdentityRef, V, TarnRefHash<TarnUserIdentity>,
                                               TarnRefEqual<TarnUserIdentity>>;

}  // namespace tarn
