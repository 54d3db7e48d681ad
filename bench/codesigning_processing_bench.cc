// Code-signing processing, measured two ways in one run:
//
//  1. Command 18 through a running daemon for N applications with three
//     application groups each, against the bare SQLite upserts of the same
//     entries (the floor of bench/StoreFloor.h: same schema, same WAL and
//     fsync behaviour, one transaction per entry). Daemon and floor rounds are
//     interleaved, each round with fresh identifiers.
//  2. The gate's registration of unchanged entitlements, which every admitted
//     request runs inline, against a command-0 look-up round trip of the same
//     daemon. The registration is timed in this process, on a mapping of its
//     own: what it adds to a look-up is its own cost. Target: under 10%.
//
//   codesigning_processing_bench [applications=1000] [rounds=3]
#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <string>
#include <vector>

#include "Daemon/TarnCodeSigningMapping.h"
#include "Daemon/TarnCommandQueue.h"
#include "Daemon/TarnSQLiteDB.h"
#include "Platform/Dispatch.h"
#include "Platform/PlatformLog.h"
#include "Platform/RootPrefix.h"
#include "bench/BenchSupport.h"
#include "bench/StoreFloor.h"

using namespace tarn;
using namespace tarn::bench;
using namespace std::chrono_literals;

namespace {

std::string appIdentifier(const std::string& round, int i) {
    return "com.bench." + round + ".app" + std::to_string(i);
}

PlistDict entitlementsFor(int i) {
    PlistArray groups;
    for (int g = 0; g < 3; ++g) groups.emplace_back("group.bench." + std::to_string((i + g) % 50));
    return PlistDict{{"com.ostrea.security.application-groups", PlistValue(std::move(groups))},
                     {"application-identifier", PlistValue("app" + std::to_string(i))}};
}

PlistDict infoFor(int i) {
    return PlistDict{{TarnCodeSigningMapping::kEntitlementsKey, PlistValue(entitlementsFor(i))}};
}

PlistValue command18(const std::string& identifier, int i) {
    PlistDict options{{TarnCodeSigningMapping::kOptionDataContainerClass, PlistValue(uint64_t{2})}};
    return PlistValue(PlistDict{{"Command", PlistValue(uint64_t{18})},
                                {"Identifier", PlistValue(identifier)},
                                {"CodeSigningInfo", PlistValue(infoFor(i))},
                                {"OptionsDictionary", PlistValue(std::move(options))}});
}

double secondsSince(Clock::time_point t0) {
    return std::chrono::duration<double>(Clock::now() - t0).count();
}

// Per-entry microseconds of processing N applications through the daemon.
double daemonRound(conduit::Client& client, const std::string& round, int applications) {
    const auto t0 = Clock::now();
    for (int i = 0; i < applications; ++i) sendOrDie(client, command18(appIdentifier(round, i), i));
    return secondsSince(t0) * 1e6 / applications;
}

// Per-entry microseconds of the same upserts on bare SQLite.
double bareRound(BareStore& store, const std::string& round, int applications) {
    std::vector<std::vector<uint8_t>> blobs;
    blobs.reserve(static_cast<size_t>(applications));
    for (int i = 0; i < applications; ++i) blobs.push_back(PlistValue(infoFor(i)).toBinary());
    const auto t0 = Clock::now();
    for (int i = 0; i < applications; ++i) store.upsert(appIdentifier(round, i), blobs[i], 2);
    return secondsSince(t0) * 1e6 / applications;
}

double lookupUs(conduit::Client& client, int ops) {
    const PlistValue lookup{PlistDict{{"Command", PlistValue(uint64_t{0})},
                                      {"ContainerClass", PlistValue(uint64_t{2})},
                                      {"Identifier", PlistValue("bench.lookup")}}};
    std::vector<double> us;
    for (int i = 0; i < ops; ++i) {
        const auto t0 = Clock::now();
        sendOrDie(client, lookup);
        us.push_back(secondsSince(t0) * 1e6);
    }
    return medianUs(std::move(us));
}

// Median nanoseconds of one registration of entitlements already registered.
double registrationNs(const std::string& root, int calls) {
    SetRootPrefix(root);
    TarnCodeSigningMapping mapping(
        nullptr, DispatchQueue::createSerial("com.ostrea.TarnKeeper.EntitlementQueue"),
        TarnSQLiteDB::initWithParentDirectoryURL(root));
    TarnCommandQueue queue;
    const PlistDict entitlements = entitlementsFor(7);
    if (!mapping.processCallerRegisteredEntitlements(entitlements, "com.bench.caller", &queue).ok())
        die("the first registration failed");
    std::vector<double> ns;
    constexpr int kBatch = 1000;
    for (int b = 0; b < calls / kBatch; ++b) {
        const auto t0 = Clock::now();
        for (int i = 0; i < kBatch; ++i)
            (void)mapping.processCallerRegisteredEntitlements(entitlements, "com.bench.caller",
                                                              &queue);
        ns.push_back(secondsSince(t0) * 1e9 / kBatch);
    }
    return medianUs(std::move(ns));
}

}  // namespace

int main(int argc, char** argv) {
    const int applications = argc > 1 ? std::max(1, std::atoi(argv[1])) : 1000;
    const int rounds = argc > 2 ? std::max(1, std::atoi(argv[2])) : 3;
    PlatformLogSetQuiet(true);

    const std::string root = makeScratchRoot();
    if (root.empty()) die("cannot make a scratch root");
    BenchDaemon daemon = startDaemon(root);
    BareStore floor(root + "/floor.sqlite3");

    std::vector<double> daemonUs, bareUs;
    for (int r = 0; r < rounds; ++r) {
        // Alternate which side goes first, so that neither always meets a
        // freshly checkpointed log.
        const std::string tag = "r" + std::to_string(r);
        if (r % 2 == 0) {
            daemonUs.push_back(daemonRound(*daemon.client, tag, applications));
            bareUs.push_back(bareRound(floor, tag, applications));
        } else {
            bareUs.push_back(bareRound(floor, tag, applications));
            daemonUs.push_back(daemonRound(*daemon.client, tag, applications));
        }
        std::printf("round %d: daemon %.1f us per application | bare upserts %.1f us\n", r,
                    daemonUs.back(), bareUs.back());
    }
    const double d = medianUs(daemonUs), b = medianUs(bareUs);
    std::printf(
        "processing %d applications x 3 groups: daemon %.1f us each | bare %.1f us each | "
        "ratio %.2f\n",
        applications, d, b, b > 0 ? d / b : 0.0);

    sendOrDie(*daemon.client, PlistValue(PlistDict{{"Command", PlistValue(uint64_t{0})},
                                                   {"ContainerClass", PlistValue(uint64_t{2})},
                                                   {"Identifier", PlistValue("bench.lookup")},
                                                   {"CreateIfNecessary", PlistValue(true)}}));
    (void)lookupUs(*daemon.client, 200);  // warm up
    const double lookup = lookupUs(*daemon.client, 2000);
    const std::string own = makeScratchRoot();
    const double registration = registrationNs(own, 200000);
    std::printf(
        "gate registration of unchanged entitlements: %.0f ns | look-up %.2f us | "
        "share %.1f%% (target < 10%%)\n",
        registration, lookup, lookup > 0 ? registration / (lookup * 10) : 0.0);

    daemon.process->terminate();
    std::error_code ec;
    std::filesystem::remove_all(root, ec);
    std::filesystem::remove_all(own, ec);
    return 0;
}
