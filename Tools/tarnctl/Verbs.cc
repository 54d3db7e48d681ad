// tarnctl's request verbs, defined once as data (VerbDefinitions) and turned
// into CLI11 subcommands, requests and readable replies here.
#include "Tools/tarnctl/Verbs.h"

#include <algorithm>
#include <cctype>
#include <charconv>
#include <fstream>
#include <iostream>
#include <map>
#include <memory>
#include <sstream>

#include "Platform/TarnErrorNames.h"
#include "Tools/tarnctl/Json.h"

namespace tarnctl {

namespace {

using tarn::PlistValue;

// Arguments several verbs share.
VerbArg identifier(std::string help = "The container's identifier") {
    return {.name = "IDENTIFIER", .key = "Identifier", .help = std::move(help), .required = true};
}
VerbArg ownIdentifier() {
    return {.name = "IDENTIFIER",
            .key = "Identifier",
            .help = "The identifier asked about (default: the caller's own)"};
}
VerbArg containerClass(std::string key = "ContainerClass", std::string name = "--class") {
    return {.name = std::move(name),
            .key = std::move(key),
            .type = ArgType::UInt,
            .help = "Container class, 1 to 13 (2: application data)",
            .defaultValue = "2"};
}
VerbArg transient() {
    return {.name = "--transient",
            .key = "Transient",
            .type = ArgType::Bool,
            .help = "The transient container of the identity"};
}
VerbArg uuid(std::string key = "UUID", std::string name = "--uuid") {
    return {.name = std::move(name),
            .key = std::move(key),
            .type = ArgType::Uuid,
            .help = "The container's UUID"};
}
VerbArg persona(std::string key = "PersonaUniqueString", std::string name = "--persona") {
    return {.name = std::move(name),
            .key = std::move(key),
            .help = "Persona unique string (per-user classes)"};
}
// The keys that name one existing container.
std::vector<VerbArg> concrete(std::vector<VerbArg> more = {}) {
    std::vector<VerbArg> args = {identifier(), containerClass(), uuid(), persona()};
    args.insert(args.end(), more.begin(), more.end());
    return args;
}

const VerbTable kContainerList{.kind = VerbTable::Kind::Parallel,
                               .columns = {{"ReplyIdsArray", "IDENTIFIER"},
                                           {"ReplyUUIDsArray", "UUID"},
                                           {"ReplyPersonaUniqueStringsArray", "PERSONA"}}};
const VerbTable kGroupPaths{.kind = VerbTable::Kind::Keyed,
                            .keyHeading = "GROUP",
                            .columns = {{"ReplyGroupContainerDict", "PATH"},
                                        {"ReplyPersonaUniqueStringDict", "PERSONA"},
                                        {"ReplySandboxTokenDict", "TOKEN"}}};

std::vector<VerbDefinition> makeDefinitions() {
    return {
        {.path = {"container", "create"},
         .command = 0,
         .help = "Create the container unless it exists",
         .args = {identifier(), containerClass(), transient()},
         .fixed = {{"CreateIfNecessary", PlistValue(true)}}},
        {.path = {"container", "lookup"},
         .command = 0,
         .help = "Look the container up without creating it",
         .args = {identifier(), containerClass(), transient()}},
        {.path = {"container", "list"},
         .command = 1,
         .help = "The caller's containers of a class",
         .args = {containerClass(), transient()},
         .table = kContainerList},
        {.path = {"container", "delete"},
         .command = 10,
         .help = "Move the container to death row",
         .args = {identifier(), containerClass(), transient()}},
        {.path = {"container", "wipe"},
         .command = 11,
         .help =
             "Remove the content of an entitled plug-in data container (class 4); with --class, "
             "of a container of that class",
         .args = {identifier(),
                  {.name = "--class",
                   .key = "ContainerClass",
                   .type = ArgType::UInt,
                   .help = "Wipe a container of this class instead (needs deleteContainerContent)",
                   .command = 12}}},
        {.path = {"container", "replace"},
         .command = 2,
         .help = "Replace the container named by --old (if any) by NEW-IDENTIFIER's container",
         .args = {{.name = "NEW-IDENTIFIER",
                   .key = "NewIdentifier",
                   .help = "The replacing container's identifier",
                   .required = true},
                  containerClass("NewContainerClass"),
                  uuid("NewContainerUUID"),
                  persona("NewPersonaUniqueString"),
                  {.name = "--old",
                   .key = "OldIdentifier",
                   .help = "The replaced container's identifier"},
                  containerClass("OldContainerClass", "--old-class"),
                  uuid("OldContainerUUID", "--old-uuid"),
                  persona("OldPersonaUniqueString", "--old-persona")}},
        {.path = {"container", "metadata"},
         .command = 7,
         .help = "The container's path, transient flag and (with --with-info) info dictionary",
         .args = concrete({{.name = "--with-info",
                            .key = "InfoDictRequested",
                            .type = ArgType::Bool,
                            .help = "Also the metadata's info dictionary"}})},
        {.path = {"container", "info", "get"},
         .command = 6,
         .help = "Read one metadata info value",
         .args = concrete({{.name = "KEY", .key = "Key", .help = "Info key", .required = true}})},
        {.path = {"container", "info", "set"},
         .command = 5,
         .help = "Set one metadata info value",
         .args = concrete({{.name = "KEY", .key = "Key", .help = "Info key", .required = true},
                           {.name = "VALUE",
                            .key = "Value",
                            .type = ArgType::Json,
                            .help = "The value as JSON (the send mapping), or @FILE",
                            .required = true}})},
        {.path = {"container", "du"},
         .command = 23,
         .help = "Disk usage of the container in bytes",
         .args = concrete()},
        {.path = {"container", "new-uuid"},
         .command = 9,
         .help = "Move the container to a new UUID directory",
         .args = concrete()},
        {.path = {"container", "restructure"},
         .command = 8,
         .help = "Recreate the container's standard subdirectories",
         .args = concrete()},
        {.path = {"container", "empty-death-row"},
         .command = 4,
         .help = "Destroy what is on death row; answered when the pass ends"},
        {.path = {"groups"},
         .command = 13,
         .help = "The application group containers of IDENTIFIER; with --ids only the group "
                 "identifiers",
         .args = {ownIdentifier(),
                  {.name = "--ids",
                   .type = ArgType::Bool,
                   .help = "Only the group identifiers the owner is entitled to",
                   .command = 14}},
         .table = kGroupPaths},
        {.path = {"system-container"},
         .command = 15,
         .help = "The path of a system container, created if needed",
         .args = {ownIdentifier()}},
        {.path = {"system-group"},
         .command = 16,
         .help = "The system group containers of --owner; with GROUP, that one group's path",
         .args = {{.name = "GROUP",
                   .key = "GroupIdentifier",
                   .help = "A system group identifier",
                   .command = 17},
                  {.name = "--owner",
                   .key = "Identifier",
                   .help = "The owner's identifier (default: the caller's own)"}},
         .table = kGroupPaths},
        {.path = {"codesign", "set"},
         .command = 18,
         .help = "Record code-signing information for IDENTIFIER (without --info: remove it)",
         .args = {identifier("The code-signing identifier"),
                  {.name = "--info",
                   .key = "CodeSigningInfo",
                   .type = ArgType::Json,
                   .help = "The information as a JSON object, or @FILE"},
                  {.name = "--options",
                   .key = "OptionsDictionary",
                   .type = ArgType::Json,
                   .help = "The options as a JSON object, or @FILE"}}},
        {.path = {"codesign", "get"},
         .command = 19,
         .help = "The code-signing information recorded for IDENTIFIER",
         .args = {identifier("The code-signing identifier")}},
        {.path = {"codesign", "invalidate"},
         .command = 20,
         .help = "Invalidate the information of applications without a bundle container"},
        {.path = {"protection", "set"},
         .command = 21,
         .help = "Set the data-protection class of a data container",
         .args = {identifier(),
                  {.name = "PROTECTION",
                   .key = "DataProtectionClass",
                   .type = ArgType::Int,
                   .help = "Data-protection class, 1 to 4",
                   .required = true},
                  containerClass(),
                  {.name = "--third-party",
                   .key = "IsThirdParty",
                   .type = ArgType::Bool,
                   .help = "A second- or third-party application"},
                  {.name = "--retry-if-locked",
                   .key = "RetryIfLocked",
                   .type = ArgType::Bool,
                   .help = "Retry once unlocked instead of failing with 61"}}},
        {.path = {"assets", "path"},
         .command = 28,
         .help = "The user-managed assets directory of IDENTIFIER's data container",
         .args = {identifier(),
                  {.name = "--relative",
                   .key = "IsRelative",
                   .type = ArgType::Bool,
                   .help = "Relative to the container"},
                  {.name = "--create",
                   .key = "CreateIfNecessary",
                   .type = ArgType::Bool,
                   .help = "Create it when missing"}}},
        {.path = {"assets", "delete"},
         .command = 29,
         .help = "Move one user-managed asset to death row",
         .args = {identifier(),
                  {.name = "PATH",
                   .key = "SourcePath",
                   .help = "Relative to the assets directory",
                   .required = true}}},
        {.path = {"assets", "stage-shared"},
         .command = 26,
         .help = "Move content into a system group container the caller names in its code-signing "
                 "information",
         .args = {identifier("The system group identifier"),
                  {.name = "SOURCE", .key = "SourcePath", .help = "Source path", .required = true},
                  {.name = "DEST",
                   .key = "DestPath",
                   .help = "Destination, relative to the group container",
                   .required = true}}},
        {.path = {"personas"},
         .command = 32,
         .help = "The persona unique strings visible to the caller",
         .table = {.kind = VerbTable::Kind::Parallel,
                   .columns = {{"ReplyPersonaUniqueStringsArray", "PERSONA"}}}},
        {.path = {"migrate"},
         .command = 24,
         .help = "Run the data-migrator migration; with --per-user the per-user migration",
         .args = {{.name = "--per-user",
                   .type = ArgType::Bool,
                   .help = "The per-user data migration",
                   .command = 30}}},
    };
}

std::optional<PlistValue> parseArg(const VerbArg& arg, const std::string& text, std::string* why) {
    auto bad = [&](const char* what) -> std::optional<PlistValue> {
        *why = arg.name + ": " + what + ": " + text;
        return std::nullopt;
    };
    switch (arg.type) {
        case ArgType::String:
            return PlistValue(text);
        case ArgType::Bool:
            return PlistValue(true);
        case ArgType::UInt: {
            uint64_t v = 0;
            auto [end, ec] = std::from_chars(text.data(), text.data() + text.size(), v);
            if (ec != std::errc() || end != text.data() + text.size())
                return bad("not an unsigned number");
            return PlistValue(v);
        }
        case ArgType::Int: {
            int64_t v = 0;
            auto [end, ec] = std::from_chars(text.data(), text.data() + text.size(), v);
            if (ec != std::errc() || end != text.data() + text.size()) return bad("not a number");
            return PlistValue(v);
        }
        case ArgType::Uuid: {
            auto u = tarn::Uuid::parse(text);
            if (!u) return bad("not a UUID");
            return PlistValue(*u);
        }
        case ArgType::Json: {
            std::string json = text;
            if (!json.empty() && json[0] == '@') {
                std::ifstream in(json.substr(1));
                if (!in) return bad("cannot read the file");
                std::stringstream s;
                s << in.rdbuf();
                json = s.str();
            }
            std::string reason;
            auto value = JsonToPlist(json, &reason);
            if (!value) return bad(("not JSON (" + reason + ")").c_str());
            return value;
        }
    }
    return bad("unknown argument type");
}

// "ReplyPersonaUniqueString" -> "persona unique string"; upper-case runs
// (UUID) stay as they are.
std::string labelFor(const std::string& key) {
    std::string_view k = key;
    if (k.starts_with("Reply")) k.remove_prefix(5);
    auto upper = [&](size_t i) { return std::isupper(static_cast<unsigned char>(k[i])) != 0; };
    std::vector<std::string> words;
    for (size_t i = 0; i < k.size(); ++i) {
        const bool boundary =
            i > 0 && upper(i) && (!upper(i - 1) || (i + 1 < k.size() && !upper(i + 1)));
        if (words.empty() || boundary) words.emplace_back();
        words.back() += k[i];
    }
    std::string out;
    for (std::string& w : words) {
        const bool acronym = w.size() > 1 && std::all_of(w.begin(), w.end(), [](char c) {
                                 return std::isupper(static_cast<unsigned char>(c)) != 0;
                             });
        if (!acronym)
            for (char& c : w) c = static_cast<char>(std::tolower(static_cast<unsigned char>(c)));
        out += (out.empty() ? "" : " ") + w;
    }
    return out;
}

std::string cellText(const PlistValue* v) {
    if (!v) return "";
    if (const std::string* s = v->asString()) return *s;
    if (v->isBool()) return *v->asBool() ? "yes" : "no";
    if (v->isUuid()) return v->asUuid()->string();
    if (v->isInteger()) {
        if (auto u = v->asUInt64()) return std::to_string(*u);
        return std::to_string(*v->asInt64());
    }
    return PlistToJson(*v);
}

// The rows of the verb's table, or empty when the reply has none of its keys
// (or they are not the shape the table expects: then they print as values).
std::vector<std::vector<std::string>> tableRows(const VerbTable& table, const PlistValue& reply,
                                                std::vector<std::string>* used) {
    std::vector<const VerbColumn*> present;
    for (const VerbColumn& c : table.columns) {
        const PlistValue* v = reply.find(c.replyKey);
        if (!v) continue;
        if (table.kind == VerbTable::Kind::Parallel ? !v->isArray() : !v->isDict()) return {};
        present.push_back(&c);
    }
    if (present.empty()) return {};
    std::vector<std::vector<std::string>> rows(1);
    if (table.kind == VerbTable::Kind::Keyed) rows[0].push_back(table.keyHeading);
    for (const VerbColumn* c : present) rows[0].push_back(c->heading);
    if (table.kind == VerbTable::Kind::Parallel) {
        size_t n = 0;
        for (const VerbColumn* c : present)
            n = std::max(n, reply.find(c->replyKey)->asArray()->size());
        for (size_t i = 0; i < n; ++i) {
            std::vector<std::string> row;
            for (const VerbColumn* c : present) {
                const auto& a = *reply.find(c->replyKey)->asArray();
                row.push_back(i < a.size() ? cellText(&a[i]) : "");
            }
            rows.push_back(std::move(row));
        }
    } else {
        for (const auto& [key, first] : *reply.find(present[0]->replyKey)->asDict()) {
            std::vector<std::string> row{key};
            for (const VerbColumn* c : present)
                row.push_back(cellText(reply.find(c->replyKey)->find(key)));
            rows.push_back(std::move(row));
        }
    }
    for (const VerbColumn* c : present) used->push_back(c->replyKey);
    return rows;
}

struct VerbState {
    const VerbDefinition* verb = nullptr;
    std::vector<std::string> values;  // one per argument
    std::vector<CLI::Option*> options;
};

CLI::App* groupFor(CLI::App& app, std::map<std::string, CLI::App*>& groups,
                   const std::vector<std::string>& path) {
    CLI::App* parent = &app;
    std::string prefix;
    for (size_t i = 0; i + 1 < path.size(); ++i) {
        prefix += path[i] + " ";
        auto it = groups.find(prefix);
        if (it == groups.end()) {
            CLI::App* g = parent->add_subcommand(path[i], "");
            g->require_subcommand(1);
            it = groups.emplace(prefix, g).first;
        }
        parent = it->second;
    }
    return parent;
}

std::string commandsOf(const VerbDefinition& verb) {
    std::string text = std::to_string(verb.command);
    for (const VerbArg& a : verb.args)
        if (a.command) text += "; " + std::to_string(*a.command) + " with " + a.name;
    return text;
}

void runVerb(Options& options, VerbState& state) {
    std::vector<std::pair<std::string, std::string>> given;
    for (size_t i = 0; i < state.verb->args.size(); ++i) {
        if (state.options[i]->count() == 0) continue;
        given.emplace_back(state.verb->args[i].name, state.values[i]);
    }
    std::string why;
    auto request = BuildVerbRequest(*state.verb, given, &why);
    if (!request) {
        std::cerr << "tarnctl: " << why << "\n";
        options.exitCode = kExitBadInput;
        return;
    }
    auto reply = SendRequest(options, *request);
    if (!reply) return;
    options.exitCode = kExitOk;
    const PlistValue* code = reply->find("ReplyError");
    if (options.json) {
        std::cout << PlistToJson(*reply) << "\n";
    } else {
        std::cout << FormatReplyTable(*state.verb, *reply);
    }
    std::cout << std::flush;
    if (!code || !code->asUInt64()) {
        std::cerr << "tarnctl: the reply carries no \"ReplyError\"\n";
        options.exitCode = kExitNoReply;
    } else if (*code->asUInt64() != 1) {
        std::cerr << "tarnctl: " << tarn::TarnErrorSummary(*code->asUInt64()) << "\n";
        options.exitCode = kExitReplyError;
    }
}

}  // namespace

std::string FormatColumns(const std::vector<std::vector<std::string>>& rows) {
    std::string out;
    std::vector<size_t> widths;
    for (const auto& row : rows)
        for (size_t c = 0; c < row.size(); ++c) {
            if (widths.size() <= c) widths.push_back(0);
            widths[c] = std::max(widths[c], row[c].size());
        }
    for (const auto& row : rows) {
        std::string line;
        for (size_t c = 0; c < row.size(); ++c) {
            line += row[c];
            if (c + 1 < row.size()) line.append(widths[c] - row[c].size() + 2, ' ');
        }
        while (!line.empty() && line.back() == ' ') line.pop_back();
        out += line + "\n";
    }
    return out;
}

const std::vector<VerbDefinition>& VerbDefinitions() {
    static const std::vector<VerbDefinition> definitions = makeDefinitions();
    return definitions;
}

std::optional<PlistValue> BuildVerbRequest(
    const VerbDefinition& verb, const std::vector<std::pair<std::string, std::string>>& given,
    std::string* why) {
    PlistValue request{tarn::PlistDict{}};
    uint64_t command = verb.command;
    for (const auto& [key, value] : verb.fixed) request.set(key, value);
    for (const VerbArg& arg : verb.args) {
        auto it = std::find_if(given.begin(), given.end(),
                               [&](const auto& g) { return g.first == arg.name; });
        std::optional<std::string> text;
        if (it != given.end()) {
            text = it->second;
            if (arg.command) command = *arg.command;
        } else {
            text = arg.defaultValue;
        }
        if (!text || arg.key.empty()) continue;
        auto value = parseArg(arg, *text, why);
        if (!value) return std::nullopt;
        request.set(arg.key, std::move(*value));
    }
    request.set("Command", command);
    return request;
}

std::string FormatReplyTable(const VerbDefinition& verb, const PlistValue& reply) {
    std::string out;
    if (!reply.isDict()) return PlistToJson(reply) + "\n";
    std::vector<std::string> used{"ReplyError"};
    const auto rows = tableRows(verb.table, reply, &used);
    std::vector<std::vector<std::string>> pairs;
    for (const auto& [key, value] : *reply.asDict()) {
        if (std::find(used.begin(), used.end(), key) != used.end()) continue;
        if (const auto* a = value.asArray(); a && !a->empty()) {
            // A list nobody put into a table: its label, then one item per line.
            pairs.push_back({labelFor(key) + ":", ""});
            for (const PlistValue& item : *a) pairs.push_back({"", cellText(&item)});
            continue;
        }
        pairs.push_back({labelFor(key) + ":", cellText(&value)});
    }
    out += FormatColumns(pairs);
    if (!rows.empty()) {
        if (!out.empty()) out += "\n";
        out += FormatColumns(rows);
    }
    return out;
}

void SetupVerbCommands(CLI::App& app, Options& options) {
    std::map<std::string, CLI::App*> groups;
    for (const VerbDefinition& verb : VerbDefinitions()) {
        CLI::App* parent = groupFor(app, groups, verb.path);
        auto state = std::make_shared<VerbState>();
        state->verb = &verb;
        state->values.resize(verb.args.size());
        CLI::App* sub = parent->add_subcommand(verb.path.back(),
                                               verb.help + " (command " + commandsOf(verb) + ")");
        for (size_t i = 0; i < verb.args.size(); ++i) {
            const VerbArg& arg = verb.args[i];
            std::string help = arg.help;
            if (arg.defaultValue) help += " (default: " + *arg.defaultValue + ")";
            CLI::Option* opt = nullptr;
            if (arg.type == ArgType::Bool) {
                opt = sub->add_flag(arg.name)->description(help);
            } else {
                opt = sub->add_option(arg.name, state->values[i], help);
                if (arg.required) opt->required();
            }
            state->options.push_back(opt);
        }
        sub->callback([&options, state] { runVerb(options, *state); });
    }
    // Group descriptions name the verbs below them.
    for (auto& [prefix, group] : groups) {
        std::string verbs;
        for (const CLI::App* s : group->get_subcommands([](const CLI::App*) { return true; }))
            verbs += (verbs.empty() ? "" : ", ") + s->get_name();
        group->description(verbs);
    }
}

}  // namespace tarnctl
