// The identifier lock manager: per-identifier reader/writer locks (identifiers
// are container UUIDs in canonical form) and one global reader/writer lock that
// covers every identifier at once.
//
// One process-wide instance, `gTarnLocks`, created before main and never
// destroyed (threads may still wait on it while the process exits). Every
// member function is thread-safe.
//
// Compatibility (held \ wanted):
//
//                     id read (other)  id read (same)  id write (same)  global read  global write
//   identifier read   yes              yes             waits            yes          waits
//   identifier write  yes              waits           waits            waits        waits
//   global read       yes              yes             waits            yes          waits
//   global write      waits            waits           waits            waits        waits
//
// Ordering guarantees and rules for callers:
//  - An array parameter is locked in ascending order of its distinct
//    identifiers and unlocked in descending order, so two callers locking
//    overlapping arrays cannot deadlock. Pass every identifier you need in one
//    call rather than locking them one by one in your own order.
//  - Never take a global lock while holding an identifier lock, nor an
//    identifier write lock while holding a global lock: both wait for yourself.
//  - An identifier lock is released on the thread that took it (the record
//    lock is a platform reader/writer lock). Global locks may be released from
//    any thread (the test locks hold them across requests).
//  - No fairness beyond the platform's: a steady stream of identifier readers
//    can hold off a global writer, and a stream of readers of one identifier
//    can hold off its writers.
//  - Unlocking what is not locked stops the process with a message naming the
//    broken invariant; so does a parameter that is neither a string nor an
//    array of strings.
//
// Internally `mutex` guards the counts, the map and every record's refCount;
// it is never held while waiting for a record's reader/writer lock. A record's
// lockState is changed only by a holder of that record's lock.
#pragma once

#include <concepts>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <unordered_map>
#include <vector>

#include "Platform/PropertyList.h"
#include "Platform/ThreadAnnotations.h"

namespace tarn {

class SignpostInterval;
struct TarnLockRecord;

class TarnLocks {
  public:
    TarnLocks();
    ~TarnLocks();
    TarnLocks(const TarnLocks&) = delete;
    TarnLocks& operator=(const TarnLocks&) = delete;

    // Shared lock on one identifier or on each distinct identifier of an array.
    void read_lock_identifier(const std::string& identifier) EXCLUDES(mutex);
    void read_lock_identifier(const std::vector<std::string>& identifiers) EXCLUDES(mutex);
    // Exclusive lock, same parameters.
    void write_lock_identifier(const std::string& identifier) EXCLUDES(mutex);
    void write_lock_identifier(const std::vector<std::string>& identifiers) EXCLUDES(mutex);
    // Releases what the matching lock call with the same parameter took.
    void unlock_identifier(const std::string& identifier) EXCLUDES(mutex);
    void unlock_identifier(const std::vector<std::string>& identifiers) EXCLUDES(mutex);

    // A property-list parameter as it arrives in a request: a string or an
    // array of strings. Anything else is a programming error and aborts.
    template <std::same_as<PlistValue> P>
    void read_lock_identifier(const P& parameter) EXCLUDES(mutex) {
        lockParameter(parameter, false);
    }
    template <std::same_as<PlistValue> P>
    void write_lock_identifier(const P& parameter) EXCLUDES(mutex) {
        lockParameter(parameter, true);
    }
    template <std::same_as<PlistValue> P>
    void unlock_identifier(const P& parameter) EXCLUDES(mutex) {
        unlockParameter(parameter);
    }

    // Global read lock: no identifier may be write-locked while it is held.
    void read_lock_all_identifiers() EXCLUDES(mutex);
    // Global write lock: exclusive over every identifier and every other global lock.
    void write_lock_all_identifiers() EXCLUDES(mutex);
    // Releases one global lock (read or write, whichever is held).
    void unlock_all_identifiers() EXCLUDES(mutex);

    // Test-only inspection. Records: empty when the identifier has none.
    std::optional<int32_t> TEST_lockState(const std::string& identifier) EXCLUDES(mutex);
    std::optional<uint64_t> TEST_refCount(const std::string& identifier) EXCLUDES(mutex);
    size_t TEST_recordCount() EXCLUDES(mutex);
    uint32_t TEST_identifierReaderCount() EXCLUDES(mutex);
    uint32_t TEST_identifierWriterCount() EXCLUDES(mutex);
    int32_t TEST_allReaderWriterState() EXCLUDES(mutex);
    // Called with ("lock", id) once a record lock is taken and ("unlock", id)
    // before it is released. Set only while no lock operation runs.
    using TraceHook = std::function<void(const char* event, const std::string& identifier)>;
    void TEST_setTraceHook(TraceHook hook);

  private:
    using LockMap = std::unordered_map<std::string, std::unique_ptr<TarnLockRecord>>;

    void lockParameter(const PlistValue& parameter, bool writing) EXCLUDES(mutex);
    void unlockParameter(const PlistValue& parameter) EXCLUDES(mutex);
    void _lock_identifier(const std::string& identifier, bool writing) EXCLUDES(mutex);
    void _lock_identifier(const std::vector<std::string>& identifiers, bool writing)
        EXCLUDES(mutex);
    void take_one_lock(const std::string& identifier, bool writing) EXCLUDES(mutex);
    void unlock_one_lock(const std::string& identifier) EXCLUDES(mutex);
    void _lock_all_identifiers(bool writing) EXCLUDES(mutex);
    // True when nothing at all is held or being acquired.
    bool _lock_noHolders() const REQUIRES(mutex);
    TarnLockRecord* _lock_findRecord(const std::string& identifier) REQUIRES(mutex);

    // Self-synchronising.
    Mutex mutex;
    CondVar noHoldersCondition;          // global writers wait here
    CondVar globalReadersCondition;      // global readers wait here
    CondVar identifierWritersCondition;  // identifier writers wait here
    CondVar identifierReadersCondition;  // identifier readers wait here

    // Guarded by mutex. The map is made on first use and owns its records.
    std::unique_ptr<LockMap> identifierToLockMap GUARDED_BY(mutex);
    uint32_t identifierReaderCount GUARDED_BY(mutex) = 0;  // held or being acquired
    uint32_t identifierWriterCount GUARDED_BY(mutex) = 0;  // held or being acquired
    // 0 none; -1 the global write lock is held; n > 0: n global read locks held.
    int32_t allReaderWriterState GUARDED_BY(mutex) = 0;
    // Open "GlobalReadLock" intervals (one per holder) and the "GlobalWriteLock" one.
    std::vector<std::unique_ptr<SignpostInterval>> globalReadIntervals GUARDED_BY(mutex);
    std::unique_ptr<SignpostInterval> globalWriteInterval GUARDED_BY(mutex);

    // Test-only; written while no lock operation runs.
    TraceHook traceHook_;
};

// The daemon's one lock manager.
extern TarnLocks& gTarnLocks;

// One global lock of gTarnLocks, read or write, held until release() or the
// end of the scope, so that no return path or exception leaves it taken.
class TarnGlobalLockHolder {
  public:
    enum class Mode { None, Read, Write };
    explicit TarnGlobalLockHolder(Mode mode = Mode::None) {
        if (mode == Mode::Read) readLock();
        if (mode == Mode::Write) writeLock();
    }
    ~TarnGlobalLockHolder() { release(); }
    TarnGlobalLockHolder(const TarnGlobalLockHolder&) = delete;
    TarnGlobalLockHolder& operator=(const TarnGlobalLockHolder&) = delete;

    void readLock() {
        gTarnLocks.read_lock_all_identifiers();
        held_ = true;
    }
    void writeLock() {
        gTarnLocks.write_lock_all_identifiers();
        held_ = true;
    }
    void release() {
        if (held_) gTarnLocks.unlock_all_identifiers();
        held_ = false;
    }

  private:
    bool held_ = false;
};

// One identifier lock of gTarnLocks for a scope (`enabled` false: none).
// Identifier locks must be released on the taking thread, which a scope
// guarantees.
class TarnScopedIdentifierLock {
  public:
    TarnScopedIdentifierLock(std::string identifier, bool writing, bool enabled = true)
        : identifier_(std::move(identifier)), held_(enabled) {
        if (!held_) return;
        if (writing)
            gTarnLocks.write_lock_identifier(identifier_);
        else
            gTarnLocks.read_lock_identifier(identifier_);
    }
    ~TarnScopedIdentifierLock() {
        if (held_) gTarnLocks.unlock_identifier(identifier_);
    }
    TarnScopedIdentifierLock(const TarnScopedIdentifierLock&) = delete;
    TarnScopedIdentifierLock& operator=(const TarnScopedIdentifierLock&) = delete;

  private:
    const std::string identifier_;
    const bool held_;
};

}  // namespace tarn
