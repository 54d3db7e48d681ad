// tarnctl container ...: shorthands for commands 0, 1, 4 and 10.
#include "Tools/tarnctl/Container.h"

#include <cstdint>
#include <iostream>
#include <memory>
#include <string>

#include "Tools/tarnctl/Json.h"

namespace tarnctl {

namespace {

struct ContainerArgs {
    std::string identifier;
    uint64_t containerClass = 2;  // application data: what one usually means
    bool transient = false;
};

void sendAndPrint(Options& options, const tarn::PlistValue& request) {
    auto reply = SendRequest(options, request);
    if (!reply) return;
    std::cout << PlistToJson(*reply) << "\n" << std::flush;
    options.exitCode = kExitOk;
}

tarn::PlistValue requestFor(uint64_t command, const ContainerArgs& args) {
    tarn::PlistValue request{tarn::PlistDict{}};
    request.set("Command", command);
    if (!args.identifier.empty()) request.set("Identifier", args.identifier);
    request.set("ContainerClass", args.containerClass);
    request.set("Transient", args.transient);
    return request;
}

CLI::App* addContainerSubcommand(CLI::App* parent, const char* name, const char* description,
                                 ContainerArgs& args, bool withIdentifier) {
    auto* sub = parent->add_subcommand(name, description);
    if (withIdentifier)
        sub->add_option("IDENTIFIER", args.identifier, "The container's identifier")->required();
    sub->add_option("--class", args.containerClass, "Container class, 1 to 13")->default_val(2);
    sub->add_flag("--transient", args.transient, "The transient container of the identity");
    return sub;
}

}  // namespace

void SetupContainerCommands(CLI::App& app, Options& options) {
    auto* group = app.add_subcommand(
        "container",
        "Create, look up, list and delete containers (commands 0, 1, 10) and empty death row "
        "(command 4). Prints the reply as `send` does.");
    group->require_subcommand(1);
    auto args = std::make_shared<ContainerArgs>();

    addContainerSubcommand(group, "create", "Create the container unless it exists (command 0)",
                           *args, true)
        ->callback([&options, args] {
            tarn::PlistValue request = requestFor(0, *args);
            request.set("CreateIfNecessary", true);
            sendAndPrint(options, request);
        });
    addContainerSubcommand(group, "lookup", "Look the container up without creating it (command 0)",
                           *args, true)
        ->callback([&options, args] { sendAndPrint(options, requestFor(0, *args)); });
    addContainerSubcommand(group, "list", "The caller's containers of a class (command 1)", *args,
                           false)
        ->callback([&options, args] { sendAndPrint(options, requestFor(1, *args)); });
    addContainerSubcommand(group, "delete", "Move the container to death row (command 10)", *args,
                           true)
        ->callback([&options, args] { sendAndPrint(options, requestFor(10, *args)); });
    group->add_subcommand("empty-death-row", "Destroy what is on death row (command 4)")
        ->callback([&options] {
            tarn::PlistValue request{tarn::PlistDict{}};
            request.set("Command", uint64_t{4});
            sendAndPrint(options, request);
        });
}

}  // namespace tarnctl
