#include "Daemon/TarnContainerIdentity.h"

#include "Daemon/TarnError.h"
#include "Daemon/TarnLog.h"
#include "Daemon/TarnUserIdentityCache.h"
#include "Platform/PlatformLog.h"

namespace tarn {

namespace {

// The construction's log lines carry the constructors' full names.
constexpr const char* kInitTag =
    "-[TarnContainerIdentity initWithUserIdentity:identifier:containerClass:error:]";
constexpr const char* kConcreteInitTag =
    "-[TarnConcreteContainerIdentity initWithUUID:userIdentity:identifier:containerClass:error:]";

}  // namespace

TarnContainerIdentity::TarnContainerIdentity(PrivateTag, TarnUserIdentityRef userIdentity,
                                             std::string identifier,
                                             TarnContainerClass containerClass)
    : identifier_(std::move(identifier)),
      containerClass_(containerClass),
      userIdentity_(std::move(userIdentity)) {}

TarnStatus TarnContainerIdentity::validateText(const TarnUserIdentityRef& userIdentity,
                                               bool hasIdentifier,
                                               TarnContainerClass containerClass) {
    // The line above each refusal is its report: the error values are silent.
    if (!userIdentity) {
        TarnLog(kLogError, kInitTag, "Invalid object: no user identity");
        return TARN_ERROR_CODE_IN(kInitTag, TarnErrorInvalidArgument, nullptr);
    }
    if (!hasIdentifier) {
        TarnLog(kLogError, kInitTag, "Invalid object: missing identifier");
        return TARN_ERROR_CODE_IN(kInitTag, TarnErrorMissingIdentifier, nullptr);
    }
    if (!TarnContainerClassIsValid(containerClass)) {
        TarnLog(kLogError, kInitTag, "Invalid object: container class = %llu", containerClass);
        return TARN_ERROR_CODE_IN(kInitTag, TarnErrorInvalidArgument, nullptr);
    }
    return {};
}

TarnStatus TarnContainerIdentity::validate(const TarnUserIdentityRef& userIdentity,
                                           const PlistValue* identifier,
                                           TarnContainerClass containerClass,
                                           std::string* identifierOut) {
    const bool present = identifier && !identifier->isNull();
    if (!userIdentity || !present) return validateText(userIdentity, present, containerClass);
    const std::string* text = identifier->asString();
    if (!text) {
        TarnLog(kLogError, kInitTag, "Invalid object: identifier = [%@]", *identifier);
        return TARN_ERROR_CODE_IN(kInitTag, TarnErrorInvalidArgument, nullptr);
    }
    TARN_TRY(validateText(userIdentity, true, containerClass));
    *identifierOut = *text;
    return {};
}

TarnResult<TarnContainerIdentityRef> TarnContainerIdentity::containerIdentityWithUserIdentity(
    TarnUserIdentityRef userIdentity, const PlistValue* identifier,
    TarnContainerClass containerClass) {
    std::string text;
    TARN_TRY(validate(userIdentity, identifier, containerClass, &text));
    return TarnContainerIdentityRef(std::make_shared<const TarnContainerIdentity>(
        PrivateTag{}, std::move(userIdentity), std::move(text), containerClass));
}

TarnResult<TarnContainerIdentityRef> TarnContainerIdentity::containerIdentityWithUserIdentity(
    TarnUserIdentityRef userIdentity, std::optional<std::string> identifier,
    TarnContainerClass containerClass) {
    // Text already: checked and moved in without a property-list detour.
    TARN_TRY(validateText(userIdentity, identifier.has_value(), containerClass));
    return TarnContainerIdentityRef(std::make_shared<const TarnContainerIdentity>(
        PrivateTag{}, std::move(userIdentity), std::move(*identifier), containerClass));
}

TarnResult<TarnContainerIdentityRef> TarnContainerIdentity::initWithUserIdentity(
    TarnUserIdentityRef userIdentity, std::optional<std::string> identifier,
    TarnContainerClass containerClass) {
    return containerIdentityWithUserIdentity(std::move(userIdentity), std::move(identifier),
                                             containerClass);
}

TarnResult<TarnContainerIdentityRef> TarnContainerIdentity::containerIdentityWithIdentifier(
    std::optional<std::string> identifier, TarnContainerClass containerClass) {
    if (TarnUserIdentity::isUserIdentityRequiredForContainerClass(containerClass)) {
        PlatformLog("default", PlatformLogType::Fault,
                    "Attempt to create a container identity without a user identity when one is "
                    "required; identifier = [%@], class = %llu",
                    identifier, containerClass);
        return TARN_ERROR_CODE(TarnErrorInvalidArgument, nullptr);
    }
    return containerIdentityWithUserIdentity(TarnUserIdentityCache::defaultUserIdentity(),
                                             std::move(identifier), containerClass);
}

bool TarnContainerIdentity::isEqualToContainerIdentity(const TarnContainerIdentity& other) const {
    return containerClass_ == other.containerClass_ && identifier_ == other.identifier_ &&
           userIdentity_->isEqualToUserIdentity(*other.userIdentity_);
}

bool TarnContainerIdentity::isEqual(const TarnContainerIdentity& other) const {
    return this == &other || isEqualToContainerIdentity(other);
}

size_t TarnContainerIdentity::hash() const {
    return std::hash<std::string>()(identifier_) ^ userIdentity_->hash() ^
           static_cast<size_t>(containerClass_);
}

std::string TarnContainerIdentity::description() const {
    return Format("<%@: %p; userIdentity = %@, identifier = %@, class = %llu>",
                  "TarnContainerIdentity", static_cast<const void*>(this),
                  userIdentity_->shortDescription(), identifier_, containerClass_);
}

// ---- TarnConcreteContainerIdentity ----

TarnConcreteContainerIdentity::TarnConcreteContainerIdentity(PrivateTag, Uuid uuid,
                                                             TarnUserIdentityRef userIdentity,
                                                             std::string identifier,
                                                             TarnContainerClass containerClass)
    : TarnContainerIdentity(PrivateTag{}, std::move(userIdentity), std::move(identifier),
                            containerClass),
      uuid_(uuid) {}

TarnResult<TarnConcreteContainerIdentityRef> TarnConcreteContainerIdentity::containerIdentityWithUUID(
    const PlistValue* uuid, TarnUserIdentityRef userIdentity, const PlistValue* identifier,
    TarnContainerClass containerClass) {
    std::string text;
    TARN_TRY(validate(userIdentity, identifier, containerClass, &text));
    // Only a UUID value will do: a string in UUID form is a caller's mistake.
    if (!uuid || !uuid->isUuid()) {
        TarnLog(kLogError, kConcreteInitTag, "Invalid object: uuid = [%@]",
                uuid ? uuid->description() : std::string("(null)"));
        return TARN_ERROR_CODE_IN(kConcreteInitTag, TarnErrorInvalidArgument, nullptr);
    }
    return TarnConcreteContainerIdentityRef(std::make_shared<const TarnConcreteContainerIdentity>(
        PrivateTag{}, *uuid->asUuid(), std::move(userIdentity), std::move(text), containerClass));
}

TarnResult<TarnConcreteContainerIdentityRef> TarnConcreteContainerIdentity::containerIdentityWithUUID(
    std::optional<Uuid> uuid, TarnUserIdentityRef userIdentity,
    std::optional<std::string> identifier, TarnContainerClass containerClass) {
    TARN_TRY(validateText(userIdentity, identifier.has_value(), containerClass));
    if (!uuid) {
        TarnLog(kLogError, kConcreteInitTag, "Invalid object: uuid = [%@]", "(null)");
        return TARN_ERROR_CODE_IN(kConcreteInitTag, TarnErrorInvalidArgument, nullptr);
    }
    return TarnConcreteContainerIdentityRef(std::make_shared<const TarnConcreteContainerIdentity>(
        PrivateTag{}, *uuid, std::move(userIdentity), std::move(*identifier), containerClass));
}

TarnResult<TarnConcreteContainerIdentityRef> TarnConcreteContainerIdentity::initWithUUID(
    std::optional<Uuid> uuid, TarnUserIdentityRef userIdentity,
    std::optional<std::string> identifier, TarnContainerClass containerClass) {
    return containerIdentityWithUUID(uuid, std::move(userIdentity), std::move(identifier),
                                     containerClass);
}

bool TarnConcreteContainerIdentity::isEqualToConcreteContainerIdentity(
    const TarnConcreteContainerIdentity& other) const {
    return uuid_ == other.uuid_ && isEqualToContainerIdentity(other);
}

bool TarnConcreteContainerIdentity::isEqual(const TarnContainerIdentity& other) const {
    if (this == &other) return true;
    auto* concrete = dynamic_cast<const TarnConcreteContainerIdentity*>(&other);
    return concrete && isEqualToConcreteContainerIdentity(*concrete);
}

size_t TarnConcreteContainerIdentity::hash() const {
    size_t h = 0;
    for (uint8_t b : uuid_.bytes) h = h * 131 + b;
    return TarnContainerIdentity::hash() ^ h;
}

std::string TarnConcreteContainerIdentity::description() const {
    return Format("<%@: %p; userIdentity = %@, identifier = %@, class = %llu, uuid = %@>",
                  "TarnConcreteContainerIdentity", static_cast<const void*>(this),
                  userIdentity()->shortDescription(), identifier(), containerClass(),
                  uuid_.string());
}

TarnContainerIdentityRef TarnConcreteContainerIdentity::baseIdentity() const {
    return std::make_shared<const TarnContainerIdentity>(PrivateTag{}, userIdentity(), identifier(),
                                                         containerClass());
}

}  // namespace tarn
