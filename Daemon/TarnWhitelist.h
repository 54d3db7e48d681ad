// TarnWhitelist: the well-known system and system-group containers (fixed
// directory names instead of UUIDs) and the lookups granted without the usual
// lookup entitlement. One per process (sharedWhitelist); read-only once built
// and shared by every thread.
//
// The tables are platform configuration: DIR/etc/tarnkeeper/wellknown.plist
// when present, otherwise the built-in copy of dist/wellknown.plist. File
// format (a dictionary):
//   "SystemContainers"              {identifier: directory name}
//   "SystemGroupContainers"         {identifier: directory name}
//   "InternalSystemGroupContainers" {identifier: directory name}, internal builds only
//   "LookupByClass"                 {"<class>": [identifiers]}
//   "LookupByCodeSignIdentifier"    {code-signing id: true | {"<class>": true | [identifiers]}}
// where `true` is the "any" marker. A malformed file is logged and the
// built-in table is used instead.
#pragma once

#include <array>
#include <map>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <string_view>
#include <vector>

#include "Daemon/TarnContainerClass.h"
#include "Platform/PropertyList.h"

namespace tarn {

// A nested dictionary whose arrays became sets. Null is the "any" marker.
class TarnNestedSetValue {
public:
    enum class Kind { Null, Set, Dict, Other };
    Kind kind = Kind::Null;
    std::set<std::string> set;                        // Kind::Set (string elements)
    std::map<std::string, TarnNestedSetValue> dict;   // Kind::Dict
    PlistValue other;                                 // Kind::Other, copied unchanged

    bool isNullMarker() const { return kind == Kind::Null; }
};

class TarnWhitelist {
public:
    static TarnWhitelist& sharedWhitelist();

    // `whitelistedCodeSignIdentifierMapping`: code-signing id -> Null (any) or
    // {"<class>": Null (any) | [identifiers]}. Class keys are decimal strings.
    TarnWhitelist(std::map<std::string, std::string> systemContainerMapping,
                  std::map<std::string, std::string> systemGroupContainerMapping,
                  const std::map<TarnContainerClass, std::vector<std::string>>& whitelistedContainerMapping,
                  const PlistValue& whitelistedCodeSignIdentifierMapping);

    // Builds from a table file's dictionary; nullptr (reason in *why) when malformed.
    static std::unique_ptr<TarnWhitelist> whitelistWithTable(const PlistValue& table,
                                                             bool internalImage, std::string* why);
    // The shipped default table (identical to dist/wellknown.plist).
    static const PlistValue& builtInTable();

    std::vector<std::string> wellknownSystemContainers() const;
    std::vector<std::string> wellknownSystemGroupContainers() const;
    bool systemContainerIdIsWellknown(const std::string& identifier) const;
    bool systemGroupContainerIdIsWellknown(const std::string& identifier) const;
    std::optional<std::string> wellknownSystemContainerForId(const std::string& identifier) const;
    std::optional<std::string> wellknownSystemGroupContainerForId(const std::string& identifier) const;
    // Table by class: 12 system, 13 system group; other classes answer false/nullopt.
    bool containerIdIsWellknown(const std::string& identifier, TarnContainerClass containerClass) const;
    std::optional<std::string> wellknownContainerForId(const std::string& identifier,
                                                       TarnContainerClass containerClass) const;
    // Whether `name` is the directory name of a well-known container of the
    // class (12 or 13): the table's values, which need not equal identifiers.
    bool isWellknownDirectoryName(std::string_view name, TarnContainerClass containerClass) const;

    bool isLookupWhitelistedFromCodeSignIdentifier(const std::string& codeSignIdentifier,
                                                   TarnContainerClass forContainerClass,
                                                   const std::string& containerIdentifier) const;

    static TarnNestedSetValue _convertArraysToSetsInNestedDictionary(const PlistValue& dictionary);

    const std::map<std::string, std::string>& systemWhitelist() const { return systemWhitelist_; }
    const std::map<std::string, std::string>& systemGroupWhitelist() const {
        return systemGroupWhitelist_;
    }
    void setSystemWhitelist(std::map<std::string, std::string> m) { systemWhitelist_ = std::move(m); }
    void setSystemGroupWhitelist(std::map<std::string, std::string> m) {
        systemGroupWhitelist_ = std::move(m);
    }

private:
    std::array<std::optional<std::set<std::string>>, 14> whitelistedLookupByContainer_;
    TarnNestedSetValue whitelistedLookupByCodeSignIdentifier_;
    std::map<std::string, std::string> systemWhitelist_;
    std::map<std::string, std::string> systemGroupWhitelist_;
};

}  // namespace tarn
