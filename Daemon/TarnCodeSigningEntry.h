// The code-signing record of one code-signing identifier. The identifier is
// the key under which the record is stored and is not part of it.
//
// An entry is built and filled in by one owner (the store while decoding a row,
// the mapping while processing new information) and is then shared as
// TarnCodeSigningEntryRef, which is immutable: whoever wants a changed entry
// copies it first. Shared entries may be read from any thread.
#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "Platform/PropertyList.h"

namespace tarn {

class TarnCodeSigningEntry;
using TarnCodeSigningEntryRef = std::shared_ptr<const TarnCodeSigningEntry>;

// Key of the entitlements dictionary inside the code-signing info.
inline constexpr const char* kTarnEntitlementsKey = "com.ostrea.TarnKeeper.Entitlements";

class TarnCodeSigningEntry {
public:
    // No info, no flags, no children, class 0: the entry that means "remove".
    TarnCodeSigningEntry() = default;
    // initWithCodeSigningInfo:andDataContainerClass: (flags false, no children).
    TarnCodeSigningEntry(std::optional<PlistDict> codeSigningInfo, uint64_t andDataContainerClass);
    // initWithCodeSigningInfo: (class 0).
    explicit TarnCodeSigningEntry(std::optional<PlistDict> codeSigningInfo);

    // initWithSerializedDictionary: the form written by serialize() (and by the
    // legacy mapping file). Empty when `serialized` is not a dictionary; keys of
    // the wrong type read as absent.
    static std::shared_ptr<TarnCodeSigningEntry> initWithSerializedDictionary(
        const PlistValue& serialized);
    PlistValue serialize() const;

    // Absent info and an empty dictionary are different things: absent means
    // the identifier has no code-signing information.
    const std::optional<PlistDict>& codeSigningInfo() const { return codeSigningInfo_; }
    // The info's entitlements dictionary, whatever the entry's flags; empty when
    // there is no info or the value is not a dictionary.
    const PlistDict* entitlements() const;
    // In the order they were added; empty when there are none.
    const std::vector<std::string>& childBundleIdentifiers() const { return childBundleIdentifiers_; }
    bool invalid() const { return invalid_; }
    bool placeholder() const { return placeholder_; }
    bool advanceCopy() const { return advanceCopy_; }
    bool registeredByCaller() const { return registeredByCaller_; }
    uint64_t dataContainerClass() const { return dataContainerClass_; }

    void setCodeSigningInfo(std::optional<PlistDict> info) { codeSigningInfo_ = std::move(info); }
    void setChildBundleIdentifiers(std::vector<std::string> ids) { childBundleIdentifiers_ = std::move(ids); }
    void setInvalid(bool v) { invalid_ = v; }
    void setPlaceholder(bool v) { placeholder_ = v; }
    void setAdvanceCopy(bool v) { advanceCopy_ = v; }
    void setRegisteredByCaller(bool v) { registeredByCaller_ = v; }
    void setDataContainerClass(uint64_t v) { dataContainerClass_ = v; }

    bool isEqual(const TarnCodeSigningEntry& other) const;
    bool operator==(const TarnCodeSigningEntry& other) const { return isEqual(other); }
    size_t hash() const;
    std::string description() const;

private:
    std::optional<PlistDict> codeSigningInfo_;
    std::vector<std::string> childBundleIdentifiers_;
    bool invalid_ = false;
    bool placeholder_ = false;
    bool advanceCopy_ = false;
    bool registeredByCaller_ = false;
    uint64_t dataContainerClass_ = 0;
};

// Equality of two possibly absent entries: both absent are equal.
bool TarnCodeSigningEntriesEqual(const TarnCodeSigningEntryRef& a, const TarnCodeSigningEntryRef& b);

}  // namespace tarn
