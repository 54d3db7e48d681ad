#include "Platform/Dispatch.h"

#include <pthread.h>

#include <algorithm>
#include <array>
#include <cstdio>
#include <cstdlib>
#include <exception>
#include <system_error>
#include <thread>
#include <utility>
#include <vector>

namespace tarn {
namespace {

using Clock = std::chrono::steady_clock;

// Hard cap on pool threads: past it, blocked work waits instead of growing the
// process further.
constexpr size_t kMaxPoolThreads = 256;
// How long queued pool work may sit without any thread picking work up before
// the pool adds a thread.
constexpr auto kStallInterval = std::chrono::milliseconds(10);
// Threads added per stall: when every thread is blocked, one more rarely helps.
constexpr size_t kStallSpawn = 4;
constexpr auto kIdleThreadExit = std::chrono::seconds(5);

[[noreturn]] void fatal(const std::string& message) {
    std::fprintf(stderr, "tarn dispatch: %s\n", message.c_str());
    std::fflush(stderr);
    std::abort();
}

void runWork(const std::function<void()>& work, const std::string& label) noexcept {
    try {
        work();
    } catch (const std::exception& e) {
        fatal("work item on queue \"" + label + "\" threw: " + e.what());
    } catch (...) {
        fatal("work item on queue \"" + label + "\" threw a non-standard exception");
    }
}

void nameThisThread(const char* name) {
    // Only for debuggers and ps; failure changes nothing else.
    (void)pthread_setname_np(pthread_self(), name);
}

// The queues whose work the calling thread is running, outermost first. Raw
// pointers: whoever runs the work keeps the queue alive meanwhile.
thread_local std::vector<const DispatchQueue*> tCurrentQueues;

class QueueFrame {
  public:
    explicit QueueFrame(const DispatchQueue* queue) { tCurrentQueues.push_back(queue); }
    ~QueueFrame() { tCurrentQueues.pop_back(); }
    QueueFrame(const QueueFrame&) = delete;
    QueueFrame& operator=(const QueueFrame&) = delete;
};

// Threads that serve the global queues. Process lifetime (never destroyed, so
// detached threads never see it go away).
class WorkerPool {
  public:
    static WorkerPool& instance() {
        static WorkerPool* const pool = new WorkerPool;
        return *pool;
    }

    void submit(QoS qos, std::function<void()> job) EXCLUDES(mu_) {
        bool wakeWorker = false, wakeMonitor = false;
        {
            MutexLock lock(mu_);
            jobs_[static_cast<size_t>(qos)].push_back(std::move(job));
            ++queued_;
            wakeWorker = idle_ > 0;
            // Idle threads already woken for earlier jobs count against this one.
            if (idle_ < queued_ && !(threads_ < eagerThreads_ && spawnWorker())) {
                startMonitor();
                wakeMonitor = true;
            }
        }
        // Signalled after unlocking, so that the woken thread does not run
        // straight into the lock still held here. Waiters re-check queued_.
        if (wakeWorker) workReady_.notifyOne();
        if (wakeMonitor) monitorWake_.notifyOne();
    }

  private:
    WorkerPool() = default;

    // Starts one worker; false when the OS refused a thread.
    bool spawnWorker() REQUIRES(mu_) {
        if (threads_ >= kMaxPoolThreads) return false;
        try {
            std::thread([this] { workerLoop(); }).detach();
        } catch (const std::system_error&) {
            return false;  // the monitor tries again on the next stall
        }
        ++threads_;
        return true;
    }

    void startMonitor() REQUIRES(mu_) {
        if (monitorStarted_) return;
        try {
            std::thread([this] { monitorLoop(); }).detach();
        } catch (const std::system_error& e) {
            fatal(std::string("cannot start the worker pool monitor: ") + e.what());
        }
        monitorStarted_ = true;
    }

    void workerLoop() EXCLUDES(mu_) {
        nameThisThread("tarn-worker");
        mu_.lock();
        for (;;) {
            while (queued_ == 0) {
                ++idle_;
                const bool woken = workReady_.waitFor(mu_, kIdleThreadExit);
                --idle_;
                if (!woken && queued_ == 0) {
                    --threads_;
                    mu_.unlock();
                    return;
                }
            }
            std::function<void()> job = takeJob();
            mu_.unlock();
            job();
            job = nullptr;  // captures die before the lock is taken again
            mu_.lock();
        }
    }

    // Highest QoS first, FIFO within one QoS.
    std::function<void()> takeJob() REQUIRES(mu_) {
        for (size_t i = jobs_.size(); i-- > 0;) {
            if (jobs_[i].empty()) continue;
            std::function<void()> job = std::move(jobs_[i].front());
            jobs_[i].pop_front();
            --queued_;
            ++taken_;
            return job;
        }
        fatal("worker pool bookkeeping is inconsistent");
    }

    // Adds a thread whenever queued work has waited a whole interval while no
    // thread picked any up: every thread is busy or blocked, perhaps on work
    // that is itself still queued.
    void monitorLoop() EXCLUDES(mu_) {
        nameThisThread("tarn-pool-mon");
        mu_.lock();
        for (;;) {
            while (queued_ == 0) monitorWake_.wait(mu_);
            uint64_t seen = taken_;
            Clock::time_point next = Clock::now() + kStallInterval;
            while (queued_ > 0) {
                if (monitorWake_.waitUntil(mu_, next)) continue;  // woken early: keep the interval
                if (queued_ > 0 && taken_ == seen && idle_ == 0) {
                    for (size_t n = std::min(queued_, kStallSpawn); n > 0 && spawnWorker(); --n) {
                    }
                }
                seen = taken_;
                next = Clock::now() + kStallInterval;
            }
        }
    }

    // Threads started on demand without waiting for a stall; more would only
    // compete for the cores.
    const size_t eagerThreads_ = std::max<size_t>(8, 4 * std::thread::hardware_concurrency());

    Mutex mu_;
    CondVar workReady_;
    CondVar monitorWake_;
    std::array<std::deque<std::function<void()>>, 4> jobs_ GUARDED_BY(mu_);  // by QoS
    size_t queued_ GUARDED_BY(mu_) = 0;                                      // across jobs_
    size_t threads_ GUARDED_BY(mu_) = 0;
    size_t idle_ GUARDED_BY(mu_) = 0;     // workers waiting for a job
    uint64_t taken_ GUARDED_BY(mu_) = 0;  // jobs ever picked up: the monitor's progress mark
    bool monitorStarted_ GUARDED_BY(mu_) = false;
};

// Delivers asyncAfter work to its queue at its deadline, from one thread.
// Process lifetime.
class DelayedWork {
  public:
    static DelayedWork& instance() {
        static DelayedWork* const timer = new DelayedWork;
        return *timer;
    }

    void schedule(Clock::time_point deadline, DispatchQueueRef queue, std::function<void()> work)
        EXCLUDES(mu_) {
        {
            MutexLock lock(mu_);
            if (!started_) {
                try {
                    std::thread([this] { loop(); }).detach();
                } catch (const std::system_error& e) {
                    fatal(std::string("cannot start the timer thread: ") + e.what());
                }
                started_ = true;
            }
            entries_.push_back(Entry{deadline, nextSeq_++, std::move(queue), std::move(work)});
            std::push_heap(entries_.begin(), entries_.end(), Later{});
        }
        changed_.notifyOne();
    }

  private:
    struct Entry {
        Clock::time_point deadline;
        uint64_t seq;  // keeps equal deadlines in call order
        DispatchQueueRef queue;
        std::function<void()> work;
    };
    struct Later {
        bool operator()(const Entry& a, const Entry& b) const {
            return a.deadline != b.deadline ? a.deadline > b.deadline : a.seq > b.seq;
        }
    };

    DelayedWork() = default;

    void loop() EXCLUDES(mu_) {
        nameThisThread("tarn-timer");
        std::vector<Entry> due;
        mu_.lock();
        for (;;) {
            if (entries_.empty()) {
                changed_.wait(mu_);
                continue;
            }
            const Clock::time_point now = Clock::now();
            if (entries_.front().deadline > now) {
                (void)changed_.waitUntil(mu_, entries_.front().deadline);
                continue;
            }
            while (!entries_.empty() && entries_.front().deadline <= now) {
                std::pop_heap(entries_.begin(), entries_.end(), Later{});
                due.push_back(std::move(entries_.back()));
                entries_.pop_back();
            }
            mu_.unlock();
            for (Entry& entry : due) entry.queue->async(std::move(entry.work));
            due.clear();
            mu_.lock();
        }
    }

    Mutex mu_;
    CondVar changed_;
    std::vector<Entry> entries_ GUARDED_BY(mu_);  // a heap ordered by Later
    uint64_t nextSeq_ GUARDED_BY(mu_) = 0;
    bool started_ GUARDED_BY(mu_) = false;
};

// The jobs of the main queue, run by runMain(). Process lifetime.
struct MainRunner {
    static MainRunner& instance() {
        static MainRunner* const runner = new MainRunner;
        return *runner;
    }

    Mutex mu;
    CondVar changed;
    std::deque<std::function<void()>> jobs GUARDED_BY(mu);
    bool stopRequested GUARDED_BY(mu) = false;
    bool running GUARDED_BY(mu) = false;
};

struct TransactionState {
    static TransactionState& instance() {
        static TransactionState* const state = new TransactionState;
        return *state;
    }

    Mutex mu;
    CondVar idle;
    uint64_t open GUARDED_BY(mu) = 0;
};

}  // namespace

// A thread blocked in sync(). The ticket standing for it travels up the target
// chain like an item; each queue it starts in appends itself to `entered`, and
// the root (or a queue the thread already runs) grants it.
struct DispatchQueue::SyncWaiter {
    // The caller holds a reference to the waiter, so signalling after the
    // unlock cannot touch a waiter that has already returned and gone.
    void grant() {
        {
            MutexLock lock(mu);
            granted = true;
        }
        wakeup.notifyOne();
    }

    void enter(DispatchQueueRef queue) {
        MutexLock lock(mu);
        entered.push_back(std::move(queue));
    }

    // Waits for the grant; returns the queues entered, innermost first.
    std::vector<DispatchQueueRef> await() {
        MutexLock lock(mu);
        while (!granted) wakeup.wait(mu);
        return std::move(entered);
    }

    const DispatchQueue* stopAt = nullptr;  // constant once the ticket is submitted

    Mutex mu;
    CondVar wakeup;
    bool granted GUARDED_BY(mu) = false;
    std::vector<DispatchQueueRef> entered GUARDED_BY(mu);
};

struct DispatchQueue::Roots {
    std::array<DispatchQueueRef, 4> globals;  // by QoS
    DispatchQueueRef mainRoot;
    DispatchQueueRef main;
};

DispatchQueue::Roots& DispatchQueue::roots() {
    static Roots* const roots = [] {
        auto* r = new Roots;
        const char* const names[] = {"tarn.global.background", "tarn.global.utility",
                                     "tarn.global.default", "tarn.global.user-initiated"};
        for (size_t i = 0; i < r->globals.size(); ++i) {
            r->globals[i] = std::make_shared<DispatchQueue>(PrivateTag{}, Kind::GlobalRoot,
                                                            names[i], static_cast<QoS>(i), nullptr);
        }
        r->mainRoot = std::make_shared<DispatchQueue>(PrivateTag{}, Kind::MainRoot,
                                                      "tarn.main-thread", QoS::Default, nullptr);
        r->main = std::make_shared<DispatchQueue>(PrivateTag{}, Kind::Serial, "tarn.main",
                                                  QoS::Default, r->mainRoot);
        return r;
    }();
    return *roots;
}

DispatchQueue::DispatchQueue(PrivateTag, Kind kind, std::string label, QoS qos,
                             DispatchQueueRef target)
    : kind_(kind), label_(std::move(label)), qos_(qos), target_(std::move(target)) {}

DispatchQueue::~DispatchQueue() = default;

DispatchQueueRef DispatchQueue::create(Kind kind, std::string label, DispatchQueueRef target) {
    if (!target) target = global(QoS::Default);
    return std::make_shared<DispatchQueue>(PrivateTag{}, kind, std::move(label), QoS::Default,
                                           std::move(target));
}

DispatchQueueRef DispatchQueue::createSerial(std::string label, DispatchQueueRef target) {
    return create(Kind::Serial, std::move(label), std::move(target));
}

DispatchQueueRef DispatchQueue::createConcurrent(std::string label, DispatchQueueRef target) {
    return create(Kind::Concurrent, std::move(label), std::move(target));
}

DispatchQueueRef DispatchQueue::global(QoS qos) {
    return roots().globals.at(static_cast<size_t>(qos));
}

DispatchQueueRef DispatchQueue::main() { return roots().main; }

void DispatchQueue::async(std::function<void()> work) {
    if (!work) fatal("empty work item submitted to queue \"" + label_ + "\"");
    submit(Item{std::move(work), nullptr, false});
}

void DispatchQueue::barrierAsync(std::function<void()> work) {
    if (!work) fatal("empty work item submitted to queue \"" + label_ + "\"");
    submit(Item{std::move(work), nullptr, kind_ == Kind::Concurrent});
}

void DispatchQueue::sync(const std::function<void()>& work) { syncImpl(work, false); }

void DispatchQueue::barrierSync(const std::function<void()>& work) {
    syncImpl(work, kind_ == Kind::Concurrent);
}

void DispatchQueue::asyncAfter(std::chrono::nanoseconds delay, std::function<void()> work) {
    if (!work) fatal("empty work item submitted to queue \"" + label_ + "\"");
    if (delay <= std::chrono::nanoseconds::zero()) {
        async(std::move(work));
        return;
    }
    if (!isRoot()) {
        MutexLock lock(mu_);
        used_ = true;
    }
    DelayedWork::instance().schedule(Clock::now() + delay, shared_from_this(), std::move(work));
}

void DispatchQueue::submit(Item item) {
    switch (kind_) {
        case Kind::GlobalRoot:
            if (item.sync) {
                item.sync->enter(shared_from_this());
                item.sync->grant();
                return;
            }
            // Root queues live for the whole process, so `this` stays valid.
            WorkerPool::instance().submit(qos_, [this, work = std::move(item.work)] {
                QueueFrame frame(this);
                runWork(work, label_);
            });
            return;
        case Kind::MainRoot: {
            if (item.sync) {
                item.sync->enter(shared_from_this());
                item.sync->grant();
                return;
            }
            MainRunner& runner = MainRunner::instance();
            {
                MutexLock lock(runner.mu);
                runner.jobs.push_back([this, work = std::move(item.work)] {
                    QueueFrame frame(this);
                    runWork(work, label_);
                });
            }
            runner.changed.notifyAll();
            return;
        }
        case Kind::Serial:
        case Kind::Concurrent:
            break;
    }
    {
        MutexLock lock(mu_);
        used_ = true;
        pending_.push_back(std::move(item));
    }
    pump();
}

void DispatchQueue::pump() {
    std::vector<Item> ready;
    DispatchQueueRef target;
    {
        MutexLock lock(mu_);
        while (suspendCount_ == 0 && !pending_.empty()) {
            Item& next = pending_.front();
            const bool blocked =
                next.barrier ? running_ > 0 : (barrierRunning_ || running_ >= width());
            if (blocked) break;
            ++running_;
            if (next.barrier) barrierRunning_ = true;
            ready.push_back(std::move(next));
            pending_.pop_front();
        }
        target = target_;
    }
    for (Item& item : ready) startItem(std::move(item), target);
}

void DispatchQueue::startItem(Item item, const DispatchQueueRef& target) {
    if (item.sync) {
        item.sync->enter(shared_from_this());
        forward(target, Item{{}, std::move(item.sync), false});
        return;
    }
    // The wrapper holds this queue alive until its item has run, and runs as an
    // ordinary (non-barrier) item of the target.
    forward(target, Item{[self = shared_from_this(), item = std::move(item)]() mutable {
                             self->runForwarded(item);
                         },
                         nullptr, false});
}

void DispatchQueue::forward(const DispatchQueueRef& to, Item item) {
    if (item.sync && to.get() == item.sync->stopAt) {
        item.sync->grant();
        return;
    }
    to->submit(std::move(item));
}

void DispatchQueue::runForwarded(Item& item) {
    {
        MutexLock lock(mu_);
        if (suspendCount_ > 0) {
            // Suspended after the item left this queue but before it started:
            // put it back so that it starts only after resume().
            --running_;
            if (item.barrier) barrierRunning_ = false;
            pending_.push_front(std::move(item));
            return;
        }
    }
    {
        QueueFrame frame(this);
        runWork(item.work, label_);
    }
    item.work = nullptr;  // captures die before the next item starts
    finishItem(item.barrier);
}

void DispatchQueue::finishItem(bool barrier) {
    if (isRoot()) return;
    {
        MutexLock lock(mu_);
        --running_;
        if (barrier) barrierRunning_ = false;
    }
    pump();
}

DispatchQueueRef DispatchQueue::targetOf() const {
    MutexLock lock(mu_);
    return target_;
}

void DispatchQueue::syncImpl(const std::function<void()>& work, bool barrier) {
    if (!work) fatal("empty work item submitted to queue \"" + label_ + "\"");
    if (kind_ == Kind::GlobalRoot) {
        QueueFrame frame(this);
        runWork(work, label_);
        return;
    }
    const DispatchQueueRef self = shared_from_this();

    // The first queue up the target chain that this thread already runs stops
    // the ticket: a serial one can never be entered again (deadlock), a
    // concurrent one is simply re-entered.
    const DispatchQueue* held = nullptr;
    for (DispatchQueueRef q = self; q && !q->isRoot(); q = q->targetOf()) {
        if (!q->isCurrent()) continue;
        if (q->kind_ == Kind::Serial || (barrier && q == self)) {
            std::string message = "sync onto queue \"" + label_ + "\"";
            if (q != self) message += " (which targets \"" + q->label_ + "\")";
            fatal(message + " from a thread that is running it: deadlock");
        }
        held = q.get();
        break;
    }

    auto waiter = std::make_shared<SyncWaiter>();
    waiter->stopAt = held;
    forward(self, Item{{}, waiter, barrier});
    const std::vector<DispatchQueueRef> entered = waiter->await();

    // Outermost first, so that this queue is the innermost.
    for (auto it = entered.rbegin(); it != entered.rend(); ++it)
        tCurrentQueues.push_back(it->get());
    runWork(work, label_);
    tCurrentQueues.resize(tCurrentQueues.size() - entered.size());
    for (size_t i = 0; i < entered.size(); ++i) entered[i]->finishItem(i == 0 && barrier);
}

bool DispatchQueue::runHereIfIdle(const std::function<void()>& work) {
    if (!work) fatal("empty work item submitted to queue \"" + label_ + "\"");
    // Enter every queue up the chain that is free now, or none: a queue with
    // anything pending or running (or suspended) keeps its FIFO order by
    // refusing, and the caller submits the work instead.
    std::array<DispatchQueue*, 16> entered;
    size_t depth = 0;
    bool admitted = false;
    for (DispatchQueue* q = this; q && depth < entered.size();) {
        if (q->kind_ == Kind::GlobalRoot) {
            admitted = true;
            break;
        }
        if (q->kind_ == Kind::MainRoot) break;  // only runMain() may run its work
        DispatchQueue* next;
        {
            MutexLock lock(q->mu_);
            if (q->suspendCount_ > 0 || !q->pending_.empty() || q->barrierRunning_ ||
                q->running_ >= q->width())
                break;
            ++q->running_;
            q->used_ = true;
            next = q->target_.get();  // kept alive by q, whose target is now fixed
        }
        entered[depth++] = q;
        q = next;
    }
    if (admitted) {
        for (size_t i = depth; i-- > 0;) tCurrentQueues.push_back(entered[i]);
        runWork(work, label_);
        tCurrentQueues.resize(tCurrentQueues.size() - depth);
    }
    // Innermost first, as a finished item would; pending work that arrived
    // meanwhile starts from here.
    for (size_t i = 0; i < depth; ++i) entered[i]->finishItem(false);
    return admitted;
}

void DispatchQueue::suspend() {
    if (isRoot()) return;
    MutexLock lock(mu_);
    ++suspendCount_;
}

void DispatchQueue::resume() {
    if (isRoot()) return;
    {
        MutexLock lock(mu_);
        if (suspendCount_ == 0) fatal("resume of queue \"" + label_ + "\", which is not suspended");
        if (--suspendCount_ > 0) return;
    }
    pump();
}

void DispatchQueue::setTarget(DispatchQueueRef target) {
    if (isRoot() || this == roots().main.get()) fatal("cannot retarget queue \"" + label_ + "\"");
    if (!target) target = global(QoS::Default);
    for (DispatchQueueRef q = target; q; q = q->targetOf()) {
        if (q.get() == this) {
            fatal("targeting queue \"" + label_ + "\" at \"" + target->label_ +
                  "\" would form a cycle");
        }
    }
    MutexLock lock(mu_);
    if (used_) fatal("setTarget on queue \"" + label_ + "\" after work was submitted to it");
    target_ = std::move(target);
}

bool DispatchQueue::isCurrent() const {
    return std::find(tCurrentQueues.begin(), tCurrentQueues.end(), this) != tCurrentQueues.end();
}

std::string DispatchQueue::currentLabel() {
    return tCurrentQueues.empty() ? std::string() : tCurrentQueues.back()->label_;
}

void DispatchQueue::runMain() {
    MainRunner& runner = MainRunner::instance();
    runner.mu.lock();
    if (runner.running) fatal("runMain called while another thread runs the main queue");
    runner.running = true;
    for (;;) {
        while (!runner.stopRequested && runner.jobs.empty()) runner.changed.wait(runner.mu);
        if (runner.stopRequested) break;
        std::function<void()> job = std::move(runner.jobs.front());
        runner.jobs.pop_front();
        runner.mu.unlock();
        job();
        job = nullptr;
        runner.mu.lock();
    }
    runner.stopRequested = false;
    runner.running = false;
    runner.mu.unlock();
}

void DispatchQueue::stopMain() {
    MainRunner& runner = MainRunner::instance();
    {
        MutexLock lock(runner.mu);
        runner.stopRequested = true;
    }
    runner.changed.notifyAll();
}

void Transaction::begin() {
    TransactionState& state = TransactionState::instance();
    MutexLock lock(state.mu);
    ++state.open;
}

void Transaction::end() {
    TransactionState& state = TransactionState::instance();
    bool idle;
    {
        MutexLock lock(state.mu);
        if (state.open == 0) fatal("Transaction::end without an open transaction");
        idle = --state.open == 0;
    }
    if (idle) state.idle.notifyAll();
}

uint64_t Transaction::openCount() {
    TransactionState& state = TransactionState::instance();
    MutexLock lock(state.mu);
    return state.open;
}

bool Transaction::waitForIdle(std::chrono::milliseconds bound) {
    TransactionState& state = TransactionState::instance();
    const Clock::time_point deadline = Clock::now() + bound;
    MutexLock lock(state.mu);
    while (state.open > 0) {
        if (!state.idle.waitUntil(state.mu, deadline)) return state.open == 0;
    }
    return true;
}

void transactionAsync(const DispatchQueueRef& queue, std::function<void()> work) {
    if (!work) fatal("empty work item submitted to queue \"" + queue->label() + "\"");
    Transaction::begin();
    queue->async([work = std::move(work)] {
        work();
        Transaction::end();
    });
}

}  // namespace tarn
