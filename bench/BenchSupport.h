// Shared by the benchmarks that drive a real tarnkeeperd: a scratch root the
// daemon can run under, with this benchmark registered as a fully entitled
// client, and the median of a set of latencies.
#pragma once

#include <stdlib.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <memory>
#include <string>
#include <vector>

#include "Platform/Conduit.h"
#include "Platform/ConduitHarness.h"
#include "Platform/PropertyList.h"

namespace tarn::bench {

using Clock = std::chrono::steady_clock;

inline std::string makeScratchRoot() {
    const char* tmp = std::getenv("TMPDIR");
    std::string tmpl = std::string(tmp && *tmp ? tmp : "/tmp") + "/tarn-bench-XXXXXX";
    if (!::mkdtemp(tmpl.data())) return {};
    namespace fs = std::filesystem;
    fs::create_directories(tmpl + "/etc/tarnkeeper/codesign");
    fs::create_directories(tmpl + "/private/var/mobile");
    fs::create_directories(tmpl + "/private/var/root");
    std::ofstream(tmpl + "/etc/passwd") << "root:x:0:0:root:/private/var/root:/bin/sh\n"
                                           "_installd:x:33:33:installd:/private/var/installd:/bin/false\n"
                                           "mobile:x:501:501:Mobile User:/private/var/mobile:/bin/sh\n";
    std::ofstream(tmpl + "/etc/group") << "wheel:x:0:\nmobile:x:501:\nsystemusers:x:1020:\n";
    PlistDict entitlements;
    entitlements["com.ostrea.private.TarnKeeper.allowed"] = PlistValue(true);
    PlistDict entry;
    entry["Executable"] = PlistValue(conduit::harness::SelfExecutablePath());
    entry["SigningIdentifier"] = PlistValue("com.ostrea.tarnkeeperd.bench");
    entry["Entitlements"] = PlistValue(std::move(entitlements));
    const auto bytes = PlistValue(std::move(entry)).toBinary();
    std::ofstream(tmpl + "/etc/tarnkeeper/codesign/bench.plist", std::ios::binary)
        .write(reinterpret_cast<const char*>(bytes.data()), static_cast<std::streamsize>(bytes.size()));
    return tmpl;
}

[[noreturn]] inline void die(const std::string& what) {
    std::fprintf(stderr, "%s\n", what.c_str());
    std::exit(1);
}

// A tarnkeeperd started on `root` and one client connected to it.
struct BenchDaemon {
    std::unique_ptr<conduit::harness::ChildProcess> process;
    std::unique_ptr<conduit::Client> client;
    std::string socket;
};

inline BenchDaemon startDaemon(const std::string& root) {
    using namespace std::chrono_literals;
    BenchDaemon d;
    std::string why;
    conduit::harness::ChildProcess::Options opts;
    opts.stdoutPath = root + "/daemon.out";
    opts.stderrPath = root + "/daemon.err";
    d.process = conduit::harness::ChildProcess::spawn(
        {TARN_BINARY_DIR "/tarnkeeperd", "--root", root}, opts, &why);
    if (!d.process) die("cannot start " TARN_BINARY_DIR "/tarnkeeperd: " + why);
    d.socket = root + "/run/com.ostrea.tarnkeeperd.socket";
    for (const auto deadline = Clock::now() + 15s; !d.client && Clock::now() < deadline;) {
        d.client = conduit::Client::connect(d.socket, &why);
        if (!d.client && d.process->wait(50ms)) die("the daemon exited; see " + opts.stderrPath);
    }
    if (!d.client) die("no daemon socket: " + why);
    return d;
}

// One request; exits on transport failure or an error reply.
inline PlistValue sendOrDie(conduit::Client& client, const PlistValue& request) {
    using namespace std::chrono_literals;
    std::string why;
    auto reply = client.sendSync(request, 10000ms, &why);
    if (!reply) die("request failed: " + why);
    const PlistValue* e = reply->find("ReplyError");
    if (e && e->asUInt64() != uint64_t{1}) die("daemon answered " + reply->description());
    return std::move(*reply);
}

inline double medianUs(std::vector<double> v) {
    if (v.empty()) return 0;
    std::sort(v.begin(), v.end());
    return v[v.size() / 2];
}

}  // namespace tarn::bench
