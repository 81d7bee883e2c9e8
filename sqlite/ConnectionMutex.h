// Internal to the SQLite access layer: the lock that serialises every call on
// one connection. Recursive, so that a thread inside a transaction or a
// Database::ScopedLock makes its own calls without waiting for itself; and
// cheap when taken again by its owner, which is how a row's columns are read.
//
// lock and unlock as std::recursive_mutex's; ConnectionLock holds it for a
// scope, as the thread-safety analysis sees it. The owner is read without the lock: a thread only ever
// finds its own id there if it stored it itself and has not cleared it yet.
#pragma once

#include <atomic>
#include <mutex>
#include <thread>

#include "platform/ThreadAnnotations.h"

namespace lumivale {
namespace sqlite {

class TS_CAPABILITY("mutex") ConnectionMutex {
public:
    void lock() TS_ACQUIRE() {
        const std::thread::id self = std::this_thread::get_id();
        if (owner.load(std::memory_order_relaxed) == self) {
            ++depth;
            return;
        }
        mutex.lock();
        owner.store(self, std::memory_order_relaxed);
        depth = 1;
    }

    void unlock() TS_RELEASE() {
        if (--depth != 0) return;
        owner.store(std::thread::id(), std::memory_order_relaxed);
        mutex.unlock();
    }

private:
    std::mutex mutex;
    std::atomic<std::thread::id> owner{};
    int depth = 0;  // the owner's; read and written only by it
};

class TS_SCOPED_CAPABILITY ConnectionLock {
public:
    explicit ConnectionLock(ConnectionMutex& m) TS_ACQUIRE(m) : mutex(m) { mutex.lock(); }
    ~ConnectionLock() TS_RELEASE() { mutex.unlock(); }
    ConnectionLock(const ConnectionLock&) = delete;
    ConnectionLock& operator=(const ConnectionLock&) = delete;

private:
    ConnectionMutex& mutex;
};

}  // namespace sqlite
}  // namespace lumivale
