#include "Platform/Dispatch.h"

#include <gtest/gtest.h>

#include <atomic>
#include <stdexcept>
#include <string>
#include <thread>
#include <vector>

#include "Platform/ThreadAnnotations.h"

namespace tarn {
namespace {

using namespace std::chrono_literals;

// Only a broken queue makes a test wait this long.
constexpr auto kBound = 5000ms;
// Long enough for work that wrongly ran to have shown itself.
constexpr auto kSettle = 50ms;

class Event {
  public:
    void set() {
        MutexLock lock(mu_);
        set_ = true;
        cv_.notifyAll();
    }
    bool wait(std::chrono::milliseconds bound = kBound) {
        MutexLock lock(mu_);
        return cv_.waitFor(mu_, bound, [&]() REQUIRES(mu_) { return set_; });
    }

  private:
    Mutex mu_;
    CondVar cv_;
    bool set_ GUARDED_BY(mu_) = false;
};

template <typename Predicate>
bool eventually(Predicate pred, std::chrono::milliseconds bound = kBound) {
    const auto deadline = std::chrono::steady_clock::now() + bound;
    while (!pred()) {
        if (std::chrono::steady_clock::now() > deadline) return false;
        std::this_thread::sleep_for(1ms);
    }
    return true;
}

// Checks that no two items overlap; items record into plain vectors, so a
// broken exclusion also shows up under the thread sanitizer.
struct ExclusionProbe {
    std::atomic<bool> inside{false};
    std::atomic<int> overlaps{0};
    void enter() {
        if (inside.exchange(true)) overlaps++;
    }
    void leave() { inside = false; }
};

TEST(DispatchSerial, FifoAndExclusiveWithAsyncAndSyncFromManyThreadsForEveryTarget) {
    struct Config {
        const char* name;
        DispatchQueueRef target;
    };
    const std::vector<Config> configs = {
        {"default global", nullptr},
        {"background global", DispatchQueue::global(QoS::Background)},
        {"serial queue", DispatchQueue::createSerial("test.serial-target")},
        {"concurrent queue", DispatchQueue::createConcurrent("test.concurrent-target")},
    };
    constexpr int kProducers = 4;
    constexpr int kItems = 300;
    for (const Config& config : configs) {
        SCOPED_TRACE(config.name);
        auto queue = DispatchQueue::createSerial("test.serial", config.target);
        ExclusionProbe probe;
        std::vector<std::vector<int>> seen(kProducers);
        std::vector<std::thread> producers;
        for (int p = 0; p < kProducers; ++p) {
            producers.emplace_back([&, p] {
                for (int i = 0; i < kItems; ++i) {
                    auto work = [&, p, i] {
                        probe.enter();
                        seen[p].push_back(i);
                        probe.leave();
                    };
                    if (i % 10 == 0) {
                        queue->sync(work);
                        // Ran before returning, after this producer's earlier items.
                        ASSERT_EQ(seen[p].size(), size_t(i + 1));
                    } else {
                        queue->async(work);
                    }
                }
            });
        }
        for (auto& t : producers) t.join();
        queue->sync([] {});
        EXPECT_EQ(probe.overlaps, 0);
        for (int p = 0; p < kProducers; ++p) {
            ASSERT_EQ(seen[p].size(), size_t{kItems});
            for (int i = 0; i < kItems; ++i) ASSERT_EQ(seen[p][i], i) << "producer " << p;
        }
    }
}

TEST(DispatchTarget, QueuesTargetingSerialQueueNeverOverlapItsItems) {
    auto listener = DispatchQueue::createSerial("test.listener");
    auto upcall = DispatchQueue::createSerial("test.upcall", listener);
    auto other = DispatchQueue::createSerial("test.other");
    other->setTarget(listener);
    auto fanout = DispatchQueue::createConcurrent("test.fanout", listener);
    const std::vector<DispatchQueueRef> queues = {listener, upcall, other, fanout};

    ExclusionProbe probe;
    std::atomic<int> done{0};
    constexpr int kPerQueue = 200;
    std::vector<std::vector<int>> order(queues.size());
    std::vector<std::thread> producers;
    for (size_t q = 0; q < queues.size(); ++q) {
        producers.emplace_back([&, q] {
            for (int i = 0; i < kPerQueue; ++i) {
                auto work = [&, q, i] {
                    probe.enter();
                    order[q].push_back(i);
                    probe.leave();
                    done++;
                };
                if (i % 5 == 0) {
                    queues[q]->sync(work);
                } else {
                    queues[q]->async(work);
                }
            }
        });
    }
    for (auto& t : producers) t.join();
    ASSERT_TRUE(eventually([&] { return done == int(queues.size()) * kPerQueue; }));
    EXPECT_EQ(probe.overlaps, 0);
    // The concurrent queue is serialized by its target but need not keep order.
    for (size_t q = 0; q + 1 < queues.size(); ++q) {
        for (int i = 0; i < kPerQueue; ++i) ASSERT_EQ(order[q][i], i) << queues[q]->label();
    }
}

TEST(DispatchConcurrent, ItemsRunAtTheSameTime) {
    auto queue = DispatchQueue::createConcurrent("test.concurrent");
    Event first, second;
    std::atomic<int> met{0};
    queue->async([&] {
        first.set();
        if (second.wait()) met++;
    });
    queue->async([&] {
        second.set();
        if (first.wait()) met++;
    });
    ASSERT_TRUE(eventually([&] { return met == 2; }));
}

TEST(DispatchSuspend, CountedAndHoldsSyncAndQueuesTargetingIt) {
    auto queue = DispatchQueue::createSerial("test.suspend");
    Event started, release;
    std::atomic<bool> firstDone{false}, secondRan{false};
    queue->async([&] {
        started.set();
        release.wait();
        firstDone = true;
    });
    queue->async([&] { secondRan = true; });
    ASSERT_TRUE(started.wait());
    queue->suspend();
    queue->suspend();
    release.set();
    ASSERT_TRUE(eventually([&] { return firstDone.load(); }));
    std::this_thread::sleep_for(kSettle);
    EXPECT_FALSE(secondRan);
    queue->resume();
    std::this_thread::sleep_for(kSettle);
    EXPECT_FALSE(secondRan) << "one resume undid two suspends";

    // A sync waits for the suspension too, and keeps its place behind the item.
    std::atomic<bool> syncRan{false};
    std::thread syncer([&] {
        queue->sync([&] {
            EXPECT_TRUE(secondRan);
            syncRan = true;
        });
    });
    std::this_thread::sleep_for(kSettle);
    EXPECT_FALSE(syncRan);
    queue->resume();
    syncer.join();
    EXPECT_TRUE(syncRan);

    // Suspending a target holds the queues that target it.
    auto child = DispatchQueue::createSerial("test.child", queue);
    queue->suspend();
    std::atomic<int> ran{0};
    child->async([&] { ran++; });
    queue->async([&] { ran++; });
    std::this_thread::sleep_for(kSettle);
    EXPECT_EQ(ran, 0);
    queue->resume();
    ASSERT_TRUE(eventually([&] { return ran == 2; }));
}

// runHereIfIdle takes the queue (and its target chain) only when an item
// could start now; otherwise it leaves the order to the queue.
TEST(DispatchRunHere, RunsOnTheCallerOnlyWhenTheWholeChainIsFree) {
    auto target = DispatchQueue::createSerial("test.here.target");
    auto queue = DispatchQueue::createSerial("test.here", target);
    const std::thread::id caller = std::this_thread::get_id();
    bool ran = false;
    EXPECT_TRUE(queue->runHereIfIdle([&] {
        EXPECT_EQ(std::this_thread::get_id(), caller);
        EXPECT_TRUE(queue->isCurrent());
        EXPECT_TRUE(target->isCurrent());
        ran = true;
    }));
    EXPECT_TRUE(ran);
    EXPECT_FALSE(queue->isCurrent());

    auto refused = [](const DispatchQueueRef& q) {
        std::atomic<bool> ran{false};
        const bool admitted = q->runHereIfIdle([&] { ran = true; });
        return !admitted && !ran;
    };
    // Busy target, then work pending behind it: both refuse, and the pending
    // work still runs in order once the target frees up.
    Event started, release;
    std::vector<int> order;
    target->async([&] {
        started.set();
        release.wait();
        order.push_back(1);
    });
    ASSERT_TRUE(started.wait());
    EXPECT_TRUE(refused(queue));
    EXPECT_TRUE(refused(target));
    queue->async([&] { order.push_back(2); });
    release.set();
    target->sync([] {});
    queue->sync([] {});
    EXPECT_EQ(order, (std::vector<int>{1, 2}));

    // Pending work on the queue itself (held by a suspension) keeps its place.
    queue->suspend();
    queue->async([&] { order.push_back(3); });
    EXPECT_TRUE(refused(queue));
    queue->resume();
    queue->sync([] {});
    EXPECT_EQ(order, (std::vector<int>{1, 2, 3}));

    // From inside its own item a serial queue is busy; the main queue belongs
    // to runMain() only.
    queue->sync([&] { EXPECT_TRUE(refused(queue)); });
    EXPECT_TRUE(refused(DispatchQueue::createSerial("test.here.main", DispatchQueue::main())));

    // Many threads racing for one queue: never two inside at once, and no
    // refused attempt loses its place to a later async.
    ExclusionProbe probe;
    std::atomic<int> inline_{0}, handed{0};
    std::vector<std::thread> threads;
    for (int t = 0; t < 4; ++t) {
        threads.emplace_back([&] {
            for (int i = 0; i < 200; ++i) {
                auto work = [&] {
                    probe.enter();
                    probe.leave();
                };
                if (queue->runHereIfIdle(work)) {
                    inline_++;
                } else {
                    handed++;
                    queue->async(work);
                }
            }
        });
    }
    for (auto& t : threads) t.join();
    queue->sync([] {});
    EXPECT_EQ(probe.overlaps, 0);
    EXPECT_EQ(inline_ + handed, 800);
    EXPECT_GT(inline_, 0);
}

TEST(DispatchBarrier, RunsAloneBetweenEarlierAndLaterItems) {
    auto queue = DispatchQueue::createConcurrent("test.barrier");
    constexpr int kRounds = 5;
    constexpr int kItems = 20;
    std::atomic<int> active{0}, finished{0}, violations{0};
    std::atomic<int> barriersDone{0};
    for (int round = 0; round < kRounds; ++round) {
        for (int i = 0; i < kItems; ++i) {
            queue->async([&, round] {
                active++;
                if (barriersDone != round) violations++;
                std::this_thread::sleep_for(100us);
                active--;
                finished++;
            });
        }
        auto barrier = [&, round] {
            if (active != 0 || finished != (round + 1) * kItems) violations++;
            std::this_thread::sleep_for(1ms);
            barriersDone++;
        };
        if (round % 2 == 0) {
            queue->barrierAsync(barrier);
        } else {
            queue->barrierSync(barrier);
        }
    }
    queue->barrierSync([] {});
    EXPECT_EQ(finished, kRounds * kItems);
    EXPECT_EQ(barriersDone, kRounds);
    EXPECT_EQ(violations, 0);
}

TEST(DispatchCurrent, ChainCoversTargetsAndNestedSyncs) {
    auto listener = DispatchQueue::createSerial("test.listener");
    auto upcall = DispatchQueue::createSerial("test.upcall", listener);
    auto mapping = DispatchQueue::createSerial("test.mapping");
    auto fanout = DispatchQueue::createConcurrent("test.fanout");

    EXPECT_EQ(DispatchQueue::currentLabel(), "");
    EXPECT_FALSE(listener->isCurrent());

    auto checkNested = [&] {
        EXPECT_TRUE(upcall->isCurrent());
        EXPECT_TRUE(listener->isCurrent()) << "a queue's target is current too";
        EXPECT_FALSE(mapping->isCurrent());
        EXPECT_EQ(DispatchQueue::currentLabel(), "test.upcall");
        mapping->sync([&] {
            EXPECT_TRUE(upcall->isCurrent());
            EXPECT_TRUE(mapping->isCurrent());
            EXPECT_EQ(DispatchQueue::currentLabel(), "test.mapping");
            fanout->sync([&] {
                EXPECT_TRUE(mapping->isCurrent() && listener->isCurrent());
                // Re-entering a concurrent queue the thread runs is allowed.
                fanout->sync([&] { EXPECT_EQ(DispatchQueue::currentLabel(), "test.fanout"); });
            });
            EXPECT_FALSE(fanout->isCurrent());
            EXPECT_EQ(DispatchQueue::currentLabel(), "test.mapping");
        });
        EXPECT_FALSE(mapping->isCurrent());
    };
    upcall->sync(checkNested);
    Event done;
    upcall->async([&] {
        checkNested();
        done.set();
    });
    ASSERT_TRUE(done.wait());
    EXPECT_FALSE(upcall->isCurrent());
    EXPECT_EQ(DispatchQueue::currentLabel(), "");
}

TEST(DispatchAfter, DeliversInDeadlineOrderAndNotEarly) {
    auto queue = DispatchQueue::createSerial("test.after");
    std::vector<std::string> order;  // touched only on the queue
    const auto start = std::chrono::steady_clock::now();
    std::atomic<int> early{0};
    auto record = [&](std::string name, std::chrono::milliseconds delay) {
        return [&, name, delay] {
            if (std::chrono::steady_clock::now() - start < delay) early++;
            order.push_back(name);
        };
    };
    queue->asyncAfter(60ms, record("c", 60ms));
    queue->asyncAfter(20ms, record("a", 20ms));
    queue->asyncAfter(40ms, record("b", 40ms));
    queue->asyncAfter(40ms, record("b2", 40ms));
    queue->asyncAfter(0ms, record("now", 0ms));
    std::atomic<int> count{0};
    ASSERT_TRUE(eventually([&] {
        queue->sync([&] { count = int(order.size()); });
        return count == 5;
    }));
    queue->sync([&] { EXPECT_EQ(order, (std::vector<std::string>{"now", "a", "b", "b2", "c"})); });
    EXPECT_EQ(early, 0);
}

// Each item blocks until all have started: with a fixed-size pool this never
// finishes. Items also sync into a shared serial queue while others block.
TEST(DispatchPool, FiftyItemsWaitingOnEachOtherAllRun) {
    constexpr int kItems = 50;
    auto shared = DispatchQueue::createSerial("test.shared");
    struct Rendezvous {
        Mutex mu;
        CondVar cv;
        int arrived GUARDED_BY(mu) = 0;
    } meet;
    std::atomic<int> completed{0};
    std::vector<DispatchQueueRef> queues;
    for (int i = 0; i < kItems; ++i) {
        queues.push_back(DispatchQueue::createSerial("test.blocker." + std::to_string(i)));
        queues.back()->async([&] {
            shared->sync([] {});
            MutexLock lock(meet.mu);
            ++meet.arrived;
            meet.cv.notifyAll();
            if (meet.cv.waitFor(meet.mu, kBound,
                                [&]() REQUIRES(meet.mu) { return meet.arrived == kItems; })) {
                completed++;
            }
        });
    }
    ASSERT_TRUE(eventually([&] { return completed == kItems; }, 2 * kBound));
}

TEST(DispatchTransaction, CountsAndWaitsForIdle) {
    const uint64_t base = Transaction::openCount();
    Transaction::begin();
    {
        ScopedTransaction scoped;
        EXPECT_EQ(Transaction::openCount(), base + 2);
    }
    EXPECT_EQ(Transaction::openCount(), base + 1);
    EXPECT_FALSE(Transaction::waitForIdle(20ms));
    std::thread ender([] {
        std::this_thread::sleep_for(20ms);
        Transaction::end();
    });
    EXPECT_TRUE(Transaction::waitForIdle(kBound));
    ender.join();

    // Work submitted with a transaction keeps it open until the work ran.
    auto queue = DispatchQueue::createSerial("test.transaction");
    queue->suspend();
    std::atomic<bool> ran{false};
    transactionAsync(queue, [&] { ran = true; });
    EXPECT_EQ(Transaction::openCount(), base + 1);
    EXPECT_FALSE(Transaction::waitForIdle(20ms));
    queue->resume();
    EXPECT_TRUE(Transaction::waitForIdle(kBound));
    EXPECT_TRUE(ran);
}

TEST(DispatchMain, RunMainDrainsInOrderOnItsThreadUntilStopped) {
    auto mainQueue = DispatchQueue::main();
    std::vector<int> order;  // touched only by main-queue items
    std::atomic<std::thread::id> ranOn{};
    std::atomic<int> notCurrent{0};
    for (int i = 0; i < 20; ++i) {
        mainQueue->async([&, i] {
            if (!mainQueue->isCurrent()) notCurrent++;
            ranOn = std::this_thread::get_id();
            order.push_back(i);
        });
    }
    std::atomic<std::thread::id> runnerId{};
    std::thread runner([&] {
        runnerId = std::this_thread::get_id();
        DispatchQueue::runMain();
    });
    Event drained;
    mainQueue->async([&] { drained.set(); });
    ASSERT_TRUE(drained.wait());
    DispatchQueue::stopMain();
    runner.join();
    EXPECT_EQ(ranOn.load(), runnerId.load());
    EXPECT_EQ(notCurrent, 0);
    ASSERT_EQ(order.size(), 20u);
    for (int i = 0; i < 20; ++i) EXPECT_EQ(order[i], i);

    // Nothing runs between runs; a later run picks the work up.
    std::atomic<bool> late{false};
    mainQueue->async([&] { late = true; });
    std::this_thread::sleep_for(kSettle);
    EXPECT_FALSE(late);
    std::thread again([] { DispatchQueue::runMain(); });
    ASSERT_TRUE(eventually([&] { return late.load(); }));
    DispatchQueue::stopMain();
    again.join();

    // A stop requested before the run ends it at once.
    DispatchQueue::stopMain();
    DispatchQueue::runMain();
}

TEST(DispatchLifetime, DroppedQueueStillRunsItsPendingWork) {
    auto queue = DispatchQueue::createSerial("test.dropped");
    std::weak_ptr<DispatchQueue> weak = queue;
    Event release;
    std::atomic<int> ran{0};
    queue->async([&] { release.wait(); });
    for (int i = 0; i < 100; ++i) queue->async([&] { ran++; });
    queue.reset();
    release.set();
    ASSERT_TRUE(eventually([&] { return ran == 100; }));
    EXPECT_TRUE(eventually([&] { return weak.expired(); }));
}

class DispatchDeathTest : public ::testing::Test {
  protected:
    void SetUp() override { GTEST_FLAG_SET(death_test_style, "threadsafe"); }
};

TEST_F(DispatchDeathTest, SyncOntoARunningSerialQueueAborts) {
    auto listener = DispatchQueue::createSerial("test.listener");
    auto upcall = DispatchQueue::createSerial("test.upcall", listener);
    EXPECT_DEATH(listener->sync([&] { listener->sync([] {}); }), "test.listener.*deadlock");
    EXPECT_DEATH(upcall->sync([&] { listener->sync([] {}); }), "test.listener.*deadlock");
    EXPECT_DEATH(listener->sync([&] { upcall->sync([] {}); }), "test.upcall.*deadlock");
    auto fanout = DispatchQueue::createConcurrent("test.fanout");
    EXPECT_DEATH(fanout->sync([&] { fanout->barrierSync([] {}); }), "test.fanout.*deadlock");
}

TEST_F(DispatchDeathTest, MisuseAborts) {
    auto queue = DispatchQueue::createSerial("test.misuse");
    EXPECT_DEATH(queue->resume(), "test.misuse.*not suspended");
    EXPECT_DEATH(Transaction::end(), "without an open transaction");
    EXPECT_DEATH(queue->sync([] { throw std::runtime_error("boom"); }), "test.misuse.*boom");
    queue->async([] {});
    EXPECT_DEATH(queue->setTarget(nullptr), "test.misuse.*after work");
    auto a = DispatchQueue::createSerial("test.a");
    auto b = DispatchQueue::createSerial("test.b", a);
    EXPECT_DEATH(a->setTarget(b), "cycle");
}

}  // namespace
}  // namespace tarn
