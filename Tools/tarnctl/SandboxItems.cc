// Prints the kernel sandbox's per-user container items as the daemon last
// made them durable (DIR/run/tarnkeeper/sandbox/<uid>.plist): a table, or with
// --json one JSON array of {"identifier", "path", "personaID", "type"} objects.
#include "Tools/tarnctl/SandboxItems.h"

#include <cstring>
#include <iostream>

#include "Platform/PropertyList.h"
#include "Platform/RootPrefix.h"
#include "Platform/SandboxUserState.h"
#include "Tools/tarnctl/Json.h"
#include "Tools/tarnctl/Verbs.h"

namespace tarnctl {

void SetupSandboxItemsCommand(CLI::App& app, Options& options) {
    auto* cmd = app.add_subcommand("sandbox-items", "Print the sandbox container items of user U");
    static uint32_t uid = 0;
    cmd->add_option("--uid", uid, "User id")->required();
    cmd->callback([&options] {
        tarn::SetRootPrefix(options.root.empty() ? "/" : options.root);
        tarn::FileSandboxUserState state(tarn::FileSandboxUserState::defaultDirectory());
        tarn::PlistArray items;
        int err = state.iterateUserStateItems(
            uid, [&](uint64_t type, const tarn::SandboxUserStateItem* item) {
                if (!item) return;
                items.push_back(tarn::PlistValue(tarn::PlistDict{
                    {"type", tarn::PlistValue(type)},
                    {"identifier", tarn::PlistValue(item->identifier)},
                    {"path", tarn::PlistValue(item->path.value_or(""))},
                    {"personaID", tarn::PlistValue(uint64_t{item->personaID})},
                }));
            });
        if (err != 0) {
            std::cerr << "tarnctl: cannot read the sandbox items of user " << uid << ": "
                      << std::strerror(err) << "\n";
            options.exitCode = kExitBadInput;
            return;
        }
        if (options.json) {
            std::cout << PlistToJson(tarn::PlistValue(std::move(items))) << "\n";
            return;
        }
        std::vector<std::vector<std::string>> rows{{"TYPE", "PERSONA", "IDENTIFIER", "PATH"}};
        for (const tarn::PlistValue& item : items)
            rows.push_back({std::to_string(*item.find("type")->asUInt64()),
                            std::to_string(*item.find("personaID")->asUInt64()),
                            *item.find("identifier")->asString(), *item.find("path")->asString()});
        std::cout << FormatColumns(rows);
    });
}

}  // namespace tarnctl
