// Locks the compiler checks. With clang and -Wthread-safety, a member marked
// TS_GUARDED_BY(m) may only be touched with m held, a function marked
// TS_REQUIRES(m) only be called with m held, and one marked TS_EXCLUDES(m)
// only without it; other compilers ignore the marks.
//
// libstdc++'s std::mutex carries no such marks, so the library's locks are
// lumivale::Mutex (a std::mutex that the analysis knows), taken with the
// scoped MutexLock, and waited on with CondVar. Same behaviour and cost as
// std::mutex, std::unique_lock and std::condition_variable.
#pragma once

#include <chrono>
#include <condition_variable>
#include <mutex>

#if defined(__clang__)
#define TS_ATTRIBUTE(x) __attribute__((x))
#else
#define TS_ATTRIBUTE(x)
#endif

#define TS_CAPABILITY(name) TS_ATTRIBUTE(capability(name))
#define TS_SCOPED_CAPABILITY TS_ATTRIBUTE(scoped_lockable)
#define TS_GUARDED_BY(m) TS_ATTRIBUTE(guarded_by(m))
#define TS_PT_GUARDED_BY(m) TS_ATTRIBUTE(pt_guarded_by(m))
#define TS_ACQUIRED_BEFORE(...) TS_ATTRIBUTE(acquired_before(__VA_ARGS__))
#define TS_ACQUIRED_AFTER(...) TS_ATTRIBUTE(acquired_after(__VA_ARGS__))
#define TS_REQUIRES(...) TS_ATTRIBUTE(requires_capability(__VA_ARGS__))
#define TS_ACQUIRE(...) TS_ATTRIBUTE(acquire_capability(__VA_ARGS__))
#define TS_RELEASE(...) TS_ATTRIBUTE(release_capability(__VA_ARGS__))
#define TS_EXCLUDES(...) TS_ATTRIBUTE(locks_excluded(__VA_ARGS__))
#define TS_RETURN_CAPABILITY(m) TS_ATTRIBUTE(lock_returned(m))
#define TS_NO_THREAD_SAFETY_ANALYSIS TS_ATTRIBUTE(no_thread_safety_analysis)

namespace lumivale {

class TS_CAPABILITY("mutex") Mutex {
public:
    void lock() TS_ACQUIRE() { mutex.lock(); }
    void unlock() TS_RELEASE() { mutex.unlock(); }

private:
    friend class CondVar;
    std::mutex mutex;
};

// Holds mutex from construction to destruction; unlock and lock let a scope
// step out of the lock for a while (both must pair up before it ends).
class TS_SCOPED_CAPABILITY MutexLock {
public:
    explicit MutexLock(Mutex& m) TS_ACQUIRE(m) : mutex(m) { mutex.lock(); }
    ~MutexLock() TS_RELEASE() {
        if (held) mutex.unlock();
    }
    MutexLock(const MutexLock&) = delete;
    MutexLock& operator=(const MutexLock&) = delete;

    void unlock() TS_RELEASE() {
        mutex.unlock();
        held = false;
    }
    void lock() TS_ACQUIRE() {
        mutex.lock();
        held = true;
    }

private:
    Mutex& mutex;
    bool held = true;
};

// A condition variable for Mutex. The waits take the mutex held, release it
// while blocked and hold it again when they return; callers loop on their
// condition, which the analysis then checks under the lock.
class CondVar {
public:
    void wait(Mutex& m) TS_REQUIRES(m) {
        std::unique_lock<std::mutex> lock(m.mutex, std::adopt_lock);
        condition.wait(lock);
        lock.release();
    }

    // False once deadline has passed.
    template <typename Clock, typename Duration>
    bool waitUntil(Mutex& m, const std::chrono::time_point<Clock, Duration>& deadline) TS_REQUIRES(m) {
        std::unique_lock<std::mutex> lock(m.mutex, std::adopt_lock);
        const bool woken = condition.wait_until(lock, deadline) == std::cv_status::no_timeout;
        lock.release();
        return woken;
    }

    void notifyOne() noexcept { condition.notify_one(); }
    void notifyAll() noexcept { condition.notify_all(); }

private:
    std::condition_variable condition;
};

}  // namespace lumivale
