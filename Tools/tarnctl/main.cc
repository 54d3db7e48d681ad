// tarnctl: the command-line client of tarnkeeperd.
#include <CLI/CLI.hpp>

#include "Platform/PlatformLog.h"
#include "Tools/tarnctl/Maintenance.h"
#include "Tools/tarnctl/SandboxItems.h"
#include "Tools/tarnctl/Subcommands.h"
#include "Tools/tarnctl/Verbs.h"

namespace tarnctl {
namespace {

// Every subcommand, in the order --help lists them. A self-contained verb
// file adds one line here; --help and the bash completion pick it up.
constexpr SubcommandSetup kSubcommands[] = {
    SetupSendCommand,           SetupVerbCommands,
    SetupLockCommands,          SetupWaitNotificationCommand,
    SetupSimulateRebootCommand, SetupSandboxItemsCommand,
    SetupUpcallCommand,         SetupVerifyCommand,
    SetupErrorsCommand,         SetupCompletionCommand,
};

constexpr const char* kFooter = R"(JSON mapping (both ways):
  string                 <-> string
  non-negative integer   <-> uint64
  negative integer       <-> int64
  true / false           <-> bool
  array                  <-> array
  object                 <-> dictionary
  {"$uuid": "8-4-4-4-12"} <-> uuid
  {"$int64": n}          <-> int64 that is not negative
  {"$data": "base64"}    <-> data
Fractions, exponents and null are refused.

Output: verbs print the reply as a table; --json prints it as one JSON
object, as send does. A reply with an error prints its code, name and
meaning on stderr ("55 not entitled: ..."); `tarnctl errors` lists them.

Exit codes:
  0  a reply arrived (send: whatever its "ReplyError"; verbs: success)
  1  the request is not valid JSON or cannot be sent
  2  command-line usage error
  3  the daemon cannot be reached
  4  no reply: timeout, connection closed, or a malformed reply
  5  a verb's reply carries an error code

Examples:
  tarnctl --root /tmp/scratch send '{"Command": 27}'
  tarnctl --root /tmp/scratch container create com.example.notes
  tarnctl --root /tmp/scratch --json container list --class 2
  tarnctl --root /tmp/scratch lock
  tarnctl --root /tmp/scratch wait-notification com.ostrea.tarnkeeper.cleanup-complete --timeout 5)";

}  // namespace
}  // namespace tarnctl

int main(int argc, char** argv) {
    using namespace tarnctl;
    tarn::PlatformLogSetQuiet(true);  // errors reach the user on stderr, once
    CLI::App app{"tarnctl: send requests to tarnkeeperd over Conduit and print the replies."};
    app.footer(kFooter);
    app.require_subcommand(1);
    app.fallthrough();
    Options options;
    auto* root = app.add_option("--root", options.root,
                                "Root prefix the daemon runs under; the socket is "
                                "DIR/run/com.ostrea.tarnkeeperd.socket");
    auto* socket = app.add_option("--socket", options.socket, "Path of the daemon's socket");
    root->excludes(socket);
    app.add_option("--timeout", options.timeoutSeconds, "Seconds to wait for a reply")
        ->default_val(30)
        ->check(CLI::PositiveNumber);
    app.add_flag("--json", options.json, "Print replies as JSON (the send format), not tables");
    for (SubcommandSetup setup : kSubcommands) setup(app, options);
    try {
        app.parse(argc, argv);
    } catch (const CLI::ParseError& e) {
        const int code = app.exit(e);
        return code == 0 ? kExitOk : kExitUsage;
    }
    return options.exitCode;
}
