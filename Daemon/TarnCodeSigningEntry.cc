#include "Daemon/TarnCodeSigningEntry.h"

#include <functional>

#include "Platform/Format.h"

namespace tarn {

namespace {

constexpr const char* kInfoKey = "CodeSigningInfo";
constexpr const char* kChildrenKey = "ChildBundleIds";
constexpr const char* kInvalidKey = "Invalid";
constexpr const char* kPlaceholderKey = "Placeholder";
constexpr const char* kAdvanceCopyKey = "AdvanceCopy";
constexpr const char* kRegisteredByCallerKey = "RegisteredByCaller";
constexpr const char* kDataContainerClassKey = "DataContainerClass";

bool boolFor(const PlistValue& dict, const char* key) {
    const PlistValue* v = dict.find(key);
    return v && v->truthy();
}

size_t combine(size_t seed, size_t h) {
    return seed ^ (h + 0x9e3779b97f4a7c15ULL + (seed << 6) + (seed >> 2));
}

}  // namespace

TarnCodeSigningEntry::TarnCodeSigningEntry(std::optional<PlistDict> codeSigningInfo,
                                           uint64_t andDataContainerClass)
    : codeSigningInfo_(std::move(codeSigningInfo)), dataContainerClass_(andDataContainerClass) {}

TarnCodeSigningEntry::TarnCodeSigningEntry(std::optional<PlistDict> codeSigningInfo)
    : TarnCodeSigningEntry(std::move(codeSigningInfo), 0) {}

std::shared_ptr<TarnCodeSigningEntry> TarnCodeSigningEntry::initWithSerializedDictionary(
    const PlistValue& serialized) {
    if (!serialized.isDict()) return nullptr;
    auto entry = std::make_shared<TarnCodeSigningEntry>();
    if (const PlistValue* info = serialized.find(kInfoKey); info && info->isDict()) {
        entry->codeSigningInfo_ = *info->asDict();
    }
    if (const PlistValue* children = serialized.find(kChildrenKey); children && children->isArray()) {
        for (const PlistValue& child : *children->asArray()) {
            // A non-string child cannot name a bundle; keep the ones that can.
            if (const std::string* s = child.asString()) entry->childBundleIdentifiers_.push_back(*s);
        }
    }
    entry->invalid_ = boolFor(serialized, kInvalidKey);
    entry->placeholder_ = boolFor(serialized, kPlaceholderKey);
    entry->advanceCopy_ = boolFor(serialized, kAdvanceCopyKey);
    entry->registeredByCaller_ = boolFor(serialized, kRegisteredByCallerKey);
    if (const PlistValue* cls = serialized.find(kDataContainerClassKey)) {
        entry->dataContainerClass_ = cls->asUInt64().value_or(0);
    }
    return entry;
}

PlistValue TarnCodeSigningEntry::serialize() const {
    PlistValue out{PlistDict{}};
    if (codeSigningInfo_) out.set(kInfoKey, *codeSigningInfo_);
    if (!childBundleIdentifiers_.empty()) {
        PlistArray children(childBundleIdentifiers_.begin(), childBundleIdentifiers_.end());
        out.set(kChildrenKey, std::move(children));
    }
    out.set(kInvalidKey, invalid_);
    out.set(kPlaceholderKey, placeholder_);
    out.set(kAdvanceCopyKey, advanceCopy_);
    out.set(kRegisteredByCallerKey, registeredByCaller_);
    out.set(kDataContainerClassKey, dataContainerClass_);
    return out;
}

const PlistDict* TarnCodeSigningEntry::entitlements() const {
    if (!codeSigningInfo_) return nullptr;
    auto it = codeSigningInfo_->find(kTarnEntitlementsKey);
    if (it == codeSigningInfo_->end()) return nullptr;
    return it->second.asDict();
}

bool TarnCodeSigningEntry::isEqual(const TarnCodeSigningEntry& other) const {
    return codeSigningInfo_ == other.codeSigningInfo_ &&
           childBundleIdentifiers_ == other.childBundleIdentifiers_ && invalid_ == other.invalid_ &&
           placeholder_ == other.placeholder_ && advanceCopy_ == other.advanceCopy_ &&
           registeredByCaller_ == other.registeredByCaller_ &&
           dataContainerClass_ == other.dataContainerClass_;
}

size_t TarnCodeSigningEntry::hash() const {
    // Only the info's keys feed its hash: values compare integers across
    // signedness, so hashing them would have to normalise every number.
    size_t infoHash = 0;
    if (codeSigningInfo_) {
        infoHash = codeSigningInfo_->size();
        for (const auto& [key, value] : *codeSigningInfo_) {
            infoHash = combine(infoHash, std::hash<std::string>{}(key));
        }
    }
    size_t childrenHash = childBundleIdentifiers_.size();
    for (const std::string& child : childBundleIdentifiers_) {
        childrenHash = combine(childrenHash, std::hash<std::string>{}(child));
    }
    size_t h = infoHash ^ childrenHash;
    if (invalid_) h += 2;
    if (placeholder_) h += 4;
    if (registeredByCaller_) h += 8;
    if (dataContainerClass_ != 0) h += 16;
    if (advanceCopy_) h += 32;
    return h;
}

std::string TarnCodeSigningEntry::description() const {
    std::optional<PlistValue> children;
    if (!childBundleIdentifiers_.empty()) {
        children = PlistValue(PlistArray(childBundleIdentifiers_.begin(), childBundleIdentifiers_.end()));
    }
    std::optional<PlistValue> info;
    if (codeSigningInfo_) info = PlistValue(*codeSigningInfo_);
    auto yn = [](bool b) { return b ? 'Y' : 'N'; };
    return Format(
        "<%@ invalid: %c, placeholder: %c, advanceCopy: %c, regByCaller: %c, dataClass: %llu, "
        "childBundles: %@, CSinfo: %@>",
        "TarnCodeSigningEntry", yn(invalid_), yn(placeholder_), yn(advanceCopy_),
        yn(registeredByCaller_), dataContainerClass_, children, info);
}

bool TarnCodeSigningEntriesEqual(const TarnCodeSigningEntryRef& a, const TarnCodeSigningEntryRef& b) {
    if (!a || !b) return !a && !b;
    return a->isEqual(*b);
}

}  // namespace tarn
