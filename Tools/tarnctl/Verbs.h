// The request verbs of tarnctl: one definition per verb says which command it
// sends, which arguments fill which request keys, and how the reply reads as a
// table. The CLI, its --help, the bash completion and the man page's verb list
// all come from these definitions.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "Platform/PropertyList.h"
#include "Tools/tarnctl/Subcommands.h"

namespace tarnctl {

enum class ArgType { String, UInt, Int, Bool, Uuid, Json };

struct VerbArg {
    std::string name;  // "IDENTIFIER" is positional, "--class" an option
    std::string key = {};  // the request key it fills
    ArgType type = ArgType::String;
    std::string help = {};
    bool required = false;
    std::optional<std::string> defaultValue = std::nullopt;  // as it would be typed
    // Giving this argument sends another command (e.g. wipe with --class is 12).
    std::optional<uint64_t> command = std::nullopt;
};

struct VerbColumn {
    std::string replyKey;
    std::string heading;
};

// How list-shaped reply keys become one table. Parallel: the columns are
// arrays of equal length, one row per index. Keyed: the columns are
// dictionaries sharing their keys, one row per key (sorted), the key first.
struct VerbTable {
    enum class Kind { None, Parallel, Keyed } kind = Kind::None;
    std::string keyHeading = {};
    std::vector<VerbColumn> columns = {};
};

struct VerbDefinition {
    std::vector<std::string> path;  // {"container", "info", "get"}
    uint64_t command = 0;
    std::string help;
    std::vector<VerbArg> args = {};
    // Keys every request carries.
    std::vector<std::pair<std::string, tarn::PlistValue>> fixed = {};
    VerbTable table = {};
};

const std::vector<VerbDefinition>& VerbDefinitions();

// The request a verb sends for the given argument texts (name -> text, only
// those given). Empty with a reason when a text does not parse as its type.
std::optional<tarn::PlistValue> BuildVerbRequest(
    const VerbDefinition& verb, const std::vector<std::pair<std::string, std::string>>& given,
    std::string* why);

// The reply as an operator reads it: list-shaped keys as a table, the other
// reply keys as "Label  value" lines. "ReplyError" is not shown.
std::string FormatReplyTable(const VerbDefinition& verb, const tarn::PlistValue& reply);

// Rows of cells as aligned columns, two spaces apart, one line per row.
std::string FormatColumns(const std::vector<std::vector<std::string>>& rows);

void SetupVerbCommands(CLI::App& app, Options& options);

}  // namespace tarnctl
