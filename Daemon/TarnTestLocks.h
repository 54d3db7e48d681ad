// Test locks of internal builds: numbered locks a test client takes and
// releases (command 31) to hold the daemon at chosen points.
//
//   0      the global read lock of gTarnLocks
//   1      the global write lock of gTarnLocks
//   2..6   gates: daemon code calls waitOnLock(n) there and blocks while n is held
//          (2: disk usage of a container, 6: the container cache loading or
//          building a per-user cache; 3 to 5 have no waiters)
//
// Each lock is counted; it is taken when its count goes from 0 to 1 and let go
// when it returns to 0. Every count change runs synchronously on the serial
// state queue, so changes are applied in the order callers make them and taking
// lock 0 or 1 holds up later changes until the global lock is granted.
//
// Gates: taking gate n submits a barrier to gate queue n that sleeps on
// semaphore n; waitOnLock(n) runs an empty item synchronously on that queue,
// which cannot start while the barrier is there. The gate queues are FIFO, so
// a waitOnLock() that starts after acquireLock(n) returned always waits.
//
// The daemon uses sharedInstance(), which lives for the whole process. All
// member functions are thread-safe. A lock 0 or 1 taken here is held on behalf
// of the test client across requests and released from whichever thread runs
// the state queue.
#pragma once

#include <array>
#include <atomic>
#include <cstdint>
#include <memory>
#include <semaphore>

#include "Daemon/TarnRequestContext.h"
#include "Platform/Dispatch.h"
#include "Platform/PropertyList.h"

namespace tarn {

class TarnClientConnection;

class TarnTestLocks {
  public:
    static constexpr uint64_t kLockCount = 7;

    static TarnTestLocks& sharedInstance();

    // Tests may make their own instance; locks 0 and 1 still act on gTarnLocks.
    TarnTestLocks();
    ~TarnTestLocks();
    TarnTestLocks(const TarnTestLocks&) = delete;
    TarnTestLocks& operator=(const TarnTestLocks&) = delete;

    // Lock numbers must be below kLockCount (a caller bug otherwise: aborts).
    void acquireLock(uint64_t lock);
    // Releasing a lock that is not held aborts the process (a test-harness bug).
    void releaseLock(uint64_t lock);
    void releaseAllLocks();
    // Gates 2 to 6 only. Returns at once while the feature is disabled.
    void waitOnLock(uint64_t lock);
    // Switching off releases every held lock first.
    void setEnabled(bool enabled);
    bool enabled() const { return _enabled.load(); }

    // Test-only: the count of one lock, read on the state queue.
    int64_t TEST_countForLock(uint64_t lock);

  private:
    void _stateQueue_updateCountForLock(uint64_t lock, int64_t byCount);
    void _stateQueue_acquireLock(uint64_t lock);
    void _stateQueue_releaseLock(uint64_t lock);

    // Constant after construction.
    std::array<DispatchQueueRef, kLockCount> _lockQueue;  // null for 0 and 1
    std::array<std::shared_ptr<std::counting_semaphore<>>, kLockCount>
        _lockSemaphore;  // null for 0 and 1
    DispatchQueueRef stateQueue;

    // Confined to stateQueue.
    std::array<int64_t, kLockCount> _lockCount{};

    // Self-synchronising.
    std::atomic<bool> _enabled{false};
};

// Command 31: take or release one test lock ("TestLock", "Enable"); internal
// builds only. Keeps the process-wide set of locks held through this command.
void TarnHandleTestLockCommand(const TarnRequestContext& context, const PlistValue& request,
                               PlistValue& reply, TarnClientConnection* connection,
                               uint64_t* error);

}  // namespace tarn
