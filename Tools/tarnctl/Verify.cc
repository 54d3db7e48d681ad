// tarnctl verify: checks the container tree of a stopped daemon the way an
// fsck would and prints every finding with its path. Exit 0 when no
// violation was found, 1 when one was, 3 when the daemon is running on the
// root (a tree under change cannot be checked).
#include <iostream>

#include "Daemon/TarnConsistencyChecker.h"
#include "Platform/Conduit.h"
#include "Platform/RootPrefix.h"
#include "Tools/tarnctl/Subcommands.h"

namespace tarnctl {

void SetupVerifyCommand(CLI::App& app, Options& options) {
    auto* cmd = app.add_subcommand(
        "verify", "Check the container tree of a stopped daemon; exit 1 on any violation");
    static bool strict = false;
    static bool quiet = false;
    cmd->add_flag("--strict", strict,
                  "Count directories without metadata as violations, not as orphans");
    cmd->add_flag("--quiet", quiet, "Print violations only");
    cmd->callback([&options] {
        tarn::SetRootPrefix(options.root.empty() ? "/" : options.root);
        if (tarn::conduit::Client::connect(options.socketPath(), nullptr)) {
            std::cerr << "tarnctl: tarnkeeperd is running on this root; stop it before verify\n";
            options.exitCode = kExitUnavailable;
            return;
        }
        const tarn::TarnConsistencyReport report =
            tarn::TarnCheckContainerTree({.orphansAreViolations = strict});
        for (const auto& v : report.violations)
            std::cout << "violation: " << v.path << ": " << v.problem << "\n";
        if (!quiet)
            for (const auto& n : report.notes)
                std::cout << "note: " << n.path << ": " << n.problem << "\n";
        std::cout << report.containersSeen << " containers, " << report.violations.size()
                  << " violations, " << report.notes.size() << " notes\n";
        options.exitCode = report.clean() ? kExitOk : kExitBadInput;
    });
}

}  // namespace tarnctl
