// `tarnctl sandbox-items --uid U`: a user's kernel sandbox items as JSON.
#pragma once

#include "Tools/tarnctl/Subcommands.h"

namespace tarnctl {

void SetupSandboxItemsCommand(CLI::App& app, Options& options);

}  // namespace tarnctl
