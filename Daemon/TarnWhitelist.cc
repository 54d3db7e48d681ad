#include "Daemon/TarnWhitelist.h"

#include <mutex>

#include "Daemon/TarnFileManager.h"
#include "Daemon/TarnGlobalConfiguration.h"
#include "Daemon/TarnLog.h"
#include "Daemon/TarnPropertyListFile.h"
#include "Platform/RootPrefix.h"

namespace tarn {

namespace {

constexpr const char* kTableFile = "/etc/tarnkeeper/wellknown.plist";
constexpr const char* kSystemKey = "SystemContainers";
constexpr const char* kSystemGroupKey = "SystemGroupContainers";
constexpr const char* kInternalSystemGroupKey = "InternalSystemGroupContainers";
constexpr const char* kLookupByClassKey = "LookupByClass";
constexpr const char* kLookupByCodeSignKey = "LookupByCodeSignIdentifier";

PlistValue sameNameTable(std::initializer_list<const char*> identifiers) {
    PlistDict d;
    for (const char* id : identifiers) d[id] = PlistValue(id);
    return PlistValue(std::move(d));
}

PlistValue stringArray(std::initializer_list<const char*> items) {
    PlistArray a;
    for (const char* s : items) a.emplace_back(s);
    return PlistValue(std::move(a));
}

// {identifier: directory name}; false (reason in *why) when the shape is wrong.
bool readNameTable(const PlistValue& table, const char* key, bool required,
                   std::map<std::string, std::string>* out, std::string* why) {
    const PlistValue* value = table.find(key);
    if (!value) {
        if (required && why) *why = Format("\"%@\" is missing", key);
        return !required;
    }
    const PlistDict* dict = value->asDict();
    if (!dict) {
        if (why) *why = Format("\"%@\" is not a dictionary", key);
        return false;
    }
    for (const auto& [identifier, name] : *dict) {
        const std::string* text = name.asString();
        // A directory name is one path component; anything else could escape
        // the class directory.
        if (!text || text->empty() || text->find('/') != std::string::npos || *text == "." ||
            *text == "..") {
            if (why) *why = Format("\"%@\" has a bad directory name for %@", key, identifier);
            return false;
        }
        (*out)[identifier] = *text;
    }
    return true;
}

std::optional<TarnContainerClass> classKey(const std::string& key) {
    if (key.empty() || key.size() > 2 || key.find_first_not_of("0123456789") != std::string::npos) {
        return std::nullopt;
    }
    TarnContainerClass c = std::stoull(key);
    if (!TarnContainerClassIsValid(c)) return std::nullopt;
    // Look-ups use the plain decimal form: a key such as "07" would load and
    // never match.
    if (key != std::to_string(c)) return std::nullopt;
    return c;
}

bool isStringArray(const PlistValue& v) {
    const PlistArray* a = v.asArray();
    if (!a) return false;
    for (const auto& item : *a) {
        if (!item.isString()) return false;
    }
    return true;
}

// File form (true = any) to the initialiser's form (Null = any).
bool readCodeSignTable(const PlistValue& table, PlistValue* out, std::string* why) {
    const PlistValue* value = table.find(kLookupByCodeSignKey);
    PlistDict result;
    if (value) {
        const PlistDict* dict = value->asDict();
        if (!dict) {
            if (why) *why = Format("\"%@\" is not a dictionary", kLookupByCodeSignKey);
            return false;
        }
        for (const auto& [caller, grant] : *dict) {
            if (grant.asBool() == std::optional<bool>(true)) {
                result[caller] = PlistValue();
                continue;
            }
            const PlistDict* byClass = grant.asDict();
            if (!byClass) {
                if (why) *why = Format("grant for %@ is neither true nor a dictionary", caller);
                return false;
            }
            PlistDict classes;
            for (const auto& [key, ids] : *byClass) {
                if (!classKey(key)) {
                    if (why) *why = Format("grant for %@ names a bad class %@", caller, key);
                    return false;
                }
                if (ids.asBool() == std::optional<bool>(true)) {
                    classes[key] = PlistValue();
                } else if (isStringArray(ids)) {
                    classes[key] = ids;
                } else {
                    if (why) *why = Format("grant for %@ class %@ is neither true nor a list", caller, key);
                    return false;
                }
            }
            result[caller] = PlistValue(std::move(classes));
        }
    }
    *out = PlistValue(std::move(result));
    return true;
}

}  // namespace

const PlistValue& TarnWhitelist::builtInTable() {
    static const PlistValue table = [] {
        PlistDict t;
        t[kSystemKey] = sameNameTable({"com.ostrea.locationd", "com.ostrea.mediaserverd"});
        t[kSystemGroupKey] = sameNameTable({
            "systemgroup.com.ostrea.profiles",
            "systemgroup.com.ostrea.analytics",
            "systemgroup.com.ostrea.iconcache",
            "systemgroup.com.ostrea.activation",
            "systemgroup.com.ostrea.netresources",
            "systemgroup.com.ostrea.diagnostics",
            "systemgroup.com.ostrea.softwareupdate",
            "systemgroup.com.ostrea.credentials",
        });
        t[kInternalSystemGroupKey] = sameNameTable({"systemgroup.com.ostrea.internal.testing"});
        PlistDict byClass;
        byClass["10"] = stringArray({"com.ostrea.logd"});
        t[kLookupByClassKey] = PlistValue(std::move(byClass));
        PlistDict byCaller;
        for (const char* any : {"com.ostrea.installd", "com.ostrea.backupd", "com.ostrea.launchd",
                                "com.ostrea.tarnctl", "com.ostrea.restored",
                                "com.ostrea.migrationd"}) {
            byCaller[any] = PlistValue(true);
        }
        PlistDict mail;
        mail["7"] = stringArray({"group.com.ostrea.mail.shared"});
        byCaller["com.ostrea.mail"] = PlistValue(std::move(mail));
        PlistDict search;
        search["2"] = stringArray({"com.ostrea.notes"});
        byCaller["com.ostrea.searchd"] = PlistValue(std::move(search));
        PlistDict share;
        share["2"] = stringArray({"com.ostrea.photos"});
        byCaller["com.ostrea.sharingd"] = PlistValue(std::move(share));
        t[kLookupByCodeSignKey] = PlistValue(std::move(byCaller));
        return PlistValue(std::move(t));
    }();
    return table;
}

std::unique_ptr<TarnWhitelist> TarnWhitelist::whitelistWithTable(const PlistValue& table,
                                                                 bool internalImage,
                                                                 std::string* why) {
    if (!table.isDict()) {
        if (why) *why = "top level is not a dictionary";
        return nullptr;
    }
    std::map<std::string, std::string> system, systemGroup;
    if (!readNameTable(table, kSystemKey, true, &system, why) ||
        !readNameTable(table, kSystemGroupKey, true, &systemGroup, why)) {
        return nullptr;
    }
    if (internalImage && !readNameTable(table, kInternalSystemGroupKey, false, &systemGroup, why)) {
        return nullptr;
    }
    std::map<TarnContainerClass, std::vector<std::string>> byClass;
    if (const PlistValue* value = table.find(kLookupByClassKey)) {
        const PlistDict* dict = value->asDict();
        if (!dict) {
            if (why) *why = Format("\"%@\" is not a dictionary", kLookupByClassKey);
            return nullptr;
        }
        for (const auto& [key, ids] : *dict) {
            auto c = classKey(key);
            if (!c || !isStringArray(ids)) {
                if (why) *why = Format("\"%@\" has a bad entry for class %@", kLookupByClassKey, key);
                return nullptr;
            }
            for (const auto& id : *ids.asArray()) byClass[*c].push_back(*id.asString());
        }
    }
    PlistValue codeSign;
    if (!readCodeSignTable(table, &codeSign, why)) return nullptr;
    return std::make_unique<TarnWhitelist>(std::move(system), std::move(systemGroup), byClass,
                                           codeSign);
}

TarnWhitelist& TarnWhitelist::sharedWhitelist() {
    static std::mutex lock;
    static std::string root;
    // Never freed: references handed out under an earlier root stay valid, and
    // nothing is torn down at exit while other threads may still use it.
    static auto& built = *new std::vector<std::unique_ptr<TarnWhitelist>>();
    std::lock_guard<std::mutex> guard(lock);
    if (!built.empty() && root == RootPrefix()) return *built.back();

    const bool internal = TarnGlobalConfiguration::sharedInstance().isInternalImage();
    std::unique_ptr<TarnWhitelist> made;
    const FileURL file = RootPath(kTableFile);
    if (TarnFileManager::defaultManager().itemExistsAtURL(file)) {
        std::string why;
        const TarnResult<PlistValue> table = Tarn_dictionaryWithContentsOfURL(file, 0);
        if (table.ok()) made = whitelistWithTable(*table, internal, &why);
        if (!made) {
            const TarnErrorRef& error = table.error();
            TarnLog(kLogError, "+[TarnWhitelist sharedWhitelist]",
                    "Ignoring well-known containers table at %@: %@", file,
                    table.ok() ? why : (error ? error->description() : std::string("unreadable")));
        }
    }
    if (!made) made = whitelistWithTable(builtInTable(), internal, nullptr);
    built.push_back(std::move(made));
    root = RootPrefix();
    return *built.back();
}

TarnWhitelist::TarnWhitelist(
    std::map<std::string, std::string> systemContainerMapping,
    std::map<std::string, std::string> systemGroupContainerMapping,
    const std::map<TarnContainerClass, std::vector<std::string>>& whitelistedContainerMapping,
    const PlistValue& whitelistedCodeSignIdentifierMapping)
    : whitelistedLookupByCodeSignIdentifier_(
          _convertArraysToSetsInNestedDictionary(whitelistedCodeSignIdentifierMapping)),
      systemWhitelist_(std::move(systemContainerMapping)),
      systemGroupWhitelist_(std::move(systemGroupContainerMapping)) {
    for (TarnContainerClass c = 0; c < whitelistedLookupByContainer_.size(); ++c) {
        auto it = whitelistedContainerMapping.find(c);
        if (it == whitelistedContainerMapping.end()) continue;
        whitelistedLookupByContainer_[c] = std::set<std::string>(it->second.begin(), it->second.end());
    }
}

TarnNestedSetValue TarnWhitelist::_convertArraysToSetsInNestedDictionary(const PlistValue& dictionary) {
    TarnNestedSetValue result;
    struct Work {
        const PlistValue* from;
        TarnNestedSetValue* to;
    };
    // An explicit work list: the tables come from a file, and a deep one must
    // not exhaust the stack. Map nodes do not move, so `to` stays valid.
    std::vector<Work> work{{&dictionary, &result}};
    while (!work.empty()) {
        Work w = work.back();
        work.pop_back();
        if (const PlistDict* d = w.from->asDict()) {
            w.to->kind = TarnNestedSetValue::Kind::Dict;
            for (const auto& [key, value] : *d) work.push_back({&value, &w.to->dict[key]});
        } else if (const PlistArray* a = w.from->asArray()) {
            w.to->kind = TarnNestedSetValue::Kind::Set;
            for (const auto& item : *a) {
                if (const std::string* s = item.asString()) w.to->set.insert(*s);
            }
        } else if (w.from->isNull()) {
            w.to->kind = TarnNestedSetValue::Kind::Null;
        } else {
            w.to->kind = TarnNestedSetValue::Kind::Other;
            w.to->other = *w.from;
        }
    }
    return result;
}

std::vector<std::string> TarnWhitelist::wellknownSystemContainers() const {
    std::vector<std::string> ids;
    for (const auto& [id, _] : systemWhitelist_) ids.push_back(id);
    return ids;
}

std::vector<std::string> TarnWhitelist::wellknownSystemGroupContainers() const {
    std::vector<std::string> ids;
    for (const auto& [id, _] : systemGroupWhitelist_) ids.push_back(id);
    return ids;
}

bool TarnWhitelist::systemContainerIdIsWellknown(const std::string& identifier) const {
    return systemWhitelist_.count(identifier) > 0;
}

bool TarnWhitelist::systemGroupContainerIdIsWellknown(const std::string& identifier) const {
    return systemGroupWhitelist_.count(identifier) > 0;
}

std::optional<std::string> TarnWhitelist::wellknownSystemContainerForId(
    const std::string& identifier) const {
    auto it = systemWhitelist_.find(identifier);
    if (it == systemWhitelist_.end()) return std::nullopt;
    return it->second;
}

std::optional<std::string> TarnWhitelist::wellknownSystemGroupContainerForId(
    const std::string& identifier) const {
    auto it = systemGroupWhitelist_.find(identifier);
    if (it == systemGroupWhitelist_.end()) return std::nullopt;
    return it->second;
}

bool TarnWhitelist::containerIdIsWellknown(const std::string& identifier,
                                           TarnContainerClass containerClass) const {
    if (containerClass == TarnContainerClassSystemData) return systemContainerIdIsWellknown(identifier);
    if (containerClass == TarnContainerClassSystemGroup) {
        return systemGroupContainerIdIsWellknown(identifier);
    }
    return false;
}

std::optional<std::string> TarnWhitelist::wellknownContainerForId(
    const std::string& identifier, TarnContainerClass containerClass) const {
    if (containerClass == TarnContainerClassSystemData) return wellknownSystemContainerForId(identifier);
    if (containerClass == TarnContainerClassSystemGroup) {
        return wellknownSystemGroupContainerForId(identifier);
    }
    return std::nullopt;
}

bool TarnWhitelist::isWellknownDirectoryName(std::string_view name,
                                             TarnContainerClass containerClass) const {
    const std::map<std::string, std::string>* table =
        containerClass == TarnContainerClassSystemData    ? &systemWhitelist_
        : containerClass == TarnContainerClassSystemGroup ? &systemGroupWhitelist_
                                                          : nullptr;
    if (!table) return false;
    for (const auto& [identifier, directory] : *table)
        if (directory == name) return true;
    return false;
}

bool TarnWhitelist::isLookupWhitelistedFromCodeSignIdentifier(
    const std::string& codeSignIdentifier, TarnContainerClass forContainerClass,
    const std::string& containerIdentifier) const {
    if (forContainerClass >= whitelistedLookupByContainer_.size()) return false;
    const auto& open = whitelistedLookupByContainer_[forContainerClass];
    if (open && open->count(containerIdentifier)) return true;

    if (whitelistedLookupByCodeSignIdentifier_.kind != TarnNestedSetValue::Kind::Dict) return false;
    const auto& callers = whitelistedLookupByCodeSignIdentifier_.dict;
    auto entry = callers.find(codeSignIdentifier);
    if (entry == callers.end()) return false;
    if (entry->second.isNullMarker()) return true;
    if (entry->second.kind != TarnNestedSetValue::Kind::Dict) return false;
    auto classEntry = entry->second.dict.find(std::to_string(forContainerClass));
    if (classEntry == entry->second.dict.end()) return false;
    if (classEntry->second.isNullMarker()) return true;
    return classEntry->second.kind == TarnNestedSetValue::Kind::Set &&
           classEntry->second.set.count(containerIdentifier) > 0;
}

}  // namespace tarn
