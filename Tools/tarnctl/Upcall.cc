// `tarnctl upcall`: sends one kernel upcall (the process-container query) on
// the daemon's upcall socket and prints the answer as one JSON object:
//   {"ReturnCode": N, "Items": [{"Type": T, "Value": V}, ...]}
// An item is a string or a number; a key with a string value (answer types 3
// and 102, group identifier and its path) is {"Type": T, "Key": K, "Value": V}
// with the key's type. Only a process running as root is answered as the kernel.
#include <iostream>
#include <string>
#include <variant>
#include <vector>

#include "Platform/Path.h"
#include "Platform/PropertyList.h"
#include "Platform/RootPrefix.h"
#include "Platform/UpcallQuery.h"
#include "Platform/UpcallSocket.h"
#include "Tools/tarnctl/Json.h"
#include "Tools/tarnctl/Subcommands.h"

namespace tarnctl {

namespace {

using UpcallArguments = tarn::upcall::ProcessContainersQuery;

// An answer item as JSON.
tarn::PlistValue itemJson(const tarn::upcall::AnswerItem& item) {
    tarn::PlistValue out{tarn::PlistDict{}};
    out.set("Type", uint64_t{item.type});
    if (item.key) out.set("Key", *item.key);
    if (const auto* number = std::get_if<uint32_t>(&item.value))
        out.set("Value", uint64_t{*number});
    else
        out.set("Value", std::get<std::string>(item.value));
    return out;
}

std::string upcallSocketPath(const Options& options) {
    if (!options.socket.empty())
        return tarn::PathJoin(tarn::PathParent(options.socket),
                              std::string(tarn::upcall::kUpcallServiceName) + ".socket");
    tarn::SetRootPrefix(options.root.empty() ? "/" : options.root);
    return tarn::upcall::UpcallSocketPath();
}

void runUpcall(Options& options, const UpcallArguments& arguments) {
    using tarn::upcall::QueryFailure;
    std::string why;
    QueryFailure failure = QueryFailure::kNone;
    std::optional<tarn::upcall::ProcessContainersAnswer> answer =
        tarn::upcall::QueryProcessContainers(upcallSocketPath(options), arguments,
                                             options.timeout(), &failure, &why);
    if (!answer) {
        if (failure == QueryFailure::kBadQuery) {
            std::cerr << "tarnctl: " << why << "\n";
            options.exitCode = kExitBadInput;
        } else if (failure == QueryFailure::kUnreachable) {
            std::cerr << "tarnctl: cannot reach the daemon: " << why << "\n";
            options.exitCode = kExitUnavailable;
        } else {
            std::cerr << "tarnctl: no reply: " << why << "\n";
            options.exitCode = kExitNoReply;
        }
        return;
    }
    tarn::PlistArray items;
    for (const tarn::upcall::AnswerItem& item : answer->items) items.push_back(itemJson(item));
    tarn::PlistValue out{tarn::PlistDict{}};
    out.set("ReturnCode", answer->returnCode < 0 ? tarn::PlistValue(int64_t{answer->returnCode})
                                                 : tarn::PlistValue(uint64_t(answer->returnCode)));
    out.set("Items", std::move(items));
    std::cout << PlistToJson(out) << "\n";
}

}  // namespace

void SetupUpcallCommand(CLI::App& app, Options& options) {
    auto* cmd = app.add_subcommand(
        "upcall",
        "Send one kernel upcall (process-container query) and print {\"ReturnCode\": N, "
        "\"Items\": [...]}; an item is {\"Type\", \"Value\"}, or {\"Type\", \"Key\", \"Value\"} "
        "for a group and its path (Type is the key's, 3 or 102)");
    static UpcallArguments arguments;
    cmd->add_option("--uid", arguments.uid, "User id of the process")->required();
    cmd->add_option("--persona", arguments.persona, "Kernel persona id (default: none)");
    cmd->add_option("--code-signing-id", arguments.codeSigningID, "Code-signing identifier");
    cmd->add_option("--container-id", arguments.containerID, "Data container identifier");
    cmd->add_option("--container-type", arguments.containerType, "0 application, 1 plug-in")
        ->check(CLI::Range(0, 1));
    cmd->add_option("--app-group", arguments.appGroups, "Application group (repeatable)")
        ->expected(1)
        ->multi_option_policy(CLI::MultiOptionPolicy::TakeAll);
    cmd->add_option("--system-container", arguments.systemContainer, "System container identifier");
    cmd->add_option("--system-group", arguments.systemGroups, "System group (repeatable)")
        ->expected(1)
        ->multi_option_policy(CLI::MultiOptionPolicy::TakeAll);
    cmd->callback([&options] { runUpcall(options, arguments); });
}

}  // namespace tarnctl
