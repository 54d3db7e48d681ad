// Start-up of tarnkeeperd on a device holding N data containers, each figure
// against its floor measured in the same run:
//
//   1. first start after a boot, from spawn to READY=1 and to the clean-up
//      notification, against a bare walk that lists the class directory and
//      reads every metadata file. Rounds alternate daemon / walk, pinned to
//      one CPU (daemon and walk inherit this thread's placement) and
//      unpinned; medians and ratios;
//   2. look-up latency (command 0, no creation) while the clean-up runs,
//      against look-ups of the same daemon once it is idle. Target: <= 3x;
//   3. resident memory of the daemon with the N containers cached (after a
//      list of the class) against an empty daemon that answered the same
//      requests. Target: < 1 KiB per container.
//
//   startup_bench [containers=10000] [rounds=3]
#include <poll.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <cstdio>
#include <cstring>
#include <fstream>
#include <thread>

#include "BenchSupport.h"
#include "Daemon/TarnContainerIdentity.h"
#include "Daemon/TarnFileManager.h"
#include "Daemon/TarnGlobalConfiguration.h"
#include "Daemon/TarnMetadata.h"
#include "Daemon/TarnUserIdentityCache.h"
#include "Platform/FirstBootMarker.h"
#include "Platform/PlatformLog.h"
#include "Platform/RootPrefix.h"

using namespace tarn;
using namespace tarn::bench;
namespace fs = std::filesystem;
namespace harness = tarn::conduit::harness;

namespace {

constexpr const char* kCleanupComplete = "com.ostrea.tarnkeeper.cleanup-complete";

double msSince(Clock::time_point t0) {
    return std::chrono::duration<double, std::milli>(Clock::now() - t0).count();
}

// N class-2 containers of the mobile user, written as the daemon writes them.
std::string populate(const std::string& root, int containers) {
    SetRootPrefix(root);
    TarnUserIdentityCache::TEST_setPersonasAreSupported(false);
    const TarnUserIdentityRef user = TarnUserIdentityCache::defaultUserIdentity();
    const std::string base =
        *TarnGlobalConfiguration::sharedInstance().containerDirectoryURLForUserIdentity(user, 2,
                                                                                        false);
    for (int i = 0; i < containers; ++i) {
        const Uuid uuid = Uuid::generate();
        const std::string dir = base + "/" + uuid.string();
        fs::create_directories(dir);
        auto identity = TarnConcreteContainerIdentity::containerIdentityWithUUID(
                            uuid, user, "com.bench.app" + std::to_string(i), 2)
                            .value();
        auto m = TarnMetadata::initWithContainerIdentity(identity, std::nullopt, dir, std::nullopt);
        if (!m->writeMetadataToDiskWithError().ok()) die("cannot write metadata in " + dir);
    }
    return base;
}

// The floor: list the directory, read every metadata file.
size_t bareWalk(const std::string& directory) {
    size_t bytes = 0;
    char buffer[4096];
    for (const auto& entry : fs::directory_iterator(directory)) {
        std::ifstream in(entry.path() / kTarnMetadataFileName, std::ios::binary);
        while (in.read(buffer, sizeof buffer) || in.gcount() > 0)
            bytes += static_cast<size_t>(in.gcount());
    }
    return bytes;
}

// The readiness socket the daemon's READY=1 arrives on.
struct NotifySocket {
    int fd = -1;
    explicit NotifySocket(const std::string& path) {
        fd = ::socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0);
        sockaddr_un addr{};
        addr.sun_family = AF_UNIX;
        std::snprintf(addr.sun_path, sizeof addr.sun_path, "%s", path.c_str());
        ::unlink(path.c_str());
        if (fd < 0 || ::bind(fd, reinterpret_cast<sockaddr*>(&addr), sizeof addr) != 0)
            die("cannot bind " + path);
        ::setenv("NOTIFY_SOCKET", path.c_str(), 1);
    }
    ~NotifySocket() { ::close(fd); }
    bool waitReady(std::chrono::milliseconds timeout) {
        char buf[256];
        for (const auto deadline = Clock::now() + timeout; Clock::now() < deadline;) {
            pollfd p{fd, POLLIN, 0};
            if (::poll(&p, 1, 100) <= 0) continue;
            const ssize_t n = ::recv(fd, buf, sizeof buf - 1, 0);
            if (n > 0 && std::string_view(buf, static_cast<size_t>(n)).find("READY=1") !=
                             std::string_view::npos)
                return true;
        }
        return false;
    }
};

bool notified(const std::string& root, const char* name) {
    std::ifstream in(root + "/run/tarnkeeper/notifications");
    std::string line;
    while (std::getline(in, line))
        if (line == name) return true;
    return false;
}

// Makes the next start the first one after a boot.
void simulateReboot(const std::string& root) {
    SetRootPrefix(root);
    (void)FirstBootMarkerRemove();
    std::error_code ec;
    fs::remove_all(root + "/run/tarnkeeper", ec);
}

PlistValue lookupRequest(int i) {
    PlistDict d;
    d["Command"] = PlistValue(uint64_t{0});
    d["Identifier"] = PlistValue("com.bench.app" + std::to_string(i));
    d["ContainerClass"] = PlistValue(uint64_t{2});
    d["CreateIfNecessary"] = PlistValue(false);
    return PlistValue(std::move(d));
}

double lookupUs(conduit::Client& client, int i) {
    const auto t0 = Clock::now();
    (void)sendOrDie(client, lookupRequest(i));
    return std::chrono::duration<double, std::micro>(Clock::now() - t0).count();
}

struct Round {
    double readyMs = 0, cleanupMs = 0, walkMs = 0;
    std::vector<double> duringUs, idleUs;
};

// One first start after a boot: READY=1, look-ups until the clean-up is
// announced, then as many idle look-ups.
Round startOnce(const std::string& root, const std::string& base, int containers) {
    Round r;
    simulateReboot(root);
    NotifySocket notify(root + "/notify.sock");
    harness::ChildProcess::Options opts;
    opts.stderrPath = root + "/daemon.err";
    std::string why;
    const auto t0 = Clock::now();
    auto daemon =
        harness::ChildProcess::spawn({TARN_BINARY_DIR "/tarnkeeperd", "--root", root}, opts, &why);
    if (!daemon) die("cannot start tarnkeeperd: " + why);
    if (!notify.waitReady(std::chrono::seconds(60))) die("no READY=1; see " + opts.stderrPath);
    r.readyMs = msSince(t0);
    auto client = conduit::Client::connect(root + "/run/com.ostrea.tarnkeeperd.socket", &why);
    if (!client) die("connect: " + why);
    // A client's first request registers it (a database write): not what
    // the clean-up costs others.
    PlistDict personas;
    personas["Command"] = PlistValue(uint64_t{32});
    (void)sendOrDie(*client, PlistValue(std::move(personas)));
    int i = 0;
    while (!notified(root, kCleanupComplete)) {
        r.duringUs.push_back(lookupUs(*client, i++ % containers));
        if (msSince(t0) > 60000) die("no clean-up notification");
    }
    r.cleanupMs = msSince(t0);
    const size_t idle = std::max<size_t>(r.duringUs.size(), 200);
    for (size_t k = 0; k < idle; ++k) r.idleUs.push_back(lookupUs(*client, i++ % containers));
    client.reset();
    daemon->terminate();
    const auto w0 = Clock::now();
    (void)bareWalk(base);
    r.walkMs = msSince(w0);
    return r;
}

double median(std::vector<double> v) { return medianUs(std::move(v)); }

void report(const char* config, const std::string& root, const std::string& base, int containers,
            int rounds) {
    std::vector<double> ready, cleanup, walk, during, idle;
    for (int k = 0; k <= rounds; ++k) {  // round 0 warms the page cache
        Round r = startOnce(root, base, containers);
        if (k == 0) continue;
        ready.push_back(r.readyMs);
        cleanup.push_back(r.cleanupMs);
        walk.push_back(r.walkMs);
        during.insert(during.end(), r.duringUs.begin(), r.duringUs.end());
        idle.insert(idle.end(), r.idleUs.begin(), r.idleUs.end());
    }
    const double w = median(walk);
    std::printf(
        "[%s] %d containers: start to READY=1 %.1f ms, to clean-up notification %.1f ms; "
        "bare walk %.1f ms; ratios %.2f / %.2f\n",
        config, containers, median(ready), median(cleanup), w, median(ready) / w,
        median(cleanup) / w);
    std::printf(
        "[%s] look-up during clean-up %.1f us (%zu samples) vs idle %.1f us: ratio %.2f "
        "(target <= 3)\n",
        config, median(during), during.size(), median(idle), median(during) / median(idle));
}

long rssKiB(pid_t pid) {
    std::ifstream in("/proc/" + std::to_string(pid) + "/status");
    std::string line;
    while (std::getline(in, line))
        if (line.rfind("VmRSS:", 0) == 0) return std::atol(line.c_str() + 6);
    return -1;
}

// Resident memory once a list of class 2 has filled the cache.
long cachedRssKiB(const std::string& root) {
    BenchDaemon d = startDaemon(root);
    for (const auto deadline = Clock::now() + std::chrono::seconds(60);
         !notified(root, kCleanupComplete) && Clock::now() < deadline;)
        std::this_thread::sleep_for(std::chrono::milliseconds(10));
    PlistDict list;
    list["Command"] = PlistValue(uint64_t{1});
    list["ContainerClass"] = PlistValue(uint64_t{2});
    (void)sendOrDie(*d.client, PlistValue(std::move(list)));
    const long kib = rssKiB(d.process->pid());
    d.client.reset();
    d.process->terminate();
    return kib;
}

}  // namespace

int main(int argc, char** argv) {
    const int containers = argc > 1 ? std::max(1, std::atoi(argv[1])) : 10000;
    const int rounds = argc > 2 ? std::max(1, std::atoi(argv[2])) : 3;
    PlatformLogSetQuiet(true);

    const std::string root = makeScratchRoot();
    const std::string empty = makeScratchRoot();
    if (root.empty() || empty.empty()) die("cannot make a scratch root");
    const std::string base = populate(root, containers);

    std::string why;
    const std::vector<int> all = harness::AllowedCpus();
    if (!harness::SetThreadCpus({all.front()}, &why))
        std::fprintf(stderr, "pinning: %s\n", why.c_str());
    report("pinned", root, base, containers, rounds);
    (void)harness::SetThreadCpus(all, &why);
    report("unpinned", root, base, containers, rounds);

    const long full = cachedRssKiB(root);
    const long bare = cachedRssKiB(empty);
    std::printf(
        "resident memory: %ld KiB with %d containers cached, %ld KiB empty: %.0f bytes per "
        "container (target < 1024)\n",
        full, containers, bare, (full - bare) * 1024.0 / containers);

    simulateReboot(root);
    simulateReboot(empty);
    std::error_code ec;
    fs::remove_all(root, ec);
    fs::remove_all(empty, ec);
    return 0;
}
