#pragma once

#include <condition_variable>
#include <mutex>

#include "platform/foundation/ThreadAnnotations.h"

namespace cindral {

/// std::mutex with the annotations that let clang check who touches what.
class CAPABILITY("mutex") Mutex {
public:
    void lock() ACQUIRE() { mutex_.lock(); }
    void unlock() RELEASE() { mutex_.unlock(); }
    bool try_lock() TRY_ACQUIRE(true) { return mutex_.try_lock(); }  // NOLINT(readability-identifier-naming)

private:
    friend class Condition;
    std::mutex mutex_;
};

/// Holds a Mutex for a scope.
class SCOPED_CAPABILITY MutexLock {
public:
    explicit MutexLock(Mutex& mutex) ACQUIRE(mutex) : mutex_(mutex) { mutex_.lock(); }
    ~MutexLock() RELEASE() { mutex_.unlock(); }
    MutexLock(const MutexLock&) = delete;
    MutexLock& operator=(const MutexLock&) = delete;

private:
    Mutex& mutex_;
};

/// A condition that is waited for under a Mutex. Waits on the mutex itself: a condition for any kind of lock has a mutex
/// of its own besides, at which those who wake and those who are woken meet.
class Condition {
public:
    void wait(Mutex& mutex) REQUIRES(mutex) {
        Borrowed lock(mutex);
        condition_.wait(lock.lock);
    }
    /// False when the deadline passed first.
    template <typename Clock, typename Duration>
    bool waitUntil(Mutex& mutex, const std::chrono::time_point<Clock, Duration>& deadline) REQUIRES(mutex) {
        Borrowed lock(mutex);
        return condition_.wait_until(lock.lock, deadline) == std::cv_status::no_timeout;
    }
    void notifyOne() { condition_.notify_one(); }
    void notifyAll() { condition_.notify_all(); }

private:
    /// The mutex as the standard library's wait wants it: locked before and afterwards.
    struct Borrowed {
        explicit Borrowed(Mutex& mutex) : lock(mutex.mutex_, std::adopt_lock) {}
        ~Borrowed() { lock.release(); }
        Borrowed(const Borrowed&) = delete;
        Borrowed& operator=(const Borrowed&) = delete;
        std::unique_lock<std::mutex> lock;
    };

    std::condition_variable condition_;
};

}  // namespace cindral
