// Code-signing store: upsert N entries with ~1 KB of code-signing info each,
// then read every one back by identifier. The floor is bare SQLite doing the
// same statements on a database opened with the same initialisation (so the
// same WAL mode, locking mode and fsync behaviour). Store and floor runs are
// interleaved so that both see the same machine load.
//
//   codesigning_bench [entries=10000] [rounds=3]
#include <sqlite3.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <functional>
#include <random>
#include <string>
#include <vector>

#include "Daemon/TarnSQLiteDB.h"
#include "Platform/PlatformLog.h"
#include "bench/StoreFloor.h"

namespace fs = std::filesystem;
using Clock = std::chrono::steady_clock;

namespace {

struct Result {
    double upsertOps = 0;
    double readOps = 0;
};

std::string identifier(size_t i) { return "com.bench.app" + std::to_string(i); }

tarn::PlistDict infoFor(size_t i) {
    std::string payload(900, 'x');
    for (size_t k = 0; k < payload.size(); ++k) payload[k] = static_cast<char>('a' + (i + k * 7) % 26);
    return tarn::PlistDict{
        {tarn::kTarnEntitlementsKey,
         tarn::PlistDict{{"com.ostrea.security.application-groups", tarn::PlistArray{"group.bench." + std::to_string(i % 17)}},
                         {"application-identifier", identifier(i)}}},
        {"Payload", payload},
    };
}

double opsPerSecond(size_t n, Clock::duration d) {
    return static_cast<double>(n) / std::chrono::duration<double>(d).count();
}

Result runStore(const fs::path& path, const std::vector<tarn::TarnCodeSigningEntryRef>& entries) {
    Result r;
    tarn::TarnSQLiteDB db(path.string());
    auto start = Clock::now();
    for (size_t i = 0; i < entries.size(); ++i) {
        tarn::TarnStatus stored = db.addCodeSigningEntry(entries[i], identifier(i));
        if (!stored.ok()) {
            std::fprintf(stderr, "store failed: %s\n", stored.error()->description().c_str());
            std::exit(1);
        }
    }
    r.upsertOps = opsPerSecond(entries.size(), Clock::now() - start);
    start = Clock::now();
    for (size_t i = 0; i < entries.size(); ++i) {
        tarn::TarnResult<tarn::TarnCodeSigningEntryRef> read =
            db.codeSigningEntryWithIdentifier(identifier(i));
        if (!read.ok()) {
            std::fprintf(stderr, "read failed: %s\n", read.error()->description().c_str());
            std::exit(1);
        }
    }
    r.readOps = opsPerSecond(entries.size(), Clock::now() - start);
    return r;
}

Result runBare(const fs::path& path, const std::vector<std::vector<uint8_t>>& blobs) {
    Result r;
    tarn::bench::BareStore db(path.string());
    auto start = Clock::now();
    for (size_t i = 0; i < blobs.size(); ++i) db.upsert(identifier(i), blobs[i], 2);
    r.upsertOps = opsPerSecond(blobs.size(), Clock::now() - start);
    start = Clock::now();
    size_t bytes = 0;
    for (size_t i = 0; i < blobs.size(); ++i) {
        const std::string id = identifier(i);
        auto bindId = [&](sqlite3_stmt* st) { sqlite3_bind_text(st, 1, id.c_str(), -1, SQLITE_TRANSIENT); };
        db.runStep(
            "SELECT code_signing_data.data, code_signing_info.invalid, "
            "code_signing_info.placeholder, "
            "code_signing_info.registered_by_caller, code_signing_info.data_container_class FROM "
            "code_signing_info, "
            "code_signing_data WHERE code_signing_info.id = code_signing_data.cs_info_id AND "
            "code_signing_info.code_signing_id_text = ?;",
            bindId, false,
            [&](sqlite3_stmt* st) { bytes += static_cast<size_t>(sqlite3_column_bytes(st, 0)); });
        db.runStep(
            "SELECT child_bundles.child_code_signing_id_text FROM child_bundles, code_signing_info "
            "WHERE "
            "code_signing_info.code_signing_id_text = ? AND "
            "child_bundles.parent_id=code_signing_info.id;",
            bindId, true);
    }
    r.readOps = opsPerSecond(blobs.size(), Clock::now() - start);
    if (bytes == 0) std::exit(1);
    return r;
}

double median(std::vector<double> v) {
    std::sort(v.begin(), v.end());
    return v[v.size() / 2];
}

}  // namespace

int main(int argc, char** argv) {
    const size_t n = argc > 1 ? std::strtoull(argv[1], nullptr, 10) : 10000;
    const int rounds = argc > 2 ? std::atoi(argv[2]) : 3;
    tarn::PlatformLogSetQuiet(true);

    std::vector<tarn::TarnCodeSigningEntryRef> entries;
    std::vector<std::vector<uint8_t>> blobs;
    for (size_t i = 0; i < n; ++i) {
        auto e = std::make_shared<tarn::TarnCodeSigningEntry>(infoFor(i), 2);
        blobs.push_back(tarn::PlistValue(*e->codeSigningInfo()).toBinary());
        entries.push_back(std::move(e));
    }
    size_t avg = 0;
    for (auto& b : blobs) avg += b.size();
    std::printf("entries=%zu rounds=%d info blob=%zu bytes on average\n", n, rounds, n ? avg / n : 0);

    std::mt19937 rng(std::random_device{}());
    const fs::path dir = fs::temp_directory_path() / ("tarn-cs-bench-" + std::to_string(rng()));
    fs::create_directories(dir);
    std::vector<double> su, sr, bu, br;
    for (int round = 0; round < rounds; ++round) {
        // Alternate which goes first so neither always gets the warmer cache.
        for (int k = 0; k < 2; ++k) {
            const bool storeTurn = (round + k) % 2 == 0;
            const fs::path path = dir / (std::string(storeTurn ? "store" : "bare") + std::to_string(round) + ".sqlite3");
            Result r = storeTurn ? runStore(path, entries) : runBare(path, blobs);
            (storeTurn ? su : bu).push_back(r.upsertOps);
            (storeTurn ? sr : br).push_back(r.readOps);
            std::printf("round %d %-5s upsert %9.0f ops/s  read %9.0f ops/s\n", round, storeTurn ? "store" : "bare",
                        r.upsertOps, r.readOps);
            fs::remove(path);
        }
    }
    fs::remove_all(dir);
    std::printf("median upsert: store %.0f ops/s, bare %.0f ops/s, store/bare %.2f\n", median(su), median(bu),
                median(su) / median(bu));
    std::printf("median read:   store %.0f ops/s, bare %.0f ops/s, store/bare %.2f\n", median(sr), median(br),
                median(sr) / median(br));
    return 0;
}
