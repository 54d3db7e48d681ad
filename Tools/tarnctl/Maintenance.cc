// tarnctl subcommands that act on the daemon's host state rather than send a
// request: lock, unlock, wait-notification, simulate-reboot.
#include <chrono>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <iostream>
#include <thread>

#include "Platform/Conduit.h"
#include "Platform/FirstBootMarker.h"
#include "Platform/LockState.h"
#include "Platform/RootPrefix.h"
#include "Tools/tarnctl/Maintenance.h"

namespace tarnctl {

namespace {

void useRoot(const Options& options) { tarn::SetRootPrefix(options.root.empty() ? "/" : options.root); }

void setLockState(Options& options, int state) {
    useRoot(options);
    if (int err = tarn::LockStateSet(state); err != 0) {
        std::cerr << "tarnctl: cannot write " << tarn::RootPath("/run/tarnkeeper/lockstate") << ": "
                  << std::strerror(err) << "\n";
        options.exitCode = kExitBadInput;
    }
}

bool notificationPosted(const std::string& file, const std::string& name, size_t skipBytes) {
    std::ifstream in(file);
    if (!in) return false;
    in.seekg(static_cast<std::streamoff>(skipBytes));
    std::string line;
    while (std::getline(in, line))
        if (line == name) return true;
    return false;
}

}  // namespace

void SetupLockCommands(CLI::App& app, Options& options) {
    app.add_subcommand("lock", "Report the device locked (writes DIR/run/tarnkeeper/lockstate)")
        ->callback([&options] { setLockState(options, 1); });
    app.add_subcommand("unlock", "Report the device unlocked")
        ->callback([&options] { setLockState(options, 0); });
}

void SetupWaitNotificationCommand(CLI::App& app, Options& options) {
    auto* cmd = app.add_subcommand(
        "wait-notification",
        "Wait until the daemon posts NAME (already posted counts, unless --new). Exit 0 when "
        "posted, 4 on timeout.");
    static std::string name;
    static double seconds = 30;
    static bool onlyNew = false;
    cmd->add_option("NAME", name, "Notification name")->required();
    cmd->add_option("--timeout", seconds, "Seconds to wait")->check(CLI::NonNegativeNumber);
    cmd->add_flag("--new", onlyNew, "Only count posts made after tarnctl started");
    cmd->callback([&options] {
        useRoot(options);
        std::string file = tarn::RootPath("/run/tarnkeeper/notifications");
        std::error_code ec;
        size_t skip = onlyNew ? static_cast<size_t>(std::filesystem::file_size(file, ec)) : 0;
        if (ec) skip = 0;
        auto deadline = std::chrono::steady_clock::now() +
                        std::chrono::milliseconds(static_cast<int64_t>(seconds * 1000));
        for (;;) {
            if (notificationPosted(file, name, skip)) return;
            if (std::chrono::steady_clock::now() >= deadline) {
                std::cerr << "tarnctl: no notification " << name << " within " << seconds << " s\n";
                options.exitCode = kExitNoReply;
                return;
            }
            std::this_thread::sleep_for(std::chrono::milliseconds(20));
        }
    });
}

void SetupSimulateRebootCommand(CLI::App& app, Options& options) {
    app.add_subcommand("simulate-reboot",
                       "With the daemon stopped: remove the first-boot marker and DIR/run, so the "
                       "next launch does its first-boot work")
        ->callback([&options] {
            useRoot(options);
            std::string why;
            if (tarn::conduit::Client::connect(options.socketPath(), &why)) {
                std::cerr << "tarnctl: the daemon is running; stop it first\n";
                options.exitCode = kExitBadInput;
                return;
            }
            if (int err = tarn::FirstBootMarkerRemove(); err != 0) {
                std::cerr << "tarnctl: cannot remove the first-boot marker: " << std::strerror(err)
                          << "\n";
                options.exitCode = kExitBadInput;
                return;
            }
            std::error_code ec;
            std::filesystem::remove_all(tarn::RootPath("/run"), ec);
            if (ec) {
                std::cerr << "tarnctl: cannot remove " << tarn::RootPath("/run") << ": "
                          << ec.message() << "\n";
                options.exitCode = kExitBadInput;
            }
        });
}

}  // namespace tarnctl
