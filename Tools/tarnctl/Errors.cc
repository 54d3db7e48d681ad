// tarnctl errors [CODE]: the daemon's error codes with their names and meanings.
#include <iostream>

#include "Platform/PropertyList.h"
#include "Platform/TarnErrorNames.h"
#include "Tools/tarnctl/Json.h"
#include "Tools/tarnctl/Subcommands.h"
#include "Tools/tarnctl/Verbs.h"

namespace tarnctl {

namespace {

tarn::PlistValue asJson(const tarn::TarnErrorName& row) {
    return tarn::PlistValue(tarn::PlistDict{{"code", tarn::PlistValue(row.code)},
                                            {"name", tarn::PlistValue(row.name)},
                                            {"label", tarn::PlistValue(row.label)},
                                            {"meaning", tarn::PlistValue(row.meaning)}});
}

}  // namespace

void SetupErrorsCommand(CLI::App& app, Options& options) {
    auto* cmd = app.add_subcommand("errors", "The daemon's error codes: code, name and meaning");
    static uint64_t code = 0;
    auto* one = cmd->add_option("CODE", code, "Only this code");
    cmd->callback([&options, one] {
        if (one->count() > 0) {
            const tarn::TarnErrorName* row = tarn::TarnErrorNameFor(code);
            if (!row) {
                std::cerr << "tarnctl: " << tarn::TarnErrorSummary(code) << "\n";
                options.exitCode = kExitBadInput;
                return;
            }
            if (options.json)
                std::cout << PlistToJson(asJson(*row)) << "\n";
            else
                std::cout << tarn::TarnErrorSummary(code) << " (" << row->name << ")\n";
            return;
        }
        tarn::PlistArray json;
        std::vector<std::vector<std::string>> rows{{"CODE", "NAME", "MEANING"}};
        for (const tarn::TarnErrorName& row : tarn::kTarnErrorNames) {
            json.push_back(asJson(row));
            rows.push_back({std::to_string(row.code), std::string(row.name),
                            std::string(row.label) + ": " + std::string(row.meaning)});
        }
        if (options.json)
            std::cout << PlistToJson(tarn::PlistValue(std::move(json))) << "\n";
        else
            std::cout << FormatColumns(rows);
    });
}

}  // namespace tarnctl
