// Container identities: the name of a container. TarnContainerIdentity is
// (user identity, identifier, class); TarnConcreteContainerIdentity adds the
// UUID recorded in the container's metadata. Both are immutable once made and
// shared freely between threads.
//
// Construction validates its arguments and answers the identity (never
// empty) or a silent error value of TarnErrorDomain: TarnErrorMissingIdentifier
// for a missing identifier, TarnErrorInvalidArgument for every other bad
// argument. The refusal itself is logged once, by the constructor. The
// overloads taking `const PlistValue*` are for values decoded from a request,
// whose type is not known yet; nullptr or a Null value is "missing".
//
// Equality is deliberately asymmetric: a plain identity equals a concrete one
// with the same three fields, but a concrete identity equals only another
// concrete identity with the same UUID. Key a map by one kind only.
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
#include "Daemon/TarnUserIdentity.h"
#include "Platform/PropertyList.h"

namespace tarn {

class TarnContainerIdentity;
class TarnConcreteContainerIdentity;
using TarnContainerIdentityRef = std::shared_ptr<const TarnContainerIdentity>;
using TarnConcreteContainerIdentityRef = std::shared_ptr<const TarnConcreteContainerIdentity>;

class TarnContainerIdentity {
protected:
    // Explicit: outside code cannot make one with {} and skip the checks.
    struct PrivateTag {
        explicit PrivateTag() = default;
    };

public:
    static TarnResult<TarnContainerIdentityRef> containerIdentityWithUserIdentity(
        TarnUserIdentityRef userIdentity, std::optional<std::string> identifier,
        TarnContainerClass containerClass);
    static TarnResult<TarnContainerIdentityRef> containerIdentityWithUserIdentity(
        TarnUserIdentityRef userIdentity, const PlistValue* identifier,
        TarnContainerClass containerClass);
    static TarnResult<TarnContainerIdentityRef> initWithUserIdentity(
        TarnUserIdentityRef userIdentity, std::optional<std::string> identifier,
        TarnContainerClass containerClass);
    // For callers without a user identity: allowed only for global classes,
    // which get the default user identity; other classes fail with
    // TarnErrorInvalidArgument.
    static TarnResult<TarnContainerIdentityRef> containerIdentityWithIdentifier(
        std::optional<std::string> identifier, TarnContainerClass containerClass);

    virtual ~TarnContainerIdentity() = default;

    const std::string& identifier() const { return identifier_; }
    TarnContainerClass containerClass() const { return containerClass_; }
    const TarnUserIdentityRef& userIdentity() const { return userIdentity_; }

    // Same identifier, equal user identities (by identifier) and same class;
    // `other` may be concrete.
    bool isEqualToContainerIdentity(const TarnContainerIdentity& other) const;
    virtual bool isEqual(const TarnContainerIdentity& other) const;
    virtual size_t hash() const;
    virtual std::string description() const;

    // For make_shared only.
    TarnContainerIdentity(PrivateTag, TarnUserIdentityRef userIdentity, std::string identifier,
                          TarnContainerClass containerClass);

protected:
    // The checks of validate() for an identifier that is text or absent.
    static TarnStatus validateText(const TarnUserIdentityRef& userIdentity, bool hasIdentifier,
                                   TarnContainerClass containerClass);
    // Runs the checks of the base identity; on success fills `identifierOut`.
    static TarnStatus validate(const TarnUserIdentityRef& userIdentity, const PlistValue* identifier,
                               TarnContainerClass containerClass, std::string* identifierOut);

private:
    const std::string identifier_;
    const TarnContainerClass containerClass_;
    const TarnUserIdentityRef userIdentity_;
};

class TarnConcreteContainerIdentity : public TarnContainerIdentity {
public:
    static TarnResult<TarnConcreteContainerIdentityRef> containerIdentityWithUUID(
        std::optional<Uuid> uuid, TarnUserIdentityRef userIdentity,
        std::optional<std::string> identifier, TarnContainerClass containerClass);
    // `uuid` must hold a Uuid value; a string, even in UUID form, is refused.
    static TarnResult<TarnConcreteContainerIdentityRef> containerIdentityWithUUID(
        const PlistValue* uuid, TarnUserIdentityRef userIdentity, const PlistValue* identifier,
        TarnContainerClass containerClass);
    static TarnResult<TarnConcreteContainerIdentityRef> initWithUUID(
        std::optional<Uuid> uuid, TarnUserIdentityRef userIdentity,
        std::optional<std::string> identifier, TarnContainerClass containerClass);

    const Uuid& uuid() const { return uuid_; }

    // Same UUID and the base comparison.
    bool isEqualToConcreteContainerIdentity(const TarnConcreteContainerIdentity& other) const;
    // True only for another concrete identity.
    bool isEqual(const TarnContainerIdentity& other) const override;
    size_t hash() const override;
    std::string description() const override;

    // The plain identity of the same three fields.
    TarnContainerIdentityRef baseIdentity() const;

    // For make_shared only.
    TarnConcreteContainerIdentity(PrivateTag, Uuid uuid, TarnUserIdentityRef userIdentity,
                                  std::string identifier, TarnContainerClass containerClass);

private:
    const Uuid uuid_;
};

using TarnContainerIdentitySet =
    std::unordered_set<TarnContainerIdentityRef, TarnRefHash<TarnContainerIdentity>,
                       TarnRefEqual<TarnContainerIdentity>>;
template <class V>
using TarnContainerIdentityMap =
    std::unordered_map<TarnContainerIdentityRef, V, TarnRefHash<TarnContainerIdentity>,
                       TarnRefEqual<TarnContainerIdentity>>;

}  // namespace tarn
