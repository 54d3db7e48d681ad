// tarnctl send JSON: one request, the reply printed as one JSON object.
#include <iostream>
#include <iterator>
#include <memory>

#include "Platform/ConduitWire.h"
#include "Platform/TarnErrorNames.h"
#include "Tools/tarnctl/Json.h"
#include "Tools/tarnctl/Subcommands.h"

namespace tarnctl {

namespace {

void runSend(Options& options, const std::string& jsonArgument) {
    std::string json = jsonArgument;
    if (json == "-") json.assign(std::istreambuf_iterator<char>(std::cin), {});
    std::string why;
    auto request = JsonToPlist(json, &why);
    if (!request) {
        std::cerr << "tarnctl: invalid JSON request: " << why << "\n";
        options.exitCode = kExitBadInput;
        return;
    }
    if (!request->isDict()) {
        std::cerr << "tarnctl: the request must be a JSON object\n";
        options.exitCode = kExitBadInput;
        return;
    }
    // Refuse here what the wire cannot carry, so the message names the cause.
    std::vector<uint8_t> encoded;
    if (!tarn::conduit::EncodeBody(*request, &encoded, &why)) {
        std::cerr << "tarnctl: the request cannot be sent: " << why << "\n";
        options.exitCode = kExitBadInput;
        return;
    }
    auto reply = SendRequest(options, *request);
    if (!reply) return;
    std::cout << PlistToJson(*reply) << "\n" << std::flush;
    options.exitCode = kExitOk;
    // stdout stays the reply alone; the code's name goes where people look.
    if (const auto* code = reply->find("ReplyError"); code && code->asUInt64() != 1u)
        if (auto n = code->asUInt64())
            std::cerr << "tarnctl: " << tarn::TarnErrorSummary(*n) << "\n";
}

}  // namespace

void SetupSendCommand(CLI::App& app, Options& options) {
    auto* sub = app.add_subcommand(
        "send",
        "Send one request dictionary and print the reply as one JSON object on stdout. "
        "Exits 0 whenever a reply arrived, whatever its \"ReplyError\".");
    auto json = std::make_shared<std::string>();
    sub->add_option("JSON", *json, "The request as a JSON object, or - to read it from stdin")
        ->required();
    sub->callback([&options, json] { runSend(options, *json); });
}

}  // namespace tarnctl
