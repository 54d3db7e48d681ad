// Host-state subcommands of tarnctl (lock state, notifications, reboot).
#pragma once

#include "Tools/tarnctl/Subcommands.h"

namespace tarnctl {

void SetupLockCommands(CLI::App& app, Options& options);
void SetupWaitNotificationCommand(CLI::App& app, Options& options);
void SetupSimulateRebootCommand(CLI::App& app, Options& options);

}  // namespace tarnctl
