// Cost of an identifier read lock + unlock through gTarnLocks, against a bare
// pthread_rwlock read lock + unlock measured in the same run, rounds
// interleaved so that both see the same machine load:
//   1. uncontended: one thread, one identifier;
//   2. two threads, each on its own identifier (they share only the manager's
//      mutex and the platform log); the floor is two threads on two rwlocks.
// Prints ns per lock+unlock pair (median of the rounds) and the ratios, and how
// much of the cost is the two signpost intervals every lock + unlock logs (the
// platform log is silenced, so that is formatting and the log's mutex).
#include <benchmark/benchmark.h>
#include <pthread.h>

#include <algorithm>
#include <array>
#include <atomic>
#include <chrono>
#include <cstdio>
#include <string>
#include <thread>
#include <vector>

#include "Daemon/TarnLocks.h"
#include "Platform/PlatformLog.h"

namespace {

using Clock = std::chrono::steady_clock;

constexpr int kRounds = 15;
constexpr int kIterations = 20000;

const std::array<std::string, 2> kIdentifiers = {"6A1F4C3E-0000-4000-8000-000000000001",
                                                 "6A1F4C3E-0000-4000-8000-000000000002"};
// One cache line each, like two separately allocated lock records.
struct alignas(64) BareLock {
    pthread_rwlock_t lock = PTHREAD_RWLOCK_INITIALIZER;
};
BareLock gBare[2];

void ManagerPairs(int slot) {
    for (int i = 0; i < kIterations; ++i) {
        tarn::gTarnLocks.read_lock_identifier(kIdentifiers[slot]);
        tarn::gTarnLocks.unlock_identifier(kIdentifiers[slot]);
    }
}

void BarePairs(int slot) {
    for (int i = 0; i < kIterations; ++i) {
        pthread_rwlock_rdlock(&gBare[slot].lock);
        benchmark::ClobberMemory();
        pthread_rwlock_unlock(&gBare[slot].lock);
    }
}

// What a read lock + unlock must log whatever the manager does: the waiting
// interval and the held interval.
void SignpostPairs(int slot) {
    for (int i = 0; i < kIterations; ++i) {
        tarn::SignpostInterval waiting("locking", "WaitingForReadLockWithIdentifier",
                                       {{"uuid", kIdentifiers[slot]}});
        waiting.end();
        tarn::SignpostInterval held("locking", "ReadLockWithIdentifier",
                                    {{"uuid", kIdentifiers[slot]}});
        held.end();
    }
}

// ns per pair for `threads` threads running `body` on their own slots at once.
double Measure(void (*body)(int), int threads) {
    std::atomic<int> ready{0};
    std::atomic<bool> go{false};
    std::vector<std::thread> workers;
    for (int t = 0; t < threads; ++t) {
        workers.emplace_back([&, t] {
            ready.fetch_add(1);
            while (!go.load()) std::this_thread::yield();
            body(t);
        });
    }
    while (ready.load() != threads) std::this_thread::yield();
    const auto start = Clock::now();
    go.store(true);
    for (auto& worker : workers) worker.join();
    const auto elapsed = std::chrono::duration<double, std::nano>(Clock::now() - start).count();
    return elapsed / kIterations;  // each thread did kIterations; wall time per pair per thread
}

double Median(std::vector<double> values) {
    std::sort(values.begin(), values.end());
    return values[values.size() / 2];
}

void Compare(const char* name, int threads) {
    std::vector<double> manager, bare, signposts;
    for (int round = 0; round < kRounds; ++round) {
        // Rotate which goes first so none always gets the warmer cache.
        for (int k = 0; k < 3; ++k) {
            switch ((round + k) % 3) {
                case 0:
                    manager.push_back(Measure(ManagerPairs, threads));
                    break;
                case 1:
                    bare.push_back(Measure(BarePairs, threads));
                    break;
                case 2:
                    signposts.push_back(Measure(SignpostPairs, threads));
                    break;
            }
        }
    }
    const double m = Median(manager), b = Median(bare), s = Median(signposts);
    std::printf("%s\n  gTarnLocks %8.1f ns   pthread_rwlock %6.1f ns   ratio %6.1fx\n", name, m, b,
                m / b);
    std::printf("  of which signposts %8.1f ns (%.0f%%); manager without them ~%.1fx the floor\n",
                s, 100.0 * s / m, (m - s) / b);
}

}  // namespace

int main() {
    tarn::PlatformLogSetQuiet(true);
    Measure(ManagerPairs, 1);  // warm-up: first-use allocations, log channels
    Compare("read lock+unlock, uncontended", 1);
    Compare("read lock+unlock, 2 threads, 2 ids", 2);
    return 0;
}
