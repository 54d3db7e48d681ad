#include "Platform/LockState.h"

#include <atomic>
#include <filesystem>
#include <fstream>
#include <memory>
#include <mutex>
#include <vector>

#include "Platform/Dispatch.h"
#include "Platform/FileWatcher.h"
#include "Platform/RootPrefix.h"

namespace tarn {

namespace {

std::atomic<int> gOverride{-1};

std::string statePath() { return RootPath("/run/tarnkeeper/lockstate"); }

struct Watch {
    std::mutex mu;
    std::vector<std::function<void()>> callbacks;  // guarded by mu
    std::unique_ptr<FileWatcher> watcher;          // guarded by mu
};

Watch& watch() {
    static auto* w = new Watch;
    return *w;
}

}  // namespace

int LockStateGet() {
    int o = gOverride.load();
    if (o >= 0) return o;
    std::ifstream in(statePath());
    int state = 0;
    if (!(in >> state)) return 0;  // absent or unreadable: unlocked
    return state;
}

bool LockStateDeviceIsLocked() { return LockStateGet() == 1; }

int LockStateSet(int state) {
    std::error_code ec;
    std::filesystem::create_directories(std::filesystem::path(statePath()).parent_path(), ec);
    // Write then rename so that a reader never sees an empty file.
    std::string tmp = statePath() + ".tmp";
    {
        std::ofstream out(tmp, std::ios::trunc);
        out << state << "\n";
        if (!out) return EIO;
    }
    std::filesystem::rename(tmp, statePath(), ec);
    return ec ? ec.value() : 0;
}

int LockStateRegister(std::function<void()> callback) {
    auto& w = watch();
    std::lock_guard lock(w.mu);
    w.callbacks.push_back(std::move(callback));
    if (w.watcher) return 0;
    std::string why;
    w.watcher = FileWatcher::watchDirectory(
        std::filesystem::path(statePath()).parent_path().string(),
        [](const std::string& name) {
            if (name != "lockstate") return;
            std::vector<std::function<void()>> cbs;
            {
                std::lock_guard l(watch().mu);
                cbs = watch().callbacks;
            }
            for (auto& cb : cbs) DispatchQueue::main()->async(cb);
        },
        &why);
    return w.watcher ? 0 : 1;
}

void LockStateTEST_override(int state) { gOverride.store(state); }

}  // namespace tarn
