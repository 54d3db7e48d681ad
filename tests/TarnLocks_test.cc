#include "Daemon/TarnLocks.h"

#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <functional>
#include <future>
#include <random>
#include <set>
#include <thread>
#include <vector>

#include "Platform/PlatformLog.h"

namespace tarn {
namespace {

using namespace std::chrono_literals;

constexpr auto kBlocked = 150ms;  // long enough to show a waiter does not get in
constexpr auto kGranted = 10s;    // generous bound for a waiter that must get in

// Takes a lock on its own thread and holds it until release(); identifier
// locks must be released on the thread that took them.
class Holder {
  public:
    Holder(std::function<void()> lock, std::function<void()> unlock)
        : thread_([this, lock = std::move(lock), unlock = std::move(unlock)] {
              lock();
              acquired_.set_value();
              released_.get_future().wait();
              unlock();
          }),
          acquiredFuture_(acquired_.get_future()) {}
    ~Holder() { release(); }

    bool acquiredWithin(std::chrono::milliseconds bound) {
        return acquiredFuture_.wait_for(bound) == std::future_status::ready;
    }
    bool blocked() { return !acquiredWithin(kBlocked); }
    bool granted() {
        return acquiredWithin(std::chrono::duration_cast<std::chrono::milliseconds>(kGranted));
    }
    void release() {
        if (!thread_.joinable()) return;
        released_.set_value();
        thread_.join();
    }

  private:
    std::promise<void> acquired_;
    std::promise<void> released_;
    std::thread thread_;
    std::future<void> acquiredFuture_;
};

enum Kind { IdRead, IdWrite, GlobalRead, GlobalWrite };
const char* const kKindNames[] = {"identifier read", "identifier write", "global read",
                                  "global write"};

class TarnLocksTest : public ::testing::Test {
  protected:
    static void SetUpTestSuite() { PlatformLogSetQuiet(true); }

    void TearDown() override {
        EXPECT_EQ(locks_.TEST_recordCount(), 0u);
        EXPECT_EQ(locks_.TEST_identifierReaderCount(), 0u);
        EXPECT_EQ(locks_.TEST_identifierWriterCount(), 0u);
        EXPECT_EQ(locks_.TEST_allReaderWriterState(), 0);
    }

    std::unique_ptr<Holder> hold(Kind kind, const std::string& id = "X") {
        return std::make_unique<Holder>(
            [=, this] {
                if (kind == IdRead) locks_.read_lock_identifier(id);
                if (kind == IdWrite) locks_.write_lock_identifier(id);
                if (kind == GlobalRead) locks_.read_lock_all_identifiers();
                if (kind == GlobalWrite) locks_.write_lock_all_identifiers();
            },
            [=, this] {
                kind >= GlobalRead ? locks_.unlock_all_identifiers() : locks_.unlock_identifier(id);
            });
    }

    TarnLocks locks_;
};

TEST_F(TarnLocksTest, ArrayLocksDistinctIdentifiersAscendingAndUnlocksDescending) {
    std::vector<std::string> trace;
    locks_.TEST_setTraceHook([&](const char* event, const std::string& id) {
        trace.push_back(std::string(event) + " " + id);
    });
    const std::vector<std::string> ids = {"b", "a", "b"};
    for (bool writing : {false, true}) {
        SCOPED_TRACE(writing ? "writing" : "reading");
        trace.clear();
        // A write lock taken twice would wait for itself; finishing shows "b" is taken once.
        writing ? locks_.write_lock_identifier(ids) : locks_.read_lock_identifier(ids);
        EXPECT_EQ(locks_.TEST_refCount("b"), 1u);
        EXPECT_EQ(locks_.TEST_lockState("b"), writing ? -1 : 1);
        locks_.unlock_identifier(ids);
        EXPECT_EQ(trace, (std::vector<std::string>{"lock a", "lock b", "unlock b", "unlock a"}));
    }
    // The same through a request's property-list parameter.
    trace.clear();
    const PlistValue parameter(PlistArray{"b", "a", "b"});
    locks_.write_lock_identifier(parameter);
    locks_.unlock_identifier(parameter);
    EXPECT_EQ(trace, (std::vector<std::string>{"lock a", "lock b", "unlock b", "unlock a"}));
    locks_.TEST_setTraceHook(nullptr);
}

TEST_F(TarnLocksTest, ReadersShareARecordThatDisappearsAfterTheLastUnlock) {
    auto first = hold(IdRead);
    auto second = hold(IdRead);
    ASSERT_TRUE(first->granted());
    ASSERT_TRUE(second->granted());
    EXPECT_EQ(locks_.TEST_lockState("X"), 2);
    EXPECT_EQ(locks_.TEST_refCount("X"), 2u);
    first->release();
    EXPECT_EQ(locks_.TEST_lockState("X"), 1);
    second->release();
    EXPECT_EQ(locks_.TEST_lockState("X"), std::nullopt);
}

TEST_F(TarnLocksTest, WriterOfOneIdentifierExcludesOnlyThatIdentifier) {
    auto writer = hold(IdWrite, "X");
    ASSERT_TRUE(writer->granted());
    auto other = hold(IdWrite, "Y");
    EXPECT_TRUE(other->granted());
    auto reader = hold(IdRead, "X");
    EXPECT_TRUE(reader->blocked());
    // The waiter counts, so the record cannot vanish under it.
    EXPECT_EQ(locks_.TEST_refCount("X"), 2u);
    writer->release();
    EXPECT_TRUE(reader->granted());
    EXPECT_EQ(locks_.TEST_lockState("X"), 1);
}

TEST_F(TarnLocksTest, GlobalWriteWaitsForEveryHolderAndBlocksEveryNewcomer) {
    for (Kind held : {IdRead, IdWrite, GlobalRead}) {
        SCOPED_TRACE(kKindNames[held]);
        auto holder = hold(held);
        ASSERT_TRUE(holder->granted());
        auto global = hold(GlobalWrite);
        EXPECT_TRUE(global->blocked());
        holder->release();
        EXPECT_TRUE(global->granted());
        EXPECT_EQ(locks_.TEST_allReaderWriterState(), -1);
        global->release();
    }

    auto global = hold(GlobalWrite);
    ASSERT_TRUE(global->granted());
    std::vector<std::unique_ptr<Holder>> newcomers;
    for (Kind kind : {IdRead, IdWrite, GlobalRead, GlobalWrite}) {
        newcomers.push_back(hold(kind, std::string("N") + kKindNames[kind]));
        EXPECT_TRUE(newcomers.back()->blocked()) << kKindNames[kind];
    }
    global->release();
    // They get in in no particular order (the global writer alone); each one
    // that got in lets go, until all have been in.
    const auto deadline = std::chrono::steady_clock::now() + kGranted;
    while (!newcomers.empty() && std::chrono::steady_clock::now() < deadline) {
        for (auto it = newcomers.begin(); it != newcomers.end(); ++it) {
            if ((*it)->acquiredWithin(10ms)) {
                newcomers.erase(it);  // releases
                break;
            }
        }
    }
    EXPECT_TRUE(newcomers.empty());
}

TEST_F(TarnLocksTest, GlobalReadAdmitsIdentifierReadersButHoldsIdentifierWriters) {
    auto firstGlobal = hold(GlobalRead);
    auto secondGlobal = hold(GlobalRead);
    ASSERT_TRUE(firstGlobal->granted());
    ASSERT_TRUE(secondGlobal->granted());
    auto reader = hold(IdRead);
    EXPECT_TRUE(reader->granted());
    auto writer = hold(IdWrite, "Y");
    EXPECT_TRUE(writer->blocked());
    firstGlobal->release();
    EXPECT_TRUE(writer->blocked());
    secondGlobal->release();
    EXPECT_TRUE(writer->granted());

    // And the other way round: a held identifier writer keeps global readers out.
    auto global = hold(GlobalRead);
    EXPECT_TRUE(global->blocked());
    writer->release();
    EXPECT_TRUE(global->granted());
}

using TarnLocksDeathTest = TarnLocksTest;

TEST_F(TarnLocksDeathTest, ProgrammingErrorsStopTheProcess) {
#if defined(__SANITIZE_THREAD__)
    GTEST_SKIP() << "death tests fork a threaded process";
#endif
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    EXPECT_DEATH(locks_.unlock_identifier("never-locked"), "gTarnLocks.identifierToLockMap");
    EXPECT_DEATH(locks_.unlock_all_identifiers(), "gTarnLocks.allReaderWriterState");
    EXPECT_DEATH(locks_.read_lock_identifier(PlistValue(uint64_t{7})), "Unknown parameter type!");
    EXPECT_DEATH(locks_.unlock_identifier(PlistValue(PlistDict{})), "Unknown parameter type!");
}

// Threads take random mixes of every kind of lock for a bounded time, and
// check inside each critical section that nobody incompatible is in.
TEST(TarnLocksStress, RandomMixesKeepMutualExclusionAndFinish) {
    PlatformLogSetQuiet(true);
    constexpr int kThreads = 6;
    constexpr int kIdentifiers = 5;
    const auto duration = 2s;
    TarnLocks locks;

    struct Counters {
        std::atomic<int> readers{0}, writers{0};
    };
    std::array<Counters, kIdentifiers> perId;
    std::atomic<int> globalReaders{0}, globalWriters{0}, violations{0};
    std::atomic<uint64_t> operations{0};
    const auto ids = [] {
        std::vector<std::string> v;
        for (int i = 0; i < kIdentifiers; ++i) v.push_back("ID-" + std::to_string(i));
        return v;
    }();
    auto check = [&](bool ok) {
        if (!ok) violations.fetch_add(1);
    };
    auto anyIdentifierWriter = [&] {
        for (auto& c : perId)
            if (c.writers.load()) return true;
        return false;
    };
    auto anyIdentifierHolder = [&] {
        for (auto& c : perId)
            if (c.writers.load() || c.readers.load()) return true;
        return false;
    };
    // Enters the identifiers' critical sections (already locked), checks, leaves.
    auto useIdentifiers = [&](const std::set<int>& chosen, bool writing) {
        for (int i : chosen) {
            if (writing) {
                check(perId[i].writers.fetch_add(1) == 0 && perId[i].readers.load() == 0);
                check(globalReaders.load() == 0 && globalWriters.load() == 0);
            } else {
                perId[i].readers.fetch_add(1);
                check(perId[i].writers.load() == 0 && globalWriters.load() == 0);
            }
        }
        std::this_thread::yield();
        for (int i : chosen) (writing ? perId[i].writers : perId[i].readers).fetch_sub(1);
    };

    const auto deadline = std::chrono::steady_clock::now() + duration;
    auto worker = [&](unsigned seed) {
        std::mt19937 rng(seed);
        while (std::chrono::steady_clock::now() < deadline) {
            const int op = static_cast<int>(rng() % 6);
            std::vector<std::string> array;
            std::set<int> chosen;
            const size_t n = op <= 1 ? 1 : 1 + rng() % 4;  // arrays may repeat identifiers
            for (size_t k = 0; k < n; ++k) {
                const int i = static_cast<int>(rng() % kIdentifiers);
                array.push_back(ids[i]);
                chosen.insert(i);
            }
            const bool writing = rng() % 2;
            switch (op) {
                case 0:
                case 1:  // one identifier
                    writing ? locks.write_lock_identifier(array[0])
                            : locks.read_lock_identifier(array[0]);
                    useIdentifiers(chosen, writing);
                    locks.unlock_identifier(array[0]);
                    break;
                case 2:
                case 3:  // an array
                    writing ? locks.write_lock_identifier(array)
                            : locks.read_lock_identifier(array);
                    useIdentifiers(chosen, writing);
                    locks.unlock_identifier(array);
                    break;
                case 4:  // global, alone
                    if (writing) {
                        locks.write_lock_all_identifiers();
                        check(globalWriters.fetch_add(1) == 0 && globalReaders.load() == 0);
                        check(!anyIdentifierHolder());
                        std::this_thread::yield();
                        globalWriters.fetch_sub(1);
                    } else {
                        locks.read_lock_all_identifiers();
                        globalReaders.fetch_add(1);
                        check(globalWriters.load() == 0 && !anyIdentifierWriter());
                        std::this_thread::yield();
                        globalReaders.fetch_sub(1);
                    }
                    locks.unlock_all_identifiers();
                    break;
                case 5:  // global read, then identifier readers inside it
                    locks.read_lock_all_identifiers();
                    globalReaders.fetch_add(1);
                    locks.read_lock_identifier(array);
                    useIdentifiers(chosen, false);
                    locks.unlock_identifier(array);
                    globalReaders.fetch_sub(1);
                    locks.unlock_all_identifiers();
                    break;
            }
            operations.fetch_add(1);
        }
    };

    std::promise<void> finished;
    std::thread runner([&] {
        std::vector<std::thread> threads;
        for (int t = 0; t < kThreads; ++t) threads.emplace_back(worker, 1234u + t);
        for (auto& thread : threads) thread.join();
        finished.set_value();
    });
    if (finished.get_future().wait_for(duration + 60s) != std::future_status::ready) {
        std::fprintf(stderr, "lock stress test deadlocked after %llu operations\n",
                     static_cast<unsigned long long>(operations.load()));
        std::abort();
    }
    runner.join();
    EXPECT_EQ(violations.load(), 0);
    EXPECT_GT(operations.load(), 100u);
    EXPECT_EQ(locks.TEST_recordCount(), 0u);
    EXPECT_EQ(locks.TEST_allReaderWriterState(), 0);
}

}  // namespace
}  // namespace tarn
