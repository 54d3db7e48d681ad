// The kernel upcall against its floor, measured side by side in one run: one
// upcall for a process with a data container and three application groups
// (all existing) against the command-0 look-ups of the same four containers
// through the request socket. Rounds alternate (upcall, then the four
// look-ups) back to back, pinned to one CPU and unpinned; medians, upcalls
// per second and the ratio (target: at most 1, one upcall costs no more
// than the four look-ups).
//
//   upcall_bench [ROUNDS]
#include <packbuff/packbuff.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <string>
#include <vector>

#include "Platform/ConduitHarness.h"
#include "Platform/PlatformLog.h"
#include "Platform/UpcallSocket.h"
#include "bench/BenchSupport.h"

using namespace tarn;
using namespace tarn::bench;
using namespace std::chrono_literals;

namespace {

constexpr const char* kApp = "com.ostrea.bench.upcall";
const char* const kGroups[] = {"group.bench.one", "group.bench.two", "group.bench.three"};

std::vector<uint8_t> upcallRequest() {
    sb_packbuff_t* p = sb_packbuff_new(0);
    int error = sb_packbuff_pack_string(p, 0, kApp, std::strlen(kApp));
    error |= sb_packbuff_pack_uint32(p, 3, 501);
    for (const char* g : kGroups) error |= sb_packbuff_pack_string(p, 4, g, std::strlen(g));
    error |= sb_packbuff_pack_uint32(p, 5, 0);
    if (error != 0) die("cannot pack the request");
    const auto* b = static_cast<const uint8_t*>(sb_packbuff_get_bytes(p));
    std::vector<uint8_t> bytes(b, b + sb_packbuff_get_size(p));
    sb_packbuff_free(p);
    return upcall::EncodeRequestDatagram(bytes);
}

PlistValue lookup(const std::string& identifier, uint64_t containerClass) {
    PlistDict d;
    d["Command"] = PlistValue(uint64_t{0});
    d["Identifier"] = PlistValue(identifier);
    d["ContainerClass"] = PlistValue(containerClass);
    return PlistValue(std::move(d));
}

// One upcall that must be answered with every container.
void upcallOrDie(upcall::UpcallClient& client, const std::vector<uint8_t>& datagram) {
    std::string why;
    auto bytes = client.call(datagram, 10s, &why);
    if (!bytes) die("upcall failed: " + why);
    auto reply = upcall::DecodeReplyDatagram(*bytes, &why);
    if (!reply) die("upcall reply: " + why);
    // Home, data, temporary, three groups and the status: at least 8 items of 8 bytes.
    if (reply->returnCode != 0 || reply->answer.size() < 64)
        die("upcall answered " + std::to_string(reply->returnCode));
}

double since(Clock::time_point t0) {
    return std::chrono::duration<double, std::micro>(Clock::now() - t0).count();
}

void compare(const char* placement, upcall::UpcallClient& upcalls, conduit::Client& requests,
             const std::vector<uint8_t>& datagram, const std::vector<PlistValue>& lookups,
             int rounds) {
    for (int i = 0; i < 50; ++i) {  // warm both paths
        upcallOrDie(upcalls, datagram);
        for (const PlistValue& l : lookups) (void)sendOrDie(requests, l);
    }
    std::vector<double> upcallUs, lookupsUs;
    for (int i = 0; i < rounds; ++i) {
        auto t0 = Clock::now();
        upcallOrDie(upcalls, datagram);
        upcallUs.push_back(since(t0));
        t0 = Clock::now();
        for (const PlistValue& l : lookups) (void)sendOrDie(requests, l);
        lookupsUs.push_back(since(t0));
    }
    const double u = medianUs(upcallUs), l = medianUs(lookupsUs);
    std::printf("%-9s upcall %8.1f us (%7.0f/s)   4 look-ups %8.1f us (%7.0f/s)   ratio %.2f%s\n",
                placement, u, 1e6 / u, l, 1e6 / l, u / l, u <= l ? "" : "  (above target 1.00)");
}

}  // namespace

int main(int argc, char** argv) {
    const int rounds = argc > 1 ? std::max(1, std::atoi(argv[1])) : 500;
    PlatformLogSetQuiet(true);
    if (::geteuid() != 0) die("upcall_bench: needs root (only root is answered as the kernel)");
    std::string why;
    const std::string root = makeScratchRoot();
    if (root.empty()) die("cannot make a scratch root");
    BenchDaemon started = startDaemon(root);
    auto upcalls =
        upcall::UpcallClient::connect(root + "/run/com.ostrea.tarnkeeperd.upcall.socket", &why);
    if (!upcalls) die("no upcall socket: " + why);

    const std::vector<uint8_t> datagram = upcallRequest();
    upcallOrDie(*upcalls, datagram);  // makes the four containers
    std::vector<PlistValue> lookups = {lookup(kApp, 2)};
    for (const char* g : kGroups) lookups.push_back(lookup(g, 7));

    const std::vector<int> all = conduit::harness::AllowedCpus();
    const pid_t daemon = started.process->pid();
    if (!conduit::harness::SetProcessCpus(::getpid(), {all.front()}, &why) ||
        !conduit::harness::SetProcessCpus(daemon, {all.front()}, &why))
        std::fprintf(stderr, "pinning: %s\n", why.c_str());
    compare("pinned", *upcalls, *started.client, datagram, lookups, rounds);
    (void)conduit::harness::SetProcessCpus(::getpid(), all, &why);
    (void)conduit::harness::SetProcessCpus(daemon, all, &why);
    compare("unpinned", *upcalls, *started.client, datagram, lookups, rounds);

    upcalls.reset();
    started.client.reset();
    started.process->terminate();
    std::error_code ec;
    std::filesystem::remove_all(root, ec);
    return 0;
}
