// Container requests through a running tarnkeeperd, each against its floor
// measured in the same run:
//
//   1. look-up of an existing container (command 0, no creation) against the
//      bare SOCK_SEQPACKET echo of the same request record by another process
//      (as the daemon is one); rounds alternate back to back, pinned to one
//      CPU and unpinned; medians and ratio;
//   2. creation of containers (command 0 with "CreateIfNecessary") against the
//      same file-system work done directly: staging mkdir, metadata written
//      to a temporary file with fsync, renamed, staging directory fsynced,
//      moved into the container, standard subdirectories, rename into place.
//      Batches alternate daemon / direct. The direct side stages in the
//      daemon's own staging directory (see main) and moves into one live
//      directory of its own that grows in step with the daemon's (a large
//      directory costs the file system more per entry than a small one);
//      total times and ratio;
//   3. look-ups per second with 1, 2 and 4 concurrent clients.
//
//   container_requests_bench [CONTAINERS] [LOOKUP_ROUNDS] [lookup|create]
//
// With "lookup" or "create" only that part runs, pinned (for profiling).
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>
#include <uuid/uuid.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <string>
#include <thread>
#include <vector>

#include "Daemon/TarnError.h"
#include "Platform/Conduit.h"
#include "Platform/ConduitHarness.h"
#include "Platform/ConduitWire.h"
#include "Platform/ContainerLibrary.h"
#include "Platform/PlatformLog.h"
#include "bench/BenchSupport.h"

using namespace tarn;
using namespace tarn::conduit;
using namespace tarn::bench;
using namespace std::chrono_literals;

namespace {

constexpr uint64_t kClass = 2;  // application data: the most common container
constexpr uid_t kOwner = 501;

PlistValue request0(const std::string& identifier, bool create) {
    PlistDict d;
    d["Command"] = PlistValue(uint64_t{0});
    d["Identifier"] = PlistValue(identifier);
    d["ContainerClass"] = PlistValue(kClass);
    d["CreateIfNecessary"] = PlistValue(create);
    return PlistValue(std::move(d));
}

PlistValue send(Client& client, const PlistValue& request) { return sendOrDie(client, request); }

double since(Clock::time_point t0) {
    return std::chrono::duration<double, std::micro>(Clock::now() - t0).count();
}

// ---- 1. look-up latency ----

// CPU time of every thread of process `pid` so far, from the scheduler's
// own accounting (nanoseconds, unlike the tick counts of /proc/PID/stat).
double processCpuUs(pid_t pid) {
    double ns = 0;
    std::error_code ec;
    for (const auto& task :
         std::filesystem::directory_iterator("/proc/" + std::to_string(pid) + "/task", ec)) {
        std::ifstream in(task.path() / "schedstat");
        double runNs = 0;
        if (in >> runNs) ns += runNs;
    }
    return ns / 1000;
}

double threadCpuUs() {
    timespec ts{};
    ::clock_gettime(CLOCK_THREAD_CPUTIME_ID, &ts);
    return ts.tv_sec * 1e6 + ts.tv_nsec / 1e3;
}


void lookupLatency(const char* config, Client& daemon, pid_t daemonPid,
                   const std::vector<uint8_t>& record, int rounds, int ops) {
    std::string why;
    auto echo = harness::SeqpacketEcho::start(&why, /*otherProcess=*/true);
    if (!echo) die("echo: " + why);
    const PlistValue lookup = request0("bench.lookup", false);
    std::vector<double> echoLat, daemonLat;
    std::vector<uint8_t> back;
    // CPU per round trip on each side, to tell where a difference comes from.
    double echoServerCpu = 0, echoClientCpu = 0, daemonCpu = 0, daemonClientCpu = 0;
    for (int r = 0; r <= rounds; ++r) {  // round 0 warms up
        double server0 = processCpuUs(echo->pid()), client0 = threadCpuUs();
        for (int i = 0; i < ops; ++i) {
            const auto t0 = Clock::now();
            if (!echo->roundTrip(record, &back)) die("echo failed");
            if (r) echoLat.push_back(since(t0));
        }
        if (r) {
            echoServerCpu += processCpuUs(echo->pid()) - server0;
            echoClientCpu += threadCpuUs() - client0;
        }
        server0 = processCpuUs(daemonPid);
        client0 = threadCpuUs();
        for (int i = 0; i < ops; ++i) {
            const auto t0 = Clock::now();
            send(daemon, lookup);
            if (r) daemonLat.push_back(since(t0));
        }
        if (r) {
            daemonCpu += processCpuUs(daemonPid) - server0;
            daemonClientCpu += threadCpuUs() - client0;
        }
    }
    const double a = medianUs(echoLat), b = medianUs(daemonLat);
    const double n = static_cast<double>(rounds) * ops;
    std::printf("look-up   %-9s echo %7.2f us | daemon %7.2f us | ratio %.2f (target <= 2)\n",
                config, a, b, a > 0 ? b / a : 0.0);
    std::printf("          %-9s CPU: echo %.2f + client %.2f us | daemon %.2f + client %.2f us\n",
                config, echoServerCpu / n, echoClientCpu / n, daemonCpu / n, daemonClientCpu / n);
}

// ---- 2. creation ----

std::string newUuid() {
    uuid_t u;
    uuid_generate_random(u);
    char s[37];
    uuid_unparse_upper(u, s);
    return s;
}

void check(bool ok, const char* what) {
    if (!ok) die(std::string("direct: ") + what + ": " + std::strerror(errno));
}

void fsyncDir(const std::string& path) {
    int fd = ::open(path.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
    check(fd >= 0, "open dir");
    check(::fsync(fd) == 0, "fsync dir");
    ::close(fd);
}

// What the daemon does on disk for one new data container.
void createDirectly(const std::string& staging, const std::string& live,
                    const std::vector<uint8_t>& metadata, const std::vector<std::string>& subdirs) {
    const std::string uuid = newUuid();
    const std::string dir = staging + "/" + uuid;
    check(::mkdir(dir.c_str(), 0755) == 0, "mkdir");
    check(::chown(dir.c_str(), kOwner, kOwner) == 0, "chown");
    const std::string temp = staging + "/temp_metadata-" + newUuid() + ".plist";
    const std::string hidden = staging + "/.temp.tmp";
    int fd = ::open(hidden.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0644);
    check(fd >= 0, "open");
    check(::write(fd, metadata.data(), metadata.size()) == static_cast<ssize_t>(metadata.size()),
          "write");
    check(::fsync(fd) == 0, "fsync");
    ::close(fd);
    check(::rename(hidden.c_str(), temp.c_str()) == 0, "rename temp");
    fsyncDir(staging);
    check(::rename(temp.c_str(), (dir + "/.com.ostrea.tarn_keeper.metadata.plist").c_str()) == 0,
          "rename metadata");
    for (const auto& name : subdirs) {
        const std::string sub = dir + "/" + name;
        check(::mkdir(sub.c_str(), 0755) == 0, "mkdir sub");
        check(::chown(sub.c_str(), kOwner, kOwner) == 0, "chown sub");
    }
    check(::rename(dir.c_str(), (live + "/" + uuid).c_str()) == 0, "rename live");
}

void creation(const char* config, const std::string& staging, const std::string& live,
              Client& daemon, pid_t daemonPid, int total,
              const std::vector<uint8_t>& metadata) {
    std::vector<std::string> subdirs;
    uint64_t code = 0;
    if (!ContainerLibrarySubdirectoriesForClass(kClass, &subdirs, &code)) die("no subdirectories");
    const int batch = 100;
    double daemonUs = 0, directUs = 0, daemonCpuUs = 0, directCpuUs = 0;
    int made = 0;
    while (made < total) {
        const int n = std::min(batch, total - made);
        auto t0 = Clock::now();
        double cpu0 = processCpuUs(daemonPid);
        for (int i = 0; i < n; ++i)
            send(daemon, request0(std::string("bench.create.") + config + "." +
                                      std::to_string(made + i),
                                  true));
        daemonCpuUs += processCpuUs(daemonPid) - cpu0;
        daemonUs += since(t0);
        t0 = Clock::now();
        cpu0 = threadCpuUs();
        for (int i = 0; i < n; ++i) createDirectly(staging, live, metadata, subdirs);
        directCpuUs += threadCpuUs() - cpu0;
        directUs += since(t0);
        made += n;
    }
    std::printf("creation  %-9s %d containers: daemon %.1f us each | direct %.1f us each | ratio %.2f "
                "(target <= 1.5)\n",
                config, total, daemonUs / total, directUs / total, directUs > 0 ? daemonUs / directUs : 0.0);
    // Where the difference goes: CPU the daemon spends (every thread) against
    // CPU the direct side spends; the rest of the wall time is waiting (for
    // the disk, and for the scheduler to wake a sleeping thread).
    std::printf("          %-9s CPU: daemon %.1f us each | direct %.1f us each\n", config,
                daemonCpuUs / total, directCpuUs / total);
}

// ---- 3. throughput ----

void throughput(const std::string& socket, int clients) {
    std::atomic<bool> stop{false};
    std::atomic<uint64_t> done{0};
    std::vector<std::thread> threads;
    for (int c = 0; c < clients; ++c) {
        threads.emplace_back([&] {
            std::string why;
            auto client = Client::connect(socket, &why);
            if (!client) die("connect: " + why);
            const PlistValue lookup = request0("bench.lookup", false);
            uint64_t n = 0;
            while (!stop.load(std::memory_order_relaxed)) {
                send(*client, lookup);
                ++n;
            }
            done += n;
        });
    }
    std::this_thread::sleep_for(1500ms);
    stop = true;
    for (auto& t : threads) t.join();
    std::printf("look-ups  %d client%s: %8.0f per second\n", clients, clients == 1 ? " " : "s",
                static_cast<double>(done.load()) / 1.5);
}

}  // namespace

int main(int argc, char** argv) {
    const int containers = argc > 1 ? std::max(1, std::atoi(argv[1])) : 2000;
    const int rounds = argc > 2 ? std::max(1, std::atoi(argv[2])) : 20;
    const std::string only = argc > 3 ? argv[3] : "";
    PlatformLogSetQuiet(true);
    std::string why;

    const std::string root = makeScratchRoot();
    if (root.empty()) die("cannot make a scratch root");
    BenchDaemon started = startDaemon(root);
    auto& daemon = started.process;
    auto& client = started.client;
    const std::string& socket = started.socket;
    // The direct side writes the very bytes the daemon wrote for this one.
    const PlistValue made = send(*client, request0("bench.lookup", true));
    const PlistValue* path = made.find("ReplyPath");
    if (!path || !path->isString()) die("no ReplyPath in " + made.description());
    std::ifstream in(*path->asString() + "/.com.ostrea.tarn_keeper.metadata.plist", std::ios::binary);
    const std::vector<uint8_t> metadata((std::istreambuf_iterator<char>(in)),
                                        std::istreambuf_iterator<char>());
    if (metadata.empty()) die("cannot read the metadata of " + *path->asString());

    std::vector<uint8_t> body;
    if (!EncodeBody(request0("bench.lookup", false), &body, &why)) die(why);
    RecordHeader h;
    h.flags = kFlagRequest;
    h.messageId = 1;
    const std::vector<uint8_t> record = BuildRecords(h, body).front();

    const std::vector<int> all = harness::AllowedCpus();
    if (!harness::SetProcessCpus(::getpid(), {all.front()}, &why) ||
        !harness::SetProcessCpus(daemon->pid(), {all.front()}, &why))
        std::fprintf(stderr, "pinning: %s\n", why.c_str());
    // The direct side stages in the daemon's own staging directory and moves
    // its containers into a live directory of its own, made fresh for this
    // run and kept for both configurations, as the daemon's are. Staging in
    // the same directory matters on ext4: a new file's inode comes from its
    // parent directory's group, and finding a free one there costs more the
    // more inodes were freed in it in the last minutes (by a previous run or
    // a test suite), so both sides must draw from the same group.
    const std::string staging = root + "/private/var/mobile/Containers/Staging";
    const std::string live = root + "/direct-live";
    if (!std::filesystem::is_directory(staging)) die("no daemon staging directory at " + staging);
    std::filesystem::create_directories(live);
    const auto finish = [&] {
        client.reset();
        daemon->terminate();
        std::error_code ec;
        std::filesystem::remove_all(root, ec);
        return 0;
    };
    if (only != "create") lookupLatency("pinned", *client, daemon->pid(), record, rounds, 200);
    if (only != "lookup")
        creation("pinned", staging, live, *client, daemon->pid(), containers, metadata);
    if (!only.empty()) return finish();
    (void)harness::SetProcessCpus(::getpid(), all, &why);
    (void)harness::SetProcessCpus(daemon->pid(), all, &why);
    lookupLatency("unpinned", *client, daemon->pid(), record, rounds, 200);
    creation("unpinned", staging, live, *client, daemon->pid(), containers, metadata);
    for (int clients : {1, 2, 4}) throughput(socket, clients);
    return finish();
}
