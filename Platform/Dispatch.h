// Work queues, the worker pool behind them, and process transactions.
//
// A queue runs work items (std::function<void()>) submitted to it:
//
//  - Serial queues run one item at a time, in submission (FIFO) order. Items
//    submitted from different threads are ordered by the time they entered the
//    queue.
//  - Concurrent queues let their items run at the same time, with no order
//    among them. A barrier item waits until every item submitted before it has
//    finished, then runs alone; items submitted after it start once it has
//    finished. On a serial queue a barrier is an ordinary item.
//  - Every serial or concurrent queue has a target queue (the default-QoS
//    global queue unless set) and runs its items *as items of its target*: an
//    item of queue A that targets serial queue L never runs while one of L's
//    own items (or of any other queue targeting L) runs. Targets chain.
//  - Global queues (one per QoS) are concurrent root queues served by one
//    worker pool. The pool starts more threads when submitted work is not
//    making progress because every thread is busy or blocked (up to 256), and
//    a thread that stays idle for a few seconds exits, so items may block on
//    locks, condition variables or sync calls without starving the pool. A
//    higher QoS is served first when items wait for a thread; QoS does not
//    change the OS priority of the threads. Barriers, suspend() and resume()
//    have no effect on global queues.
//  - The main queue is serial; its asynchronous items run on the thread that
//    calls runMain(), and only while it does. (Sync work runs on the calling
//    thread, as on any queue.)
//
// Synchronous submission (sync, barrierSync) waits until the work has its turn
// on the queue and then runs it on the calling thread, with the queue (and
// every queue it targets) held exactly as for an asynchronous item: FIFO order,
// suspension and exclusion all apply, and isCurrent() answers true for them
// during the work. On an idle queue this costs no thread switch. A sync onto a
// serial queue that the calling thread already runs (directly or through a
// queue targeting it) can never finish and aborts the process with a message.
// A sync onto a concurrent queue that the calling thread already runs enters it
// at once, as re-entry.
//
// Queues are shared through DispatchQueueRef. A queue stays alive while any
// item submitted to it has yet to run: dropping the last reference to a queue
// with pending work does not cancel that work. The exception is a suspended
// queue: its unstarted items are discarded with it.
//
// Work items must not throw. An exception that escapes one aborts the process
// with a message that names the queue.
//
// All member functions are thread-safe.
#pragma once

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <deque>
#include <functional>
#include <memory>
#include <string>

#include "Platform/ThreadAnnotations.h"

namespace tarn {

enum class QoS { Background, Utility, Default, UserInitiated };

class DispatchQueue;
using DispatchQueueRef = std::shared_ptr<DispatchQueue>;

class DispatchQueue : public std::enable_shared_from_this<DispatchQueue> {
    struct PrivateTag {};

  public:
    // `target` nullptr means the default-QoS global queue.
    static DispatchQueueRef createSerial(std::string label, DispatchQueueRef target = nullptr);
    static DispatchQueueRef createConcurrent(std::string label, DispatchQueueRef target = nullptr);
    // The shared root queues; they live for the whole process.
    static DispatchQueueRef global(QoS qos);
    // Serial, drained only by runMain(); lives for the whole process.
    static DispatchQueueRef main();

    const std::string& label() const { return label_; }

    void async(std::function<void()> work);
    // Runs `work` on the calling thread once it has its turn on this queue, and
    // returns after it ran. Aborts when that can never happen (see above).
    void sync(const std::function<void()>& work);
    // Submits `work` asynchronously once `delay` has passed. Items submitted
    // with later deadlines are submitted later; equal deadlines keep the order
    // of the asyncAfter calls.
    void asyncAfter(std::chrono::nanoseconds delay, std::function<void()> work);
    void barrierAsync(std::function<void()> work);
    void barrierSync(const std::function<void()>& work);

    // Runs `work` on the calling thread at once, as an item of this queue, when
    // this queue and every queue it targets could start an item now (nothing
    // pending, running or suspended on a serial one); returns false without
    // running it otherwise, so that the caller submits it instead. Lets a
    // thread that received work run it without waking another thread.
    bool runHereIfIdle(const std::function<void()>& work);

    // Counted. While the count is above zero no new item of this queue starts
    // (nor of queues that target it); an item already running finishes.
    void suspend();
    // Aborts when the queue is not suspended.
    void resume();

    // Must be called before the first item is submitted; aborts afterwards, on
    // a root queue, and when the new target would form a cycle. nullptr means
    // the default-QoS global queue.
    void setTarget(DispatchQueueRef target);

    // True while the calling thread runs an item of this queue, of a queue that
    // targets it, or sync work inside such an item.
    bool isCurrent() const;
    // Label of the innermost queue the calling thread runs work of; "" when it
    // runs none.
    static std::string currentLabel();

    // Called by the process entry: runs main-queue items on the calling thread
    // until stopMain(). Only one thread may run it at a time.
    static void runMain();
    // Makes runMain() return after the item it is running, if any. Items still
    // queued stay for the next runMain(). A stop requested while no runMain()
    // runs ends the next one at once.
    static void stopMain();

  private:
    enum class Kind { Serial, Concurrent, GlobalRoot, MainRoot };
    struct SyncWaiter;

  public:
    // For make_shared only; use the create functions.
    DispatchQueue(PrivateTag, Kind kind, std::string label, QoS qos, DispatchQueueRef target);
    ~DispatchQueue();
    DispatchQueue(const DispatchQueue&) = delete;
    DispatchQueue& operator=(const DispatchQueue&) = delete;

  private:
    struct Item {
        std::function<void()> work;        // empty for a sync ticket
        std::shared_ptr<SyncWaiter> sync;  // set for a sync ticket
        bool barrier = false;
    };

    struct Roots;
    static Roots& roots();
    static DispatchQueueRef create(Kind kind, std::string label, DispatchQueueRef target);
    bool isRoot() const { return kind_ == Kind::GlobalRoot || kind_ == Kind::MainRoot; }
    size_t width() const { return kind_ == Kind::Serial ? 1 : SIZE_MAX; }

    void submit(Item item) EXCLUDES(mu_);
    void syncImpl(const std::function<void()>& work, bool barrier) EXCLUDES(mu_);
    // Starts every pending item that may start now, in order.
    void pump() EXCLUDES(mu_);
    // Hands a started item to the target queue.
    void startItem(Item item, const DispatchQueueRef& target);
    // Runs a started item when the target gets to it.
    void runForwarded(Item& item) EXCLUDES(mu_);
    void finishItem(bool barrier) EXCLUDES(mu_);
    DispatchQueueRef targetOf() const EXCLUDES(mu_);
    // Passes `item` to `to`, or lets a sync ticket through when the waiting
    // thread already runs `to`.
    static void forward(const DispatchQueueRef& to, Item item);

    // Constant after construction.
    const Kind kind_;
    const std::string label_;
    const QoS qos_;  // the QoS a global root queue serves; unused otherwise

    mutable Mutex mu_;
    DispatchQueueRef target_ GUARDED_BY(mu_);  // null only for root queues
    std::deque<Item> pending_ GUARDED_BY(mu_);
    size_t running_ GUARDED_BY(mu_) = 0;  // started items not yet finished
    bool barrierRunning_ GUARDED_BY(mu_) = false;
    uint32_t suspendCount_ GUARDED_BY(mu_) = 0;
    bool used_ GUARDED_BY(mu_) = false;  // an item was submitted; the target is fixed
};

// Process transactions: while one is open the daemon has work in flight and
// must not exit for idleness. Counted, process-wide, thread-safe.
class Transaction {
  public:
    static void begin();
    // Aborts when no transaction is open.
    static void end();
    static uint64_t openCount();
    // Waits until no transaction is open; false when `bound` passed first.
    static bool waitForIdle(std::chrono::milliseconds bound);
};

class ScopedTransaction {
  public:
    ScopedTransaction() { Transaction::begin(); }
    ~ScopedTransaction() { Transaction::end(); }
    ScopedTransaction(const ScopedTransaction&) = delete;
    ScopedTransaction& operator=(const ScopedTransaction&) = delete;
};

// Opens a transaction, submits `work` asynchronously to `queue`, and closes the
// transaction after the work ran.
void transactionAsync(const DispatchQueueRef& queue, std::function<void()> work);

}  // namespace tarn
