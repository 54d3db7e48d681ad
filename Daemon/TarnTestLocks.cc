#include "Daemon/TarnTestLocks.h"

#include <bitset>
#include <cstdio>
#include <cstdlib>

#include "Daemon/TarnError.h"
#include "Daemon/TarnLocks.h"
#include "Daemon/TarnLog.h"
#include "Platform/HostConfiguration.h"
#include "Platform/ThreadAnnotations.h"

namespace tarn {

namespace {

constexpr const char* kLockQueueLabel = "com.ostrea.tarnkeeperd.TarnTestLocks.lockQueue";
constexpr const char* kStateQueueLabel = "com.ostrea.tarnkeeperd.TarnTestLocks.stateQueue";

bool IsGate(uint64_t lock) { return lock >= 2 && lock < TarnTestLocks::kLockCount; }

// A caller handing us a lock number we do not have is a bug in the daemon itself.
void RequireLockNumber(uint64_t lock, bool gate, const char* tag) {
    if (gate ? IsGate(lock) : lock < TarnTestLocks::kLockCount) return;
    TarnLog(kLogError, tag, "Invalid test lock: %llu", lock);
    std::fprintf(stderr, "tarnkeeperd: %s: invalid test lock %llu\n", tag,
                 static_cast<unsigned long long>(lock));
    std::abort();
}

}  // namespace

TarnTestLocks& TarnTestLocks::sharedInstance() {
    static TarnTestLocks* shared = new TarnTestLocks();  // lives for the whole process
    return *shared;
}

TarnTestLocks::TarnTestLocks() : stateQueue(DispatchQueue::createSerial(kStateQueueLabel)) {
    for (uint64_t lock = 2; lock < kLockCount; ++lock) {
        _lockQueue[lock] = DispatchQueue::createConcurrent(kLockQueueLabel);
        _lockSemaphore[lock] = std::make_shared<std::counting_semaphore<>>(0);
    }
}

TarnTestLocks::~TarnTestLocks() {
    // A held gate would keep a worker asleep forever, a held global lock every request.
    releaseAllLocks();
}

void TarnTestLocks::acquireLock(uint64_t lock) {
    RequireLockNumber(lock, false, "acquireLock");
    stateQueue->sync([&] {
        _stateQueue_updateCountForLock(lock, 1);
        TarnLog(kLogNotice, "acquireLock", "Acquired test lock: %llu; count: %ld", lock,
                _lockCount[lock]);
    });
}

void TarnTestLocks::releaseLock(uint64_t lock) {
    RequireLockNumber(lock, false, "releaseLock");
    stateQueue->sync([&] {
        _stateQueue_updateCountForLock(lock, -1);
        TarnLog(kLogNotice, "releaseLock", "Released test lock: %llu; count: %ld", lock,
                _lockCount[lock]);
    });
}

void TarnTestLocks::releaseAllLocks() {
    stateQueue->sync([&] {
        for (uint64_t lock = 0; lock < kLockCount; ++lock)
            _stateQueue_updateCountForLock(lock, -_lockCount[lock]);
        TarnLog(kLogNotice, "releaseAllLocks", "Released all test locks.");
    });
}

void TarnTestLocks::waitOnLock(uint64_t lock) {
    RequireLockNumber(lock, true, "waitOnLock");
    if (!enabled()) return;
    const std::string tag = Uuid::generate().string();
    TarnLog(kLogNotice, "waitOnLock", "[%s] Waiting on lock: %llu", tag, lock);
    // Cannot start while the gate's barrier sleeps on the queue.
    _lockQueue[lock]->sync([] {});
    TarnLog(kLogNotice, "waitOnLock", "[%s] No longer waiting on lock: %llu", tag, lock);
}

void TarnTestLocks::setEnabled(bool enabled) {
    if (enabled) {
        if (!_enabled.exchange(true))
            TarnLog(kLogNotice, "setEnabled", "Enabled test locks feature.");
        return;
    }
    if (!_enabled.load()) return;
    releaseAllLocks();
    if (_enabled.exchange(false)) TarnLog(kLogNotice, "setEnabled", "Disabled test locks feature.");
}

int64_t TarnTestLocks::TEST_countForLock(uint64_t lock) {
    RequireLockNumber(lock, false, "TEST_countForLock");
    int64_t count = 0;
    stateQueue->sync([&] { count = _lockCount[lock]; });
    return count;
}

void TarnTestLocks::_stateQueue_updateCountForLock(uint64_t lock, int64_t byCount) {
    if (byCount == 0) return;
    const int64_t oldCount = _lockCount[lock];
    const int64_t newCount = oldCount + byCount;
    if (newCount < 0) {
        TarnLog(kLogError, "updateCountForLock",
                "Unbalanced update to test lock: %llu by: %ld from: %ld", lock, byCount, oldCount);
        std::fprintf(stderr,
                     "tarnkeeperd: Unbalanced update to test lock: %llu by: %ld from: %ld\n",
                     static_cast<unsigned long long>(lock), static_cast<long>(byCount),
                     static_cast<long>(oldCount));
        std::abort();
    }
    if (oldCount == 0 && newCount > 0)
        _stateQueue_acquireLock(lock);
    else if (oldCount > 0 && newCount == 0)
        _stateQueue_releaseLock(lock);
    _lockCount[lock] = newCount;
}

void TarnTestLocks::_stateQueue_acquireLock(uint64_t lock) {
    if (lock == 0) {
        gTarnLocks.read_lock_all_identifiers();
    } else if (lock == 1) {
        gTarnLocks.write_lock_all_identifiers();
    } else {
        // The barrier owns a reference to the semaphore: it may outlive this object's
        // destructor by the moment it takes to wake up.
        std::shared_ptr<std::counting_semaphore<>> semaphore = _lockSemaphore[lock];
        _lockQueue[lock]->barrierAsync([lock, semaphore] {
            TarnLog(kLogNotice, "acquireLock", "Blocking waiters for lock: %llu", lock);
            semaphore->acquire();
            TarnLog(kLogNotice, "acquireLock", "Unblocking waiters for lock: %llu", lock);
        });
    }
}

void TarnTestLocks::_stateQueue_releaseLock(uint64_t lock) {
    if (lock <= 1)
        gTarnLocks.unlock_all_identifiers();
    else
        _lockSemaphore[lock]->release();
}

// ---- Command 31 ----

namespace {

// Serialises command 31 requests of different clients, so that the set and the
// counts of the shared test locks change together.
Mutex gTestLockCommandMutex;
// The locks held through command 31.
std::bitset<TarnTestLocks::kLockCount> gHeldTestLocks GUARDED_BY(gTestLockCommandMutex);

}  // namespace

void TarnHandleTestLockCommand(const TarnRequestContext& context, const PlistValue& request,
                               PlistValue& reply, TarnClientConnection* connection,
                               uint64_t* error) {
    if (!HostConfiguration::shared().internalBuild) {
        TarnLog(kLogError, "setTestLock", "Unsupported call to set lock!");
        return;
    }
    const PlistValue* lockValue = request.find("TestLock");
    const PlistValue* enableValue = request.find("Enable");
    const uint64_t lock = lockValue ? lockValue->asUInt64().value_or(0) : 0;
    const bool enable = enableValue ? enableValue->asBool().value_or(false) : false;

    TarnTestLocks& testLocks = TarnTestLocks::sharedInstance();
    MutexLock guard(gTestLockCommandMutex);
    if (lock == TarnTestLocks::kLockCount && !enable) {
        testLocks.setEnabled(false);
        // Disabling released every lock; a stale set would make later requests no-ops.
        gHeldTestLocks.reset();
        return;
    }
    if (lock >= TarnTestLocks::kLockCount) {
        TarnSetError(error, TarnErrorBadInput);
        return;
    }
    if (enable) {
        if (gHeldTestLocks.test(lock)) return;
        gHeldTestLocks.set(lock);
        testLocks.setEnabled(true);
        testLocks.acquireLock(lock);
        return;
    }
    if (!gHeldTestLocks.test(lock)) return;
    if (lock <= 1) {
        // One global lock at a time: either number lets go of it.
        gHeldTestLocks.reset(0);
        gHeldTestLocks.reset(1);
    } else {
        gHeldTestLocks.reset(lock);
    }
    testLocks.releaseLock(lock);
    if (gHeldTestLocks.none()) testLocks.setEnabled(false);
}

}  // namespace tarn
