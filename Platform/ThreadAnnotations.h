// Clang thread-safety annotations and the mutex types that carry them.
//
// Every class that shares state between threads says which mutex guards which
// field (GUARDED_BY) and which functions expect a lock held (REQUIRES). Under
// clang with -Wthread-safety the compiler checks those claims; under other
// compilers the macros expand to nothing and the types behave like their std
// counterparts.
//
// Types:
//   tarn::Mutex      a non-recursive std::mutex that the analysis understands.
//   tarn::MutexLock  holds a Mutex for the enclosing scope.
//   tarn::CondVar    a condition variable waited on with a tarn::Mutex held.
//
// A CondVar wait releases the mutex while it sleeps and holds it again when it
// returns, like std::condition_variable. Prefer an explicit loop
//     while (!ready_) cv_.wait(mu_);
// over the predicate overloads: clang analyses a lambda as a separate function
// that holds no lock, so a predicate that reads guarded fields needs its own
// REQUIRES annotation (`[&]() REQUIRES(mu_) { return ready_; }`).
#pragma once

#include <chrono>
#include <condition_variable>
#include <mutex>
#include <utility>

#if defined(__clang__)
#define TARN_THREAD_ANNOTATION_(x) __attribute__((x))
#else
#define TARN_THREAD_ANNOTATION_(x)
#endif

#define CAPABILITY(x) TARN_THREAD_ANNOTATION_(capability(x))
#define SCOPED_CAPABILITY TARN_THREAD_ANNOTATION_(scoped_lockable)
#define GUARDED_BY(x) TARN_THREAD_ANNOTATION_(guarded_by(x))
#define PT_GUARDED_BY(x) TARN_THREAD_ANNOTATION_(pt_guarded_by(x))
#define ACQUIRED_BEFORE(...) TARN_THREAD_ANNOTATION_(acquired_before(__VA_ARGS__))
#define ACQUIRED_AFTER(...) TARN_THREAD_ANNOTATION_(acquired_after(__VA_ARGS__))
#define REQUIRES(...) TARN_THREAD_ANNOTATION_(requires_capability(__VA_ARGS__))
#define REQUIRES_SHARED(...) TARN_THREAD_ANNOTATION_(requires_shared_capability(__VA_ARGS__))
#define ACQUIRE(...) TARN_THREAD_ANNOTATION_(acquire_capability(__VA_ARGS__))
#define ACQUIRE_SHARED(...) TARN_THREAD_ANNOTATION_(acquire_shared_capability(__VA_ARGS__))
#define RELEASE(...) TARN_THREAD_ANNOTATION_(release_capability(__VA_ARGS__))
#define RELEASE_SHARED(...) TARN_THREAD_ANNOTATION_(release_shared_capability(__VA_ARGS__))
#define RELEASE_GENERIC(...) TARN_THREAD_ANNOTATION_(release_generic_capability(__VA_ARGS__))
#define TRY_ACQUIRE(...) TARN_THREAD_ANNOTATION_(try_acquire_capability(__VA_ARGS__))
#define TRY_ACQUIRE_SHARED(...) TARN_THREAD_ANNOTATION_(try_acquire_shared_capability(__VA_ARGS__))
#define EXCLUDES(...) TARN_THREAD_ANNOTATION_(locks_excluded(__VA_ARGS__))
#define ASSERT_CAPABILITY(x) TARN_THREAD_ANNOTATION_(assert_capability(x))
#define RETURN_CAPABILITY(x) TARN_THREAD_ANNOTATION_(lock_returned(x))
#define NO_THREAD_SAFETY_ANALYSIS TARN_THREAD_ANNOTATION_(no_thread_safety_analysis)

namespace tarn {

class CAPABILITY("mutex") Mutex {
  public:
    Mutex() = default;
    Mutex(const Mutex&) = delete;
    Mutex& operator=(const Mutex&) = delete;

    void lock() ACQUIRE() { mu_.lock(); }
    void unlock() RELEASE() { mu_.unlock(); }
    bool tryLock() TRY_ACQUIRE(true) { return mu_.try_lock(); }

    // Tells the analysis the caller holds the mutex where it cannot see that
    // (for example in a callback run under the lock). Checks nothing at run time.
    void assertHeld() const ASSERT_CAPABILITY(this) {}

    // The underlying mutex, for std:: facilities that need one. Locking it
    // directly bypasses the analysis.
    std::mutex& native() RETURN_CAPABILITY(this) { return mu_; }

  private:
    std::mutex mu_;
};

class SCOPED_CAPABILITY MutexLock {
  public:
    explicit MutexLock(Mutex& mu) ACQUIRE(mu) : mu_(mu) { mu_.lock(); }
    ~MutexLock() RELEASE() { mu_.unlock(); }
    MutexLock(const MutexLock&) = delete;
    MutexLock& operator=(const MutexLock&) = delete;

  private:
    Mutex& mu_;
};

// Waits may wake spuriously; callers re-check their condition in a loop (or use
// a predicate overload). The timed waits return false when the time ran out.
class CondVar {
  public:
    CondVar() = default;
    CondVar(const CondVar&) = delete;
    CondVar& operator=(const CondVar&) = delete;

    void wait(Mutex& mu) REQUIRES(mu) {
        std::unique_lock<std::mutex> lock(mu.native(), std::adopt_lock);
        cv_.wait(lock);
        lock.release();  // the caller still owns the mutex
    }

    // The predicate overloads are not analysed inside: the analysis cannot tie
    // a predicate's own REQUIRES to `mu`. Callers are still checked.
    template <typename Predicate>
    void wait(Mutex& mu, Predicate pred) REQUIRES(mu) NO_THREAD_SAFETY_ANALYSIS {
        while (!pred()) wait(mu);
    }

    bool waitUntil(Mutex& mu, std::chrono::steady_clock::time_point deadline) REQUIRES(mu) {
        std::unique_lock<std::mutex> lock(mu.native(), std::adopt_lock);
        const bool notified = cv_.wait_until(lock, deadline) == std::cv_status::no_timeout;
        lock.release();
        return notified;
    }

    // Returns the predicate's final value: false only when the deadline passed
    // with the predicate still false.
    template <typename Predicate>
    bool waitUntil(Mutex& mu, std::chrono::steady_clock::time_point deadline, Predicate pred)
        REQUIRES(mu) NO_THREAD_SAFETY_ANALYSIS {
        while (!pred()) {
            if (!waitUntil(mu, deadline)) return pred();
        }
        return true;
    }

    template <typename Rep, typename Period>
    bool waitFor(Mutex& mu, std::chrono::duration<Rep, Period> timeout) REQUIRES(mu) {
        return waitUntil(mu, deadlineAfter(timeout));
    }

    template <typename Rep, typename Period, typename Predicate>
    bool waitFor(Mutex& mu, std::chrono::duration<Rep, Period> timeout, Predicate pred)
        REQUIRES(mu) {
        return waitUntil(mu, deadlineAfter(timeout), std::move(pred));
    }

    void notifyOne() { cv_.notify_one(); }
    void notifyAll() { cv_.notify_all(); }

  private:
    template <typename Rep, typename Period>
    static std::chrono::steady_clock::time_point deadlineAfter(
        std::chrono::duration<Rep, Period> timeout) {
        return std::chrono::steady_clock::now() +
               std::chrono::duration_cast<std::chrono::steady_clock::duration>(timeout);
    }

    std::condition_variable cv_;
};

}  // namespace tarn
