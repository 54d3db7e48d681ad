// `tarnctl container create|lookup|list|delete|empty-death-row`: the container
// commands without writing request JSON by hand. Each sends one request and
// prints the reply like `send` does.
#pragma once

#include "Tools/tarnctl/Subcommands.h"

namespace tarnctl {

void SetupContainerCommands(CLI::App& app, Options& options);

}  // namespace tarnctl
