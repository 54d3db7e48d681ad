#include "Platform/Failpoints.h"

#include <fcntl.h>
#include <signal.h>
#include <unistd.h>

#include <atomic>
#include <cassert>
#include <chrono>
#include <cstdlib>
#include <map>
#include <thread>

#include "Platform/ThreadAnnotations.h"

namespace tarn {

namespace {

struct Action {
    enum class Kind { Errno, Kill, Sleep } kind = Kind::Errno;
    int value = 0;      // errno or milliseconds
    uint64_t onHit = 0;  // 0 = every hit
    uint64_t hits = 0;
};

struct Registry {
    Mutex mu;
    std::map<std::string, Action, std::less<>> armed GUARDED_BY(mu);
    std::atomic<bool> any{false};
    // Constant after construction.
    bool gated = false;
    int traceFd = -1;
};

// Opened by SIGUSR2 in a gated process; a plain flag is all a handler may set.
std::atomic<bool> gGateOpen{false};

void openGate(int) { gGateOpen.store(true, std::memory_order_release); }

bool configure(Registry& r, std::string_view value);

Registry& registry() {
    static Registry* r = [] {
        auto* reg = new Registry;
        if (std::getenv("TARN_FAILPOINTS_GATE")) {
            reg->gated = true;
            struct sigaction sa = {};
            sa.sa_handler = openGate;
            ::sigaction(SIGUSR2, &sa, nullptr);
        }
        if (const char* trace = std::getenv("TARN_FAILPOINTS_TRACE")) {
            reg->traceFd = ::open(trace, O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0644);
            reg->any.store(reg->traceFd >= 0);
        }
        if (const char* env = std::getenv("TARN_FAILPOINTS")) {
            // A malformed variable is a mistake of the tester, not of a client.
            if (!configure(*reg, env)) (void)!::write(2, "TARN_FAILPOINTS: malformed\n", 27);
        }
        return reg;
    }();
    return *r;
}

bool parseNumber(std::string_view s, uint64_t* out) {
    if (s.empty() || s.size() > 12) return false;
    uint64_t v = 0;
    for (char c : s) {
        if (c < '0' || c > '9') return false;
        v = v * 10 + static_cast<uint64_t>(c - '0');
    }
    *out = v;
    return true;
}

bool parseAction(std::string_view actionText, Action* out) {
    Action a;
    if (auto at = actionText.find('@'); at != std::string_view::npos) {
        if (!parseNumber(actionText.substr(at + 1), &a.onHit) || a.onHit == 0) return false;
        actionText = actionText.substr(0, at);
    }
    uint64_t n = 0;
    if (actionText == "kill") {
        a.kind = Action::Kind::Kill;
    } else if (actionText.starts_with("errno:") && parseNumber(actionText.substr(6), &n) && n > 0 && n < 4096) {
        a.kind = Action::Kind::Errno;
        a.value = static_cast<int>(n);
    } else if (actionText.starts_with("sleep:") && parseNumber(actionText.substr(6), &n) && n <= 600000) {
        a.kind = Action::Kind::Sleep;
        a.value = static_cast<int>(n);
    } else {
        return false;
    }
    *out = a;
    return true;
}

void setArmed(Registry& r, std::string_view name, const Action& a) {
    MutexLock lock(r.mu);
    r.armed[std::string(name)] = a;
    r.any.store(true, std::memory_order_release);
}

}  // namespace

bool FailpointIsKnown(std::string_view name) {
    for (const char* n : kFailpointNames)
        if (name == n) return true;
    return false;
}

std::optional<int> FailpointHit(std::string_view name) {
    assert(FailpointIsKnown(name) && "failpoint missing from kFailpointNames");
    Registry& r = registry();
    if (!r.any.load(std::memory_order_acquire)) return std::nullopt;
    if (r.gated && !gGateOpen.load(std::memory_order_acquire)) return std::nullopt;
    if (r.traceFd >= 0) {
        std::string line(name);
        line += '\n';
        // One append per hit; a lost trace line only makes a sweep shorter.
        (void)!::write(r.traceFd, line.data(), line.size());
    }
    Action a;
    {
        MutexLock lock(r.mu);
        auto it = r.armed.find(name);
        if (it == r.armed.end()) return std::nullopt;
        uint64_t hit = ++it->second.hits;
        if (it->second.onHit != 0 && hit != it->second.onHit) return std::nullopt;
        a = it->second;
    }
    switch (a.kind) {
        case Action::Kind::Kill:
            ::kill(::getpid(), SIGKILL);
            ::_exit(137);  // not reached
        case Action::Kind::Sleep:
            std::this_thread::sleep_for(std::chrono::milliseconds(a.value));
            return std::nullopt;
        case Action::Kind::Errno:
            return a.value;
    }
    return std::nullopt;
}

bool FailpointSet(std::string_view name, std::string_view actionText) {
    Action a;
    if (!FailpointIsKnown(name) || !parseAction(actionText, &a)) return false;
    setArmed(registry(), name, a);
    return true;
}

void FailpointClear(std::string_view name) {
    Registry& r = registry();
    MutexLock lock(r.mu);
    if (auto it = r.armed.find(name); it != r.armed.end()) r.armed.erase(it);
    r.any.store(!r.armed.empty() || r.traceFd >= 0, std::memory_order_release);
}

void FailpointClearAll() {
    Registry& r = registry();
    MutexLock lock(r.mu);
    r.armed.clear();
    r.any.store(r.traceFd >= 0, std::memory_order_release);
}

namespace {

bool configure(Registry& r, std::string_view value) {
    // Parse everything first so a bad entry arms nothing.
    std::map<std::string, Action, std::less<>> parsed;
    while (!value.empty()) {
        auto comma = value.find(',');
        std::string_view item = value.substr(0, comma);
        value = comma == std::string_view::npos ? std::string_view{} : value.substr(comma + 1);
        if (item.empty()) continue;
        auto eq = item.find('=');
        if (eq == std::string_view::npos) return false;
        Action a;
        std::string_view name = item.substr(0, eq);
        if (!FailpointIsKnown(name) || !parseAction(item.substr(eq + 1), &a)) return false;
        parsed[std::string(name)] = a;
    }
    MutexLock lock(r.mu);
    r.armed = std::move(parsed);
    r.any.store(!r.armed.empty() || r.traceFd >= 0, std::memory_order_release);
    return true;
}

}  // namespace

bool FailpointConfigure(std::string_view value) { return configure(registry(), value); }

}  // namespace tarn
