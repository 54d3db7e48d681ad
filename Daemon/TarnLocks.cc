#include "Daemon/TarnLocks.h"

#include <pthread.h>

#include <algorithm>
#include <atomic>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <mutex>

#include "Daemon/TarnLog.h"
#include "Platform/PlatformLog.h"

namespace tarn {

// One identifier's lock. Owned by the manager's map; lives while anyone holds
// or waits for it (refCount).
struct TarnLockRecord {
    TarnLockRecord() { (void)pthread_rwlock_init(&lock, nullptr); }  // cannot fail with null attrs
    ~TarnLockRecord() { (void)pthread_rwlock_destroy(&lock); }       // only ever destroyed unheld
    TarnLockRecord(const TarnLockRecord&) = delete;
    TarnLockRecord& operator=(const TarnLockRecord&) = delete;

    pthread_rwlock_t lock;
    uint64_t refCount = 0;              // guarded by the manager's mutex
    std::atomic<int32_t> lockState{0};  // changed only while holding `lock`

    // Open "ReadLockWithIdentifier"/"WriteLockWithIdentifier" intervals of the
    // holders. Holders add theirs after taking `lock`, outside the manager's
    // mutex, so these need a lock of their own (a leaf: nothing is taken
    // while it is held).
    std::mutex intervalMutex;
    std::vector<std::unique_ptr<SignpostInterval>> readIntervals;
    std::unique_ptr<SignpostInterval> writeInterval;
};

TarnLocks& gTarnLocks = *new TarnLocks();  // never destroyed: see the header

namespace {

// A broken invariant means the lock state can no longer be trusted; going on
// would risk two writers in one container.
[[noreturn]] void StopOnBrokenInvariant(const char* tag, const char* invariant) {
    TarnLog(kLogError, tag, "%s", invariant);
    std::fprintf(stderr, "tarnkeeperd: %s: broken invariant: %s\n", tag, invariant);
    std::abort();
}

#define TARN_LOCK_INVARIANT(tag, condition, name)               \
    do {                                                        \
        if (!(condition)) StopOnBrokenInvariant((tag), (name)); \
    } while (0)

[[noreturn]] void StopOnUnknownParameter(const char* tag) {
    TarnLog(kLogError, tag, "Unknown parameter type!");
    std::fprintf(stderr, "tarnkeeperd: %s: Unknown parameter type!\n", tag);
    std::abort();
}

// The identifiers of a string-or-array parameter. An array element that is not
// a string cannot name a lock record and is treated like a bad parameter.
std::vector<std::string> IdentifiersOf(const PlistValue& parameter, const char* tag) {
    if (const std::string* s = parameter.asString()) return {*s};
    const PlistArray* array = parameter.asArray();
    if (!array) StopOnUnknownParameter(tag);
    std::vector<std::string> identifiers;
    identifiers.reserve(array->size());
    for (const PlistValue& element : *array) {
        const std::string* s = element.asString();
        if (!s) StopOnUnknownParameter(tag);
        identifiers.push_back(*s);
    }
    return identifiers;
}

std::string Joined(const std::vector<std::string>& identifiers) {
    std::string text;
    for (const auto& identifier : identifiers) {
        if (!text.empty()) text += ",";
        text += identifier;
    }
    return text;
}

void PushInterval(TarnLockRecord* record, std::unique_ptr<SignpostInterval> interval,
                  bool writing) {
    std::lock_guard guard(record->intervalMutex);
    if (writing)
        record->writeInterval = std::move(interval);
    else
        record->readIntervals.push_back(std::move(interval));
}

std::unique_ptr<SignpostInterval> PopInterval(TarnLockRecord* record, bool writing) {
    std::lock_guard guard(record->intervalMutex);
    if (writing) return std::move(record->writeInterval);
    if (record->readIntervals.empty()) return nullptr;
    auto interval = std::move(record->readIntervals.back());
    record->readIntervals.pop_back();
    return interval;
}

}  // namespace

TarnLocks::TarnLocks() = default;
TarnLocks::~TarnLocks() = default;

// ---- Public entry points ----

void TarnLocks::read_lock_identifier(const std::string& identifier) {
    SignpostInterval waiting("locking", "WaitingForReadLockWithIdentifier", {{"uuid", identifier}});
    _lock_identifier(identifier, false);
}

void TarnLocks::read_lock_identifier(const std::vector<std::string>& identifiers) {
    SignpostInterval waiting("locking", "WaitingForReadLockWithIdentifier",
                             {{"uuid", Joined(identifiers)}});
    _lock_identifier(identifiers, false);
}

void TarnLocks::write_lock_identifier(const std::string& identifier) {
    SignpostInterval waiting("locking", "WaitingForWriteLockWithIdentifier",
                             {{"uuid", identifier}});
    _lock_identifier(identifier, true);
}

void TarnLocks::write_lock_identifier(const std::vector<std::string>& identifiers) {
    SignpostInterval waiting("locking", "WaitingForWriteLockWithIdentifier",
                             {{"uuid", Joined(identifiers)}});
    _lock_identifier(identifiers, true);
}

void TarnLocks::lockParameter(const PlistValue& parameter, bool writing) {
    std::vector<std::string> identifiers = IdentifiersOf(parameter, "_lock_identifier");
    const bool single = parameter.isString();
    if (writing && single)
        write_lock_identifier(identifiers.front());
    else if (writing)
        write_lock_identifier(identifiers);
    else if (single)
        read_lock_identifier(identifiers.front());
    else
        read_lock_identifier(identifiers);
}

void TarnLocks::unlock_identifier(const std::string& identifier) { unlock_one_lock(identifier); }

void TarnLocks::unlock_identifier(const std::vector<std::string>& identifiers) {
    std::vector<std::string> sorted = identifiers;
    std::sort(sorted.begin(), sorted.end(), std::greater<>());
    for (size_t i = 0; i < sorted.size(); ++i) {
        if (i > 0 && sorted[i] == sorted[i - 1]) continue;  // locked once, unlocked once
        unlock_one_lock(sorted[i]);
    }
}

void TarnLocks::unlockParameter(const PlistValue& parameter) {
    std::vector<std::string> identifiers = IdentifiersOf(parameter, "unlock_identifier");
    if (parameter.isString())
        unlock_identifier(identifiers.front());
    else
        unlock_identifier(identifiers);
}

void TarnLocks::read_lock_all_identifiers() {
    SignpostInterval waiting("locking", "WaitingForGlobalReadLock");
    _lock_all_identifiers(false);
}

void TarnLocks::write_lock_all_identifiers() {
    SignpostInterval waiting("locking", "WaitingForGlobalWriteLock");
    _lock_all_identifiers(true);
}

// ---- Identifier locks ----

void TarnLocks::_lock_identifier(const std::string& identifier, bool writing) {
    take_one_lock(identifier, writing);
}

void TarnLocks::_lock_identifier(const std::vector<std::string>& identifiers, bool writing) {
    // Ascending order is what keeps two multi-identifier callers from deadlocking.
    std::vector<std::string> sorted = identifiers;
    std::sort(sorted.begin(), sorted.end());
    for (size_t i = 0; i < sorted.size(); ++i) {
        if (i > 0 && sorted[i] == sorted[i - 1]) continue;  // a second lock would wait for us
        take_one_lock(sorted[i], writing);
    }
}

bool TarnLocks::_lock_noHolders() const {
    return identifierReaderCount == 0 && identifierWriterCount == 0 && allReaderWriterState == 0;
}

TarnLockRecord* TarnLocks::_lock_findRecord(const std::string& identifier) {
    if (!identifierToLockMap) return nullptr;
    auto it = identifierToLockMap->find(identifier);
    return it == identifierToLockMap->end() ? nullptr : it->second.get();
}

void TarnLocks::take_one_lock(const std::string& identifier, bool writing) {
    TarnLockRecord* record = nullptr;
    {
        MutexLock lock(mutex);
        if (writing) {
            while (allReaderWriterState != 0) identifierWritersCondition.wait(mutex);
            ++identifierWriterCount;
        } else {
            while (allReaderWriterState == -1) identifierReadersCondition.wait(mutex);
            ++identifierReaderCount;
        }
        if (!identifierToLockMap) identifierToLockMap = std::make_unique<LockMap>();
        std::unique_ptr<TarnLockRecord>& slot = (*identifierToLockMap)[identifier];
        if (!slot) slot = std::make_unique<TarnLockRecord>();
        // Counting ourselves before we wait keeps the record alive until we unlock.
        ++slot->refCount;
        record = slot.get();
    }
    TarnLog(kLogDebug, "take_one_lock", "Waiting to lock %@ for %s", identifier,
            writing ? "writing" : "reading");

    // The mutex is not held here: waiting for the record must not stop others
    // from unlocking it.
    if (writing) {
        const int rc = pthread_rwlock_wrlock(&record->lock);
        TARN_LOCK_INVARIANT("take_one_lock", rc == 0, "pthread_rwlock_wrlock(&lock->lock) == 0");
        int32_t expected = 0;
        TARN_LOCK_INVARIANT("take_one_lock",
                            record->lockState.compare_exchange_strong(expected, -1),
                            "lock->lockState == 0");
        PushInterval(record,
                     std::make_unique<SignpostInterval>(
                         "locking", "WriteLockWithIdentifier",
                         std::vector<std::pair<std::string, std::string>>{{"uuid", identifier}}),
                     true);
    } else {
        const int rc = pthread_rwlock_rdlock(&record->lock);
        TARN_LOCK_INVARIANT("take_one_lock", rc == 0, "pthread_rwlock_rdlock(&lock->lock) == 0");
        TARN_LOCK_INVARIANT("take_one_lock", record->lockState.fetch_add(1) >= 0,
                            "lock->lockState >= 0");
        PushInterval(record,
                     std::make_unique<SignpostInterval>(
                         "locking", "ReadLockWithIdentifier",
                         std::vector<std::pair<std::string, std::string>>{{"uuid", identifier}}),
                     false);
    }
    if (traceHook_) traceHook_("lock", identifier);
    TarnLog(kLogDebug, "take_one_lock", "Got lock on identifier %@", identifier);
}

void TarnLocks::unlock_one_lock(const std::string& identifier) {
    // Ended and freed after the mutex is released: both may write log lines.
    std::unique_ptr<SignpostInterval> interval;
    std::unique_ptr<TarnLockRecord> doomed;
    {
        MutexLock lock(mutex);
        TARN_LOCK_INVARIANT("unlock_one_lock", identifierToLockMap != nullptr,
                            "gTarnLocks.identifierToLockMap");
        auto it = identifierToLockMap->find(identifier);
        TARN_LOCK_INVARIANT("unlock_one_lock", it != identifierToLockMap->end(),
                            "gTarnLocks.identifierToLockMap[identifier]");
        TarnLockRecord* record = it->second.get();
        const int32_t state = record->lockState.load();
        TARN_LOCK_INVARIANT("unlock_one_lock", state != 0, "lock->lockState != 0");
        if (traceHook_) traceHook_("unlock", identifier);

        if (state > 0) {
            TARN_LOCK_INVARIANT("unlock_one_lock", identifierReaderCount > 0,
                                "gTarnLocks.identifierReaderCount > 0");
            record->lockState.fetch_sub(1);
            --identifierReaderCount;
            interval = PopInterval(record, false);
            if (_lock_noHolders()) noHoldersCondition.notifyOne();
        } else {
            TARN_LOCK_INVARIANT("unlock_one_lock", state == -1, "lock->lockState == -1");
            TARN_LOCK_INVARIANT("unlock_one_lock", identifierWriterCount > 0,
                                "gTarnLocks.identifierWriterCount > 0");
            TARN_LOCK_INVARIANT("unlock_one_lock", allReaderWriterState == 0,
                                "gTarnLocks.allReaderWriterState == 0");
            record->lockState.store(0);
            --identifierWriterCount;
            interval = PopInterval(record, true);
            if (_lock_noHolders()) noHoldersCondition.notifyOne();
            if (identifierWriterCount == 0 && allReaderWriterState != -1)
                globalReadersCondition.notifyAll();
        }

        TARN_LOCK_INVARIANT("unlock_one_lock", record->refCount > 0, "lock->refCount > 0");
        --record->refCount;
        const int rc = pthread_rwlock_unlock(&record->lock);
        TARN_LOCK_INVARIANT("unlock_one_lock", rc == 0, "pthread_rwlock_unlock(&lock->lock) == 0");
        TarnLog(kLogDebug, "unlock_one_lock", "Unlocked identifier %@", identifier);

        if (record->refCount == 0) {
            TarnLog(kLogDebug, "unlock_one_lock", "Destroying lock for identifier %@", identifier);
            doomed = std::move(it->second);
            identifierToLockMap->erase(it);
        }
    }
}

// ---- Global lock ----

void TarnLocks::_lock_all_identifiers(bool writing) {
    const char* mode = writing ? "writing" : "reading";
    TarnLog(kLogDebug, "_lock_all_identifiers", "Waiting to lock all identifiers for %s", mode);
    MutexLock lock(mutex);
    if (writing) {
        while (!_lock_noHolders()) noHoldersCondition.wait(mutex);
        allReaderWriterState = -1;
        globalWriteInterval = std::make_unique<SignpostInterval>("locking", "GlobalWriteLock");
    } else {
        while (identifierWriterCount != 0 || allReaderWriterState == -1)
            globalReadersCondition.wait(mutex);
        ++allReaderWriterState;
        // Only when someone records signposts: every look-up takes this lock.
        if (PlatformLogVerbose())
            globalReadIntervals.push_back(
                std::make_unique<SignpostInterval>("locking", "GlobalReadLock"));
    }
    TarnLog(kLogDebug, "_lock_all_identifiers", "Locked all identifiers for %s", mode);
}

void TarnLocks::unlock_all_identifiers() {
    std::unique_ptr<SignpostInterval> interval;
    {
        MutexLock lock(mutex);
        TARN_LOCK_INVARIANT("unlock_all_identifiers", allReaderWriterState != 0,
                            "gTarnLocks.allReaderWriterState != 0");
        if (allReaderWriterState > 0) {
            TARN_LOCK_INVARIANT("unlock_all_identifiers", identifierWriterCount == 0,
                                "gTarnLocks.identifierWriterCount == 0");
            --allReaderWriterState;
            if (!globalReadIntervals.empty()) {
                interval = std::move(globalReadIntervals.back());
                globalReadIntervals.pop_back();
            }
            if (allReaderWriterState == 0) identifierWritersCondition.notifyAll();
            if (_lock_noHolders()) noHoldersCondition.notifyOne();
        } else {
            TARN_LOCK_INVARIANT("unlock_all_identifiers", allReaderWriterState == -1,
                                "gTarnLocks.allReaderWriterState == -1");
            TARN_LOCK_INVARIANT("unlock_all_identifiers",
                                identifierReaderCount == 0 && identifierWriterCount == 0,
                                "gTarnLocks.identifierReaderCount == 0 && "
                                "gTarnLocks.identifierWriterCount == 0");
            allReaderWriterState = 0;
            interval = std::move(globalWriteInterval);
            noHoldersCondition.notifyOne();
            globalReadersCondition.notifyAll();
            identifierWritersCondition.notifyAll();
            identifierReadersCondition.notifyAll();
        }
    }
    TarnLog(kLogDebug, "unlock_all_identifiers", "Unlocked all identifiers");
}

// ---- Test-only ----

std::optional<int32_t> TarnLocks::TEST_lockState(const std::string& identifier) {
    MutexLock lock(mutex);
    TarnLockRecord* record = _lock_findRecord(identifier);
    if (!record) return std::nullopt;
    return record->lockState.load();
}

std::optional<uint64_t> TarnLocks::TEST_refCount(const std::string& identifier) {
    MutexLock lock(mutex);
    TarnLockRecord* record = _lock_findRecord(identifier);
    if (!record) return std::nullopt;
    return record->refCount;
}

size_t TarnLocks::TEST_recordCount() {
    MutexLock lock(mutex);
    return identifierToLockMap ? identifierToLockMap->size() : 0;
}

uint32_t TarnLocks::TEST_identifierReaderCount() {
    MutexLock lock(mutex);
    return identifierReaderCount;
}

uint32_t TarnLocks::TEST_identifierWriterCount() {
    MutexLock lock(mutex);
    return identifierWriterCount;
}

int32_t TarnLocks::TEST_allReaderWriterState() {
    MutexLock lock(mutex);
    return allReaderWriterState;
}

void TarnLocks::TEST_setTraceHook(TraceHook hook) { traceHook_ = std::move(hook); }

}  // namespace tarn
