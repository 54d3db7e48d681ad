// Container requests through a running tarnkeeperd, each against its floor
// measured in the same run:
//
//   1. look-up of an existing container (command 0, no creation) against the
//      bare SOCK_SEQPACKET echo of the same request record by another process
//      (as the daemon is one), and against the peer a Linux system service
//      would be: a D-Bus method call through a private dbus-daemon to another
//      process (sd-bus on both sides) that takes and returns the five values
//      of a look-up reply; rounds alternate back to back, pinned to one CPU
//      and unpinned; medians and ratios;
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
// Without dbus-daemon the D-Bus column is left out with a note.
#include <fcntl.h>
#include <sys/stat.h>
#include <systemd/sd-bus.h>
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

// ---- the D-Bus peer ----

constexpr const char* kPeerName = "com.ostrea.tarnkeeperd.BenchPeer";
constexpr const char* kPeerPath = "/com/ostrea/tarnkeeperd/BenchPeer";
constexpr const char* kPeerInterface = "com.ostrea.tarnkeeperd.BenchPeer";
// ReplyError, ReplyExisted, ReplyIdentifier, ReplyPath, ReplyUUID.
constexpr const char* kLookupSignature = "tbssay";

// A client connection to the bus at `address`, or null.
sd_bus* openBus(const std::string& address) {
    sd_bus* bus = nullptr;
    if (sd_bus_new(&bus) < 0) return nullptr;
    if (sd_bus_set_address(bus, address.c_str()) < 0 || sd_bus_set_bus_client(bus, 1) < 0 ||
        sd_bus_start(bus) < 0)
        return sd_bus_unref(bus);
    return bus;
}

// The five values of a look-up reply, as they travel in a D-Bus message
// (pointers into the message they were read from).
struct LookupValues {
    uint64_t error = 1;
    int existed = 1;
    const char* identifier = "";
    const char* path = "";
    const void* uuid = nullptr;
    size_t uuidSize = 0;

    int read(sd_bus_message* m) {
        int r = sd_bus_message_read(m, "tbss", &error, &existed, &identifier, &path);
        return r < 0 ? r : sd_bus_message_read_array(m, 'y', &uuid, &uuidSize);
    }
    int append(sd_bus_message* m) const {
        int r = sd_bus_message_append(m, "tbss", error, existed, identifier, path);
        return r < 0 ? r : sd_bus_message_append_array(m, 'y', uuid, uuidSize);
    }
};

int onPeerLookup(sd_bus_message* m, void*, sd_bus_error*) {
    LookupValues values;
    int r = values.read(m);
    if (r < 0) return r;
    sd_bus_message* reply = nullptr;
    r = sd_bus_message_new_method_return(m, &reply);
    if (r >= 0) r = values.append(reply);
    if (r >= 0) r = sd_bus_send(nullptr, reply, nullptr);
    sd_bus_message_unref(reply);
    return r < 0 ? r : 1;
}

const sd_bus_vtable kPeerVtable[] = {
    SD_BUS_VTABLE_START(0),
    SD_BUS_METHOD("Lookup", kLookupSignature, kLookupSignature, onPeerLookup, 0),
    SD_BUS_VTABLE_END,
};

// The peer process: serves Lookup until the bus goes away.
int runDBusPeer(const std::string& address) {
    sd_bus* bus = openBus(address);
    if (!bus) die("D-Bus peer: cannot connect to " + address);
    if (sd_bus_add_object_vtable(bus, nullptr, kPeerPath, kPeerInterface, kPeerVtable, nullptr) <
            0 ||
        sd_bus_request_name(bus, kPeerName, 0) < 0)
        die("D-Bus peer: cannot register");
    for (;;) {
        int r = sd_bus_process(bus, nullptr);
        if (r < 0) break;
        if (r > 0) continue;
        if (sd_bus_wait(bus, UINT64_MAX) < 0) break;
    }
    sd_bus_flush_close_unref(bus);
    return 0;
}

// A private dbus-daemon in the scratch root and the peer process on it.
struct DBusPeer {
    std::unique_ptr<harness::ChildProcess> busDaemon;
    std::unique_ptr<harness::ChildProcess> peer;
    sd_bus* bus = nullptr;
    std::string identifier = "bench.lookup";
    std::string path;
    Uuid uuid;

    ~DBusPeer() {
        if (bus) sd_bus_flush_close_unref(bus);
        if (peer) peer->terminate();
        if (busDaemon) busDaemon->terminate();
    }

    void call() {
        sd_bus_message* m = nullptr;
        sd_bus_message* reply = nullptr;
        sd_bus_error error = SD_BUS_ERROR_NULL;
        int r =
            sd_bus_message_new_method_call(bus, &m, kPeerName, kPeerPath, kPeerInterface, "Lookup");
        const LookupValues sent{.identifier = identifier.c_str(),
                                .path = path.c_str(),
                                .uuid = uuid.bytes.data(),
                                .uuidSize = uuid.bytes.size()};
        if (r >= 0) r = sent.append(m);
        if (r >= 0) r = sd_bus_call(bus, m, 10 * 1000 * 1000, &error, &reply);
        // Read the reply as a client would: all five values.
        LookupValues got;
        if (r >= 0) r = got.read(reply);
        if (r < 0 || got.uuidSize != 16)
            die(std::string("D-Bus call failed: ") +
                (error.message ? error.message : std::strerror(-r)));
        sd_bus_error_free(&error);
        sd_bus_message_unref(reply);
        sd_bus_message_unref(m);
    }
};

std::unique_ptr<DBusPeer> startDBusPeer(const std::string& root, const PlistValue& lookupReply) {
    const char* busBinary = "/usr/bin/dbus-daemon";
    if (::access(busBinary, X_OK) != 0) {
        std::printf("D-Bus peer: skipped, %s is missing (scripts/install-deps)\n", busBinary);
        return nullptr;
    }
    auto peer = std::make_unique<DBusPeer>();
    const std::string socket = root + "/dbus.socket";
    const std::string config = root + "/dbus.conf";
    std::ofstream(config)
        << "<!DOCTYPE busconfig PUBLIC \"-//freedesktop//DTD D-Bus Bus Configuration 1.0//EN\"\n"
           " \"http://www.freedesktop.org/standards/dbus/1.0/busconfig.dtd\">\n"
           "<busconfig><type>session</type><listen>unix:path="
        << socket
        << "</listen><auth>EXTERNAL</auth><policy context=\"default\">"
           "<allow user=\"*\"/><allow own=\"*\"/><allow send_destination=\"*\"/>"
           "<allow receive_sender=\"*\"/></policy></busconfig>\n";
    std::string why;
    harness::ChildProcess::Options opts;
    opts.stderrPath = root + "/dbus-daemon.err";
    peer->busDaemon = harness::ChildProcess::spawn(
        {busBinary, "--nofork", "--nopidfile", "--config-file=" + config}, opts, &why);
    // A failure here leaves the D-Bus column out; the destructor stops what started.
    const auto giveUp = [&](const std::string& what) -> std::unique_ptr<DBusPeer> {
        std::printf("D-Bus peer: skipped, %s\n", what.c_str());
        return nullptr;
    };
    if (!peer->busDaemon) return giveUp("cannot start dbus-daemon: " + why);
    const std::string address = "unix:path=" + socket;
    for (const auto deadline = Clock::now() + 10s; !std::filesystem::exists(socket);) {
        if (Clock::now() > deadline)
            return giveUp("dbus-daemon made no socket; see " + opts.stderrPath);
        std::this_thread::sleep_for(5ms);
    }
    opts.stderrPath = root + "/dbus-peer.err";
    peer->peer = harness::ChildProcess::spawn(
        {harness::SelfExecutablePath(), "--dbus-peer", address}, opts, &why);
    if (!peer->peer) return giveUp("cannot start the D-Bus peer: " + why);
    peer->bus = openBus(address);
    if (!peer->bus) return giveUp("cannot connect to the private bus at " + address);
    for (const auto deadline = Clock::now() + 10s;;) {
        if (sd_bus_get_name_creds(peer->bus, kPeerName, 0, nullptr) >= 0) break;
        if (Clock::now() > deadline)
            return giveUp("the D-Bus peer never took its name; see " + opts.stderrPath);
        std::this_thread::sleep_for(5ms);
    }
    // The same values the daemon answers, so both carry the same bytes.
    if (const PlistValue* p = lookupReply.find("ReplyPath"); p && p->isString())
        peer->path = *p->asString();
    if (const PlistValue* u = lookupReply.find("ReplyUUID"); u && u->asUuid())
        peer->uuid = *u->asUuid();
    return peer;
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
                   const std::vector<uint8_t>& record, int rounds, int ops, DBusPeer* dbus) {
    std::string why;
    auto echo = harness::SeqpacketEcho::start(&why, /*otherProcess=*/true);
    if (!echo) die("echo: " + why);
    const PlistValue lookup = request0("bench.lookup", false);
    std::vector<double> echoLat, daemonLat, dbusLat;
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
        for (int i = 0; dbus && i < ops; ++i) {
            const auto t0 = Clock::now();
            dbus->call();
            if (r) dbusLat.push_back(since(t0));
        }
    }
    const double a = medianUs(echoLat), b = medianUs(daemonLat);
    const double n = static_cast<double>(rounds) * ops;
    std::printf("look-up   %-9s echo %7.2f us | daemon %7.2f us | ratio %.2f (target <= 2)\n",
                config, a, b, a > 0 ? b / a : 0.0);
    std::printf("          %-9s CPU: echo %.2f + client %.2f us | daemon %.2f + client %.2f us\n",
                config, echoServerCpu / n, echoClientCpu / n, daemonCpu / n, daemonClientCpu / n);
    if (dbus) {
        const double d = medianUs(dbusLat);
        std::printf("          %-9s D-Bus call %7.2f us | look-up / D-Bus %.2f (target <= 0.33)\n",
                    config, d, d > 0 ? b / d : 0.0);
    }
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
    if (argc == 3 && std::string(argv[1]) == "--dbus-peer") return runDBusPeer(argv[2]);
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

    std::unique_ptr<DBusPeer> dbus;
    if (only != "create")
        dbus = startDBusPeer(root, send(*client, request0("bench.lookup", false)));
    // Every process on the road of a request shares the pinned CPU.
    std::vector<pid_t> pids = {::getpid(), daemon->pid()};
    if (dbus) pids.insert(pids.end(), {dbus->busDaemon->pid(), dbus->peer->pid()});
    const std::vector<int> all = harness::AllowedCpus();
    for (pid_t pid : pids)
        if (!harness::SetProcessCpus(pid, {all.front()}, &why))
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
        dbus.reset();
        client.reset();
        daemon->terminate();
        std::error_code ec;
        std::filesystem::remove_all(root, ec);
        return 0;
    };
    if (only != "create")
        lookupLatency("pinned", *client, daemon->pid(), record, rounds, 200, dbus.get());
    if (only != "lookup")
        creation("pinned", staging, live, *client, daemon->pid(), containers, metadata);
    if (!only.empty()) return finish();
    for (pid_t pid : pids) (void)harness::SetProcessCpus(pid, all, &why);
    lookupLatency("unpinned", *client, daemon->pid(), record, rounds, 200, dbus.get());
    creation("unpinned", staging, live, *client, daemon->pid(), containers, metadata);
    for (int clients : {1, 2, 4}) throughput(socket, clients);
    return finish();
}
